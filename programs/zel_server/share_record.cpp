#include "programs/zel_server/share_record.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <filesystem>
#include <map>
#include <sstream>
#include <string_view>
#include <utility>

#include "base/make_folder.h"
#include "base/random_digits.h"
#include "base/replace_file.h"
#include "base/section_view.h"
#include "base/text.h"
#include "base/unique_fd.h"
#include "base/whole_file.h"
#include "programs/zel_server/names.h"
#include "programs/zel_server/server_config.h"

namespace zel_server {

namespace {

namespace fs = std::filesystem;

constexpr size_t kMaxFile = 65536;
// The last line; a file without it was not completely written.
constexpr char kWhole[] = "whole";

// The keys of what a copy's folder is known by.
struct FolderFact {
    const char* key;
    std::string base::FolderIdentity::*member;
};
constexpr FolderFact kFolderFacts[] = {
    {"folder_fs", &base::FolderIdentity::file_system},
    {"folder_fsid", &base::FolderIdentity::file_system_id},
    {"folder_inode", &base::FolderIdentity::inode},
    {"folder_birth", &base::FolderIdentity::birth},
};

std::string FileOf(const std::string& share) {
    return ShareRecords() + "/" + ModuleKey(share);
}

std::string TextOf(const ShareRecord& record) {
    std::string text;
    const auto add = [&](const char* key, const std::string& value) {
        text += std::string(key) + "=\"" + value + "\"\n";
    };
    add("share", record.share);
    add("module", record.module);
    add("path", record.path);
    if (record.names_owner) {
        add("account", record.account);
        add("client", record.client);
    }
    if (!record.copy.identity.empty()) {
        add("copy", record.copy.identity);
        add("generation", std::to_string(record.copy.generation));
        add("push", record.copy.push);
        add("since", std::to_string(record.copy.since));
        for (const FolderFact& fact : kFolderFacts) {
            add(fact.key, record.copy.folder.*fact.member);
        }
    }
    add(kWhole, "yes");
    return text;
}

// An owner is an account and, once it has been pushed, a client; a client alone is damage.
bool IsOwner(const std::string& account, const std::string& client) {
    return account.empty() ? client.empty()
                           : IsAccountName(account) && (client.empty() || IsClientId(client));
}

// A copy of which not all is known counts as one without an identity: it gets a new one.
template <typename Values>
CopyState ParseCopy(Values& values) {
    CopyState copy;
    const auto generation = base::ParseNumber(values["generation"], UINT64_MAX);
    const auto since = base::ParseNumber(values["since"], INT64_MAX);
    if (!base::AreRandomDigits(values["copy"]) || !generation || !since) {
        return copy;
    }
    copy.identity = values["copy"];
    copy.generation = *generation;
    copy.push = values["push"];
    copy.since = static_cast<int64_t>(*since);
    for (const FolderFact& fact : kFolderFacts) {
        copy.folder.*fact.member = values[fact.key];
    }
    return copy;
}

std::optional<ShareRecord> ParseRecord(std::string_view text) {
    std::map<std::string_view, std::string> values;
    for (std::string_view line; base::TakeLine(text, line);) {
        if (const auto pair = base::ParseKeyLine(line)) {
            values.emplace(pair->key, pair->value);
        }
    }
    if (values.count(kWhole) == 0 || !IsShareName(values["share"])) {
        return std::nullopt;
    }
    ShareRecord record;
    record.share = values["share"];
    record.module = values["module"];
    record.path = values["path"];
    record.names_owner = values.count("account") != 0 && values.count("client") != 0 &&
                         IsOwner(values["account"], values["client"]);
    if (record.names_owner) {
        record.account = values["account"];
        record.client = values["client"];
    }
    record.copy = ParseCopy(values);
    return record;
}

std::optional<ShareRecord> ReadFileOf(const std::string& share) {
    const auto text = base::ReadFile(FileOf(share), kMaxFile);
    return text ? ParseRecord(*text) : std::nullopt;
}

// ---- The module files of earlier versions ----

constexpr char kOldSuffix[] = ".conf";

// The rest of a line that starts with `beginning`.
std::optional<std::string> Rest(const std::string& line, const std::string& beginning) {
    return line.compare(0, beginning.size(), beginning) == 0
               ? std::optional<std::string>(line.substr(beginning.size()))
               : std::nullopt;
}

// What an old module file says about its share. A damaged file yields the name alone.
ShareRecord ReadOldModule(const std::string& share) {
    const auto text = base::ReadFile(OldShareModules() + "/" + share + kOldSuffix, kMaxFile);
    ShareRecord read;
    std::optional<std::string> account;
    std::optional<std::string> client;
    std::istringstream lines(text.value_or(""));
    for (std::string line; std::getline(lines, line);) {
        if (const auto named = Rest(line, "# account = ")) {
            account = named;
        } else if (const auto behind = Rest(line, "# client = ")) {
            client = behind;
        } else if (const auto folder = Rest(line, "    path = ")) {
            read.path = *folder;
        } else if (line.size() > 2 && line.front() == '[' && line.back() == ']') {
            read.module = line.substr(1, line.size() - 2);
        }
    }
    if (ShareOfModule(read.module) != share || read.path.empty()) {
        read = ShareRecord();
        account.reset();
    }
    read.share = share;
    read.names_owner = account && client && IsOwner(*account, *client);
    if (read.names_owner) {
        read.account = *account;
        read.client = *client;
    }
    return read;
}

std::vector<std::string> SharesOfOldModules() {
    std::vector<std::string> shares;
    std::error_code error;
    for (fs::directory_iterator entry(OldShareModules(), error), end; !error && entry != end;
         entry.increment(error)) {
        const fs::path name = entry->path().filename();
        if (name.extension() == kOldSuffix && IsShareName(name.stem())) {
            shares.push_back(name.stem());
        }
    }
    return shares;
}

// Without fsync: FlushRecords() does that once for all records.
bool WritePlain(const ShareRecord& record) {
    const base::UniqueFd file(
        open(FileOf(record.share).c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600));
    return file && base::WriteAll(file.Get(), TextOf(record));
}

bool FlushRecords() {
    const base::UniqueFd folder(open(ShareRecords().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    return folder && syncfs(folder.Get()) == 0;
}

bool MakeRecordFolder() {
    return base::MakeFolder(ShareRecords(), 0700);
}

}  // namespace

bool WriteShareRecord(const std::string& share, const ShareState& state, const CopyState& copy) {
    const std::string text =
        TextOf({share, state.module, state.path, true, state.account, state.Owner(), copy});
    return base::ReadFile(FileOf(share), kMaxFile) == text ||
           (MakeRecordFolder() && base::ReplaceFile(FileOf(share), text, 0600));
}

bool HasShareRecord(const std::string& share) {
    struct stat info = {};
    if (lstat(FileOf(share).c_str(), &info) != 0) {
        // An unreadable file does not count as missing: an existing share could seem to be new.
        return errno != ENOENT && errno != ENOTDIR;
    }
    return !IsNameOfAnother(share);
}

std::optional<ShareRecord> ReadShareRecord(const std::string& share) {
    auto record = ReadFileOf(share);
    return record && record->share == share ? std::move(record) : std::nullopt;
}

CopyState RecordedCopy(const std::string& share) {
    auto record = ReadShareRecord(share);
    return record ? std::move(record->copy) : CopyState();
}

bool IsNameOfAnother(const std::string& share) {
    const auto record = ReadFileOf(share);
    return record && record->share != share;
}

std::optional<std::vector<std::string>> RecordedShares() {
    std::vector<std::string> shares;
    std::error_code error;
    for (fs::directory_iterator entry(ShareRecords(), error), end; !error && entry != end;
         entry.increment(error)) {
        const std::string name = entry->path().filename();
        if (IsShareName(name)) {  // skips temporary files
            const auto record = ReadFileOf(name);
            shares.push_back(record ? record->share : name);
        }
    }
    if (error && error != std::errc::no_such_file_or_directory) {
        return std::nullopt;
    }
    std::sort(shares.begin(), shares.end());
    return shares;
}

bool TakeOverOldModules() {
    const std::vector<std::string> shares = SharesOfOldModules();
    if (shares.empty()) {
        return true;
    }
    if (!MakeRecordFolder()) {
        return false;
    }
    for (const std::string& share : shares) {
        // An intact record is more recent than the old module file.
        if (!ReadFileOf(share) && !WritePlain(ReadOldModule(share))) {
            return false;
        }
    }
    if (!FlushRecords()) {
        return false;
    }
    for (const std::string& share : shares) {
        if (ReadShareRecord(share)) {  // not the record of another share with an equivalent name
            unlink((OldShareModules() + "/" + share + kOldSuffix).c_str());
        }
    }
    return true;
}

}  // namespace zel_server
