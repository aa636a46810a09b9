#include <tarq/core.h>
#include <tarq/root_path.h>
#include <tarq/sdk.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cstring>
#include <string>

#include "platform/internal/config.h"
#include "platform/internal/error.h"
#include "platform/tarqsdk/identity.h"

namespace {

using tarq_internal::CopyOut;
using tarq_internal::Fail;
using tarq_internal::Guarded;
using tarq_internal::ReadResult;
using tarq_internal::ReadValue;

constexpr char kConfiguration[] = "/usr/tarq/etc/tarqsdk.conf";
constexpr char kSection[] = "device";
constexpr int kHostnameSize = 64;

bool IsHostname(const std::string& name) {
    return !name.empty() && std::none_of(name.begin(), name.end(), [](char c) {
        return static_cast<unsigned char>(c) < ' ' || c == '\x7f' || c == '"' || c == '\'';
    });
}

int SerialNumber(std::string* serial) {
    switch (ReadValue(TARQ::RootPath(kConfiguration), kSection, "serial", serial)) {
        case ReadResult::kFailed:
            return -1;
        case ReadResult::kFound:
            return tarq_sdk::IsCleanSerial(*serial) ? 0 : Fail(TARQ_ERR_BAD_PARAMETER);
        case ReadResult::kAbsent:
            break;
    }
    return tarq_sdk::HardwareSerial("/sys", serial) ? 0 : Fail(TARQ_ERR_OPEN_FILE);
}

}  // namespace

int KAPIGetSerialNumber(char* buffer, int size) {
    return Guarded(-1, [&] {
        if (!CopyOut("", buffer, size)) {
            return Fail(TARQ_ERR_BAD_PARAMETER);
        }
        std::string serial;
        if (SerialNumber(&serial) < 0) {
            return -1;
        }
        return CopyOut(tarq_sdk::CompactSerial(serial), buffer, size)
                   ? 0
                   : Fail(TARQ_ERR_BAD_PARAMETER);
    });
}

int TARQLnxGetHostname(char* buffer) {
    return Guarded(-1, [&] {
        if (!CopyOut("", buffer, kHostnameSize)) {
            return Fail(TARQ_ERR_BAD_PARAMETER);
        }
        std::string name;
        const ReadResult configured =
            ReadValue(TARQ::RootPath(kConfiguration), kSection, "hostname", &name);
        if (configured == ReadResult::kFailed) {
            return -1;
        }
        if (configured == ReadResult::kAbsent) {
            // The kernel's names have up to 64 bytes: one more than the caller's buffer takes
            // beside the terminator.
            std::array<char, kHostnameSize + 1> text{};
            if (gethostname(text.data(), text.size()) != 0) {
                return Fail(TARQ_ERR_READ_FILE);
            }
            name = text.data();
        }
        if (!IsHostname(name)) {
            return Fail(TARQ_ERR_BAD_PARAMETER);
        }
        CopyOut(name.substr(0, kHostnameSize - 1), buffer, kHostnameSize);
        return 0;
    });
}
