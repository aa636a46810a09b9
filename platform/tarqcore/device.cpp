#include <string.h>

#include <string>

#include "platform/internal/error.h"
#include "tarq/root_path.h"

int KAPICIsMiniUnit(void) {
    return tarq_internal::Guarded(0, [] {
        char value[sizeof "yes" + 1] = "";  // room for one more: "yesterday" is not cut to "yes"
        const std::string path = TARQ::RootPath("/usr/tarq/etc/tarqcore.conf");
        const int before = KAPICErrGet();
        if (KAPICFileGetSectionValue(path.c_str(), "device", "mini_unit", value, sizeof value) !=
            0) {
            KAPICErrSetEx(before, __FILE__, __LINE__);  // a missing configuration is not a failure
        }
        return strcmp(value, "yes") == 0 ? 1 : 0;
    });
}
