#include "platform/tarqshare/catalogue.h"

#include <strings.h>
#include <syslog.h>
#include <tarq/core.h>
#include <tarq/owners.h>
#include <tarq/root_path.h>
#include <tarq/share.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <charconv>
#include <chrono>
#include <cstdio>

#include "base/utf8.h"
#include "platform/internal/config.h"
#include "platform/internal/error.h"

namespace tarq_share {
namespace {

using tarq_internal::ReadResult;
using tarq_internal::ReadSection;
using tarq_internal::Section;
using tarq_internal::ValueOf;

constexpr char kCatalogue[] = "/usr/tarq/etc/tarqshare.conf";
constexpr char kLockFile[] = "/usr/tarq/etc/tarqshare.conf.lock";
constexpr std::chrono::seconds kLongestWait(20);  // writers hold it for milliseconds
constexpr char kKeyFolder[] = "/usr/tarq/etc/.encrypt/";

constexpr size_t kMaxNameBytes = 80;

// Names of rsync's own among its modules: the general part of its configuration, and the module for
// commands.
constexpr const char* kReservedNames[] = {"global", "zel_command"};

struct FlagName {
    const char* name;
    unsigned int bit;
};
constexpr FlagName kFlagNames[] = {
    {"encrypted", TARQ_SHARE_ENCRYPTED},
    {"auto_mount", TARQ_SHARE_AUTO_MOUNT},
    {"acl", TARQ_SHARE_ACL},
    {"windows", TARQ_SHARE_WINDOWS},
    {"cluster", TARQ_SHARE_CLUSTER},
};

std::nullopt_t Nothing(int code, int line = __builtin_LINE()) {
    tarq_internal::Fail(code, line);
    return std::nullopt;
}

bool Refuse(int code, int line = __builtin_LINE()) {
    Nothing(code, line);
    return false;
}

std::string CataloguePath() {
    return TARQ::RootPath(kCatalogue);
}

template <typename Integer>
bool ParseWhole(const std::string& text, int base, Integer* number) {
    const char* end = text.data() + text.size();
    const auto [stop, error] = std::from_chars(text.data(), end, *number, base);
    return error == std::errc() && stop == end;
}

std::optional<unsigned int> ParseFlag(const std::string& word) {
    for (const FlagName& flag : kFlagNames) {
        if (word == flag.name) {
            return flag.bit;
        }
    }
    const bool hexadecimal = word.compare(0, 2, "0x") == 0;
    unsigned int number = 0;
    if (!ParseWhole(hexadecimal ? word.substr(2) : word, hexadecimal ? 16 : 10, &number)) {
        return std::nullopt;
    }
    return number;
}

/// Sets the hash's values. False with the error code set.
bool SetAll(KAPICSzHash hash, const std::vector<std::pair<const char*, std::string>>& values) {
    return std::all_of(values.begin(), values.end(), [hash](const auto& value) {
        return KAPICSzHashSetValue(hash, value.first, value.second.c_str()) == 0;
    });
}

std::string Or(const std::string& value, const std::string& otherwise) {
    return value.empty() ? otherwise : value;
}

bool IsAbsoluteOrEmpty(const std::string& path) {
    return path.empty() || path.front() == '/';
}

}  // namespace

bool Share::IsEncrypted() const {
    return (flags & TARQ_SHARE_ENCRYPTED) != 0;
}

std::vector<std::pair<const char*, std::string>> FactsOf(const Share& share) {
    return {
        {"volume", share.volume.mount_point},
        {"volume_fs", share.volume.file_system},
        {"volume_uuid", share.volume.uuid},
        {"folder_fs", share.identity.file_system},
        {"folder_fsid", share.identity.file_system_id},
        {"folder_inode", share.identity.inode},
        {"folder_birth", share.identity.birth},
    };
}

bool AddFacts(const Share& share, KAPICSzHash into) {
    return SetAll(into, FactsOf(share));
}

bool IsShareName(const std::string& name) {
    if (name.empty() || name.size() > kMaxNameBytes || !base::IsUtf8(name) || name.front() == '.' ||
        name.front() == '@' || name.front() == ' ' || name.back() == ' ' ||
        name.find("  ") != std::string::npos) {
        return false;
    }
    for (const char* reserved : kReservedNames) {
        if (strcasecmp(name.c_str(), reserved) == 0) {
            return false;
        }
    }
    static const std::string forbidden("/:\"\\[]*?");
    return std::none_of(name.begin(), name.end(), [](char c) {
        return (c >= '\0' && c < ' ') || c == '\x7f' || forbidden.find(c) != std::string::npos;
    });
}

std::optional<unsigned int> ParseFlags(const std::string& text) {
    static const char separators[] = " ,|";
    unsigned int flags = 0;
    for (size_t begin = text.find_first_not_of(separators); begin != std::string::npos;) {
        const size_t end = std::min(text.find_first_of(separators, begin), text.size());
        const std::optional<unsigned int> flag = ParseFlag(text.substr(begin, end - begin));
        if (!flag) {
            return std::nullopt;
        }
        flags |= *flag;
        begin = text.find_first_not_of(separators, end);
    }
    return flags;
}

std::string FormatFlags(unsigned int flags) {
    std::string text;
    const auto append = [&text](const std::string& word) {
        text += (text.empty() ? "" : "|") + word;
    };
    for (const FlagName& flag : kFlagNames) {
        if ((flags & flag.bit) != 0) {
            append(flag.name);
            flags &= ~flag.bit;
        }
    }
    if (flags != 0) {
        std::array<char, 16> number;
        snprintf(number.data(), number.size(), "0x%x", flags);
        append(number.data());
    }
    return text;
}

std::string DefaultEncryptedPath(const std::string& path) {
    const size_t name = path.rfind('/') + 1;
    return path.substr(0, name) + "@" + path.substr(name) + "@";
}

std::optional<Share> ReadShare(const std::string& name) {
    Section section;
    switch (ReadSection(CataloguePath(), name, &section)) {
        case ReadResult::kFailed:
            return std::nullopt;
        case ReadResult::kAbsent:
            return Nothing(TARQ_ERR_NO_SHARE);
        case ReadResult::kFound:
            break;
    }
    Share share;
    share.name = name;
    share.path = ValueOf(section, "path");
    while (share.path.size() > 1 && share.path.back() == '/') {
        share.path.pop_back();
    }
    const std::optional<unsigned int> flags = ParseFlags(ValueOf(section, "flags"));
    const std::string key_length = ValueOf(section, "key_length");
    if (!flags || (!key_length.empty() && !ParseWhole(key_length, 10, &share.key_length)) ||
        share.key_length < 0 || !IsAbsoluteOrEmpty(share.path)) {
        return Nothing(TARQ_ERR_BAD_PARAMETER);
    }
    share.flags = *flags;
    if (share.IsEncrypted() && !share.path.empty()) {
        share.encrypted_path =
            Or(ValueOf(section, "encrypted_path"), DefaultEncryptedPath(share.path));
    }
    const std::string keys = TARQ::RootPath(kKeyFolder);
    share.auto_key_file = Or(ValueOf(section, "auto_key_file"), keys + name);
    // No share's name begins with "@": another share's key for start-up is never at this place.
    share.key_file = Or(ValueOf(section, "key_file"), keys + "@" + name);
    if (!IsAbsoluteOrEmpty(share.encrypted_path) || share.auto_key_file.front() != '/' ||
        share.key_file.front() != '/') {
        return Nothing(TARQ_ERR_BAD_PARAMETER);
    }
    share.volume = {ValueOf(section, "volume"), ValueOf(section, "volume_fs"),
                    ValueOf(section, "volume_uuid"), TARQ_VOLUME_UNKNOWN};
    share.identity = {ValueOf(section, "folder_fs"), ValueOf(section, "folder_fsid"),
                      ValueOf(section, "folder_inode"), ValueOf(section, "folder_birth")};
    return share;
}

std::optional<std::vector<std::string>> ReadShareNames() {
    const std::string path = CataloguePath();
    if (KAPICFileExist(path.c_str()) == 0) {
        return std::vector<std::string>();
    }
    const TARQ::ListOwner list(KAPICSzListAlloc(0));
    if (!list || KAPICFileEnumSection(path.c_str(), list.get()) < 0) {
        return std::nullopt;
    }
    return TARQ::Entries(list);
}

bool WriteShare(const Share& share) {
    const TARQ::HashOwner values(KAPICSzHashAlloc(0));
    return values &&
           SetAll(values.get(), {{"path", share.path}, {"flags", FormatFlags(share.flags)}}) &&
           AddFacts(share, values.get()) &&
           KAPICFileAddSection(CataloguePath().c_str(), share.name.c_str(), values.get(),
                               nullptr) >= 1;
}

bool WriteFacts(const Share& share) {
    const TARQ::HashOwner values(KAPICSzHashAlloc(0));
    if (!values || !AddFacts(share, values.get())) {
        return false;
    }
    const int result =
        KAPICIFileModifySection(CataloguePath().c_str(), share.name.c_str(), 0, values.get(), 1, 0);
    return result > 0 || (result == 0 && Refuse(TARQ_ERR_NO_SHARE));
}

bool EraseShare(const std::string& name) {
    const std::string path = CataloguePath();
    const int result =
        KAPICFileExist(path.c_str()) == 0 ? 0 : KAPICFileRemoveSection(path.c_str(), name.c_str());
    return result > 0 || (result == 0 && Refuse(TARQ_ERR_NO_SHARE));
}

CatalogueLock::CatalogueLock(Patience patience)
    // Beside the catalogue, which every write replaces by another file.
    : lock_(TARQ::RootPath(kLockFile),
            patience == Patience::kWait ? kLongestWait : std::chrono::seconds(0)) {
    if (!lock_) {
        const int reason = errno;
        if (patience == Patience::kWait) {
            syslog(LOG_ERR, "tarqshare: %s", lock_.Problem().c_str());
        }
        errno = reason;
        Refuse(reason == EWOULDBLOCK ? TARQ_ERR_SEMAPHORE : TARQ_ERR_OPEN_FILE);
    }
}

}  // namespace tarq_share
