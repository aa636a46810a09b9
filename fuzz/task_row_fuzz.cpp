// A row of the daemon's list, as any bytes: refused, or one that is packed as it was unpacked.
#include <cstdint>
#include <cstdlib>

#include "programs/common/task_row.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    programs::TaskRow row;
    if (!programs::UnpackTaskRow({reinterpret_cast<const char*>(data), size}, row)) {
        return 0;
    }
    const std::string packed = programs::PackTaskRow(row);
    programs::TaskRow again;
    if (packed.size() > 65535 || !programs::UnpackTaskRow(packed, again) ||
        programs::PackTaskRow(again) != packed) {
        abort();
    }
    return 0;
}
