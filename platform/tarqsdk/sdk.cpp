#include <tarq/core.h>
#include <tarq/root_path.h>
#include <tarq/sdk.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cstring>
#include <string>

#include "platform/internal/config.h"
#include "platform/tarqsdk/identity.h"

namespace {

using tarq_internal::CopyOut;
using tarq_internal::ReadResult;
using tarq_internal::ReadValue;

constexpr char kSource[] = "tarq/sdk";
constexpr char kConfiguration[] = "/usr/tarq/etc/tarqsdk.conf";
constexpr char kSection[] = "device";
constexpr int kHostnameSize = 64;

int Fail(int code, int line) {
    KAPICErrSetEx(code, kSource, line);
    return -1;
}

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
            return tarq_sdk::IsCleanSerial(*serial) ? 0 : Fail(TARQ_ERR_BAD_PARAMETER, __LINE__);
        case ReadResult::kAbsent:
            break;
    }
    return tarq_sdk::HardwareSerial("/sys", serial) ? 0 : Fail(TARQ_ERR_OPEN_FILE, __LINE__);
}

}  // namespace

int KAPIGetSerialNumber(char* buffer, int size) {
    if (!CopyOut("", buffer, size)) {
        return Fail(TARQ_ERR_BAD_PARAMETER, __LINE__);
    }
    std::string serial;
    if (SerialNumber(&serial) < 0) {
        return -1;
    }
    return CopyOut(tarq_sdk::CompactSerial(serial), buffer, size)
               ? 0
               : Fail(TARQ_ERR_BAD_PARAMETER, __LINE__);
}

int TARQLnxGetHostname(char* buffer) {
    if (!CopyOut("", buffer, kHostnameSize)) {
        return Fail(TARQ_ERR_BAD_PARAMETER, __LINE__);
    }
    std::string name;
    const ReadResult configured =
        ReadValue(TARQ::RootPath(kConfiguration), kSection, "hostname", &name);
    if (configured == ReadResult::kFailed) {
        return -1;
    }
    if (configured == ReadResult::kAbsent) {
        // The kernel's names have up to 64 bytes: one more than the caller's buffer takes beside
        // the terminator.
        std::array<char, kHostnameSize + 1> text{};
        if (gethostname(text.data(), text.size() - 1) != 0) {
            return Fail(TARQ_ERR_READ_FILE, __LINE__);
        }
        name = text.data();
    }
    if (!IsHostname(name)) {
        return Fail(TARQ_ERR_BAD_PARAMETER, __LINE__);
    }
    CopyOut(name.substr(0, kHostnameSize - 1), buffer, kHostnameSize);
    return 0;
}
