#include "platform/tarqsdk/identity.h"

#include <inttypes.h>
#include <stdio.h>
#include <tarq/sdk.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdint>
#include <optional>

#include "base/text.h"
#include "base/whole_file.h"

namespace tarq_sdk {
namespace {

// The board's number comes second: it changes when the mainboard is replaced, that of the case does
// not.
constexpr const char* kSources[] = {
    "/class/dmi/id/product_serial",
    "/class/dmi/id/board_serial",
    "/firmware/devicetree/base/serial-number",
};

// Lower case, letters and digits alone: makers differ in dots, blanks and dashes.
constexpr const char* kPlaceholders[] = {
    "asset",
    "assetserialnumber",
    "baseboardserialnumber",
    "boardserialnumber",
    "chassisserialnumber",
    "default",
    "defaultstring",
    "empty",
    "invalid",
    "na",
    "noasset",
    "noassettag",
    "none",
    "noserial",
    "noserialnumber",
    "notapplicable",
    "notavailable",
    "notset",
    "notspecified",
    "null",
    "oem",
    "productserial",
    "serial",
    "serialnumber",
    "serialnum",
    "sernum",
    "sn",
    "standard",
    "systemserial",
    "systemserialnumber",
    "tobefilled",
    "tobefilledbyoem",
    "tobefilledbyoemserialnumber",
    "unavailable",
    "undefined",
    "unknown",
    "unset",
    "unspecified",
    "0123456789",
    "01234567",
    "123456789",
    "1234567890",
    "12345678",
    "1234567",
    "123456",
    "12345",
    "1234",
    "0123456789abcdef",
    "123456789abcdef",
};

constexpr size_t kPrefixBytes = 18;  // with "~" and 16 digits: TARQ_SERIAL_NUMBER_MAX

uint64_t Fnv1a(const std::string& text) {
    uint64_t hash = 14695981039346656037U;
    for (const char c : text) {
        hash = (hash ^ static_cast<unsigned char>(c)) * 1099511628211U;
    }
    return hash;
}

}  // namespace

bool IsCleanSerial(const std::string& text) {
    const auto allowed = [](char c) {
        return c >= ' ' && c <= '~' && c != '"' && c != '\'' && c != '`' && c != '\\';
    };
    return !text.empty() && text.front() != ' ' && text.back() != ' ' &&
           std::all_of(text.begin(), text.end(), allowed);
}

bool IsPlaceholder(const std::string& text) {
    std::string letters;
    for (const char c : text) {
        if (base::IsLetterOrDigit(c)) {
            letters += base::Lower(c);
        }
    }
    if (letters.find_first_not_of(letters.substr(0, 1)) == std::string::npos) {
        return true;
    }
    return std::any_of(std::begin(kPlaceholders), std::end(kPlaceholders),
                       [&](const char* placeholder) { return letters == placeholder; });
}

std::string CompactSerial(const std::string& serial) {
    if (serial.size() <= TARQ_SERIAL_NUMBER_MAX) {
        return serial;
    }
    std::array<char, 20> hash;
    snprintf(hash.data(), hash.size(), "~%016" PRIx64, Fnv1a(serial));
    return serial.substr(0, kPrefixBytes) + hash.data();
}

bool HardwareSerial(const std::string& sys, std::string* serial) {
    serial->clear();
    for (const char* source : kSources) {
        const std::optional<std::string> text = base::ReadFile(sys + source);
        if (!text) {
            if (errno == ENOENT || errno == ENOTDIR || errno == ENODEV) {
                continue;
            }
            return false;
        }
        const std::string candidate(base::Trimmed(*text));
        if (IsCleanSerial(candidate) && !IsPlaceholder(candidate)) {
            *serial = candidate;
            return true;
        }
    }
    return true;
}

}  // namespace tarq_sdk
