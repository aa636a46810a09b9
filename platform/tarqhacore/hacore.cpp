#include <tarq/core.h>
#include <tarq/hacore.h>
#include <tarq/root_path.h>

#include <string>

#include "base/text.h"
#include "platform/internal/config.h"
#include "platform/internal/error.h"

namespace {

using tarq_internal::CopyOut;
using tarq_internal::Fail;
using tarq_internal::Guarded;
using tarq_internal::ReadResult;
using tarq_internal::ReadSection;
using tarq_internal::Section;
using tarq_internal::ValueOf;

constexpr char kConfiguration[] = "/usr/tarq/etc/tarqha.conf";
constexpr char kSection[] = "pair";
constexpr size_t kMacBytes = 6;
constexpr size_t kMacText = 3 * kMacBytes - 1;

ReadResult ReadPair(Section* pair) {
    return ReadSection(TARQ::RootPath(kConfiguration), kSection, pair);
}

/// `text` in lower case with colons; empty when it is no address of one station (a group's, or all
/// zeros).
std::string NormalMac(const std::string& text) {
    if (text.size() != kMacText) {
        return {};
    }
    std::string mac;
    const std::string digits = "0123456789abcdef";
    bool zero = true;
    for (size_t i = 0; i < text.size(); ++i) {
        if (i % 3 == 2) {
            if (text[i] != ':' && text[i] != '-') {
                return {};
            }
            mac += ':';
            continue;
        }
        const char digit = base::Lower(text[i]);
        const size_t value = digits.find(digit);
        if (value == std::string::npos || (i == 1 && value % 2 == 1)) {
            return {};
        }
        zero = zero && value == 0;
        mac += digit;
    }
    return zero ? std::string() : mac;
}

}  // namespace

int TARQHAIsRunning(void) {
    return Guarded(0, [&] {
        Section pair;
        return ReadPair(&pair) == ReadResult::kFound && ValueOf(pair, "running") == "yes" ? 1 : 0;
    });
}

int TARQHAGetMac(int index, char* buffer, int size) {
    return Guarded(-1, [&] {
        if (!CopyOut("", buffer, size) || index < 0) {
            return Fail(TARQ_ERR_BAD_PARAMETER);
        }
        Section pair;
        switch (ReadPair(&pair)) {
            case ReadResult::kFailed:
                return -1;
            case ReadResult::kAbsent:
                return Fail(TARQ_ERR_NO_SECTION);
            case ReadResult::kFound:
                break;
        }
        const auto configured = pair.find("mac" + std::to_string(index));
        if (configured == pair.end()) {
            return Fail(TARQ_ERR_NO_KEY);
        }
        const std::string mac = NormalMac(configured->second);
        return !mac.empty() && CopyOut(mac, buffer, size) ? 0 : Fail(TARQ_ERR_BAD_PARAMETER);
    });
}
