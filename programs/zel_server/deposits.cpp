#include "programs/zel_server/deposits.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <ctime>
#include <filesystem>
#include <string_view>
#include <system_error>

#include "base/make_folder.h"
#include "base/percent.h"
#include "base/replace_file.h"
#include "base/section_view.h"
#include "base/text.h"
#include "base/unique_fd.h"
#include "base/utf8.h"
#include "base/whole_file.h"
#include "programs/common/server_status.h"
#include "programs/zel_server/names.h"
#include "programs/zel_server/server_config.h"

namespace zel_server {

namespace {

namespace fs = std::filesystem;
using base::UniqueFd;

constexpr size_t kYoungestKept = 3;
constexpr size_t kDaysKept = 3;
constexpr int64_t kSecondsOfADay = 86400;
// In front of the text: two lines of names, and an empty line.
constexpr size_t kMaxHead = 512;
constexpr std::string_view kEndOfHead = "\n\n";
constexpr char kPartial[] = ".part-";

std::string FolderOf(const std::string& account) {
    return DepositFolder() + "/" + account;
}

// An identity may be "..", or anything else that a file cannot be called.
std::string FolderOf(const std::string& account, const std::string& client) {
    return FolderOf(account) + "/" + base::PercentEncoded(client, "-_");
}

std::string FileOf(const std::string& account, const std::string& client, int64_t time) {
    return FolderOf(account, client) + "/" + std::to_string(time);
}

std::vector<fs::path> EntriesOf(const std::string& folder) {
    std::vector<fs::path> entries;
    std::error_code error;
    for (fs::directory_iterator entry(folder, error), end; !error && entry != end;
         entry.increment(error)) {
        entries.push_back(entry->path());
    }
    return entries;
}

std::string HeadOf(const Deposit& deposit) {
    return "server=\"" + deposit.server + "\"\nname=\"" + deposit.name + "\"\n\n";
}

// What the file says of itself, but for its client. Nothing for what is no deposit.
std::optional<Deposit> LookAt(const fs::path& path) {
    const auto time = base::ParseNumber(path.filename().string(), INT64_MAX);
    const UniqueFd file(time ? open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW) : -1);
    struct stat facts = {};
    if (!file || fstat(file.Get(), &facts) != 0) {
        return std::nullopt;
    }
    std::string head(kMaxHead, '\0');
    const ssize_t length = pread(file.Get(), head.data(), head.size(), 0);
    head.resize(length > 0 ? static_cast<size_t>(length) : 0);
    const size_t end = head.find(kEndOfHead);
    if (end == std::string::npos) {
        return std::nullopt;
    }
    Deposit deposit;
    deposit.time = static_cast<int64_t>(*time);
    deposit.bytes = static_cast<uint64_t>(facts.st_size) - end - kEndOfHead.size();
    std::string_view lines = std::string_view(head).substr(0, end);
    for (std::string_view line; base::TakeLine(lines, line);) {
        const auto pair = base::ParseKeyLine(line);
        if (pair && pair->key == "server") {
            deposit.server = pair->value;
        } else if (pair && pair->key == "name") {
            deposit.name = pair->value;
        }
    }
    return deposit;
}

// Of one client, the youngest first.
std::vector<Deposit> DepositsOf(const std::string& account, const std::string& client) {
    std::vector<Deposit> deposits;
    for (const fs::path& path : EntriesOf(FolderOf(account, client))) {
        if (auto deposit = LookAt(path)) {
            deposit->client = client;
            deposits.push_back(*std::move(deposit));
        }
    }
    std::sort(deposits.begin(), deposits.end(),
              [](const Deposit& a, const Deposit& b) { return a.time > b.time; });
    return deposits;
}

void Thin(const std::string& account, const std::string& client) {
    const std::vector<Deposit> deposits = DepositsOf(account, client);
    size_t days = 0;
    for (size_t i = kYoungestKept; i < deposits.size(); ++i) {
        const bool first_of_day =
            i + 1 == deposits.size() ||
            deposits[i + 1].time / kSecondsOfADay != deposits[i].time / kSecondsOfADay;
        if (!first_of_day || days++ >= kDaysKept) {
            unlink(FileOf(account, client, deposits[i].time).c_str());
        }
    }
}

// What came is whole: a text of its own, or one that is there already.
int Keep(const std::string& account, Deposit deposit, const std::string& text) {
    if (!base::IsUtf8(text) || text.find('\0') != std::string::npos) {
        return programs::kBadArgument;
    }
    const std::vector<Deposit> before = DepositsOf(account, deposit.client);
    const auto same = std::find_if(before.begin(), before.end(), [&](const Deposit& other) {
        return other.bytes == text.size() &&
               ReadDeposit(account, deposit.client, other.time) == text;
    });
    deposit.time = time(nullptr);
    if (!before.empty()) {
        // Its time stays where it was: so long it has been so.
        deposit.time = same == before.begin() ? before.front().time
                                              : std::max(deposit.time, before.front().time + 1);
    }
    if (!base::ReplaceFile(FileOf(account, deposit.client, deposit.time), HeadOf(deposit) + text,
                           0600)) {
        return programs::kRegistryWrite;
    }
    if (same != before.end() && same->time != deposit.time) {
        unlink(FileOf(account, deposit.client, same->time).c_str());
    }
    Thin(account, deposit.client);
    return programs::kDone;
}

// An upload that was begun anew, or given up, leaves its file.
void RemovePartials(const std::string& folder) {
    for (const fs::path& path : EntriesOf(folder)) {
        if (path.filename().string().rfind(kPartial, 0) == 0) {
            unlink(path.c_str());
        }
    }
}

bool RemoveTree(const std::string& folder) {
    std::error_code error;
    fs::remove_all(folder, error);
    errno = error.value();
    return !error;
}

}  // namespace

std::vector<Deposit> Deposits(const std::string& account) {
    std::vector<Deposit> all;
    std::vector<fs::path> clients = EntriesOf(FolderOf(account));
    std::sort(clients.begin(), clients.end());
    for (const fs::path& folder : clients) {
        const auto client = base::PercentDecoded(folder.filename().string());
        if (client && IsClientId(*client)) {
            for (Deposit& deposit : DepositsOf(account, *client)) {
                all.push_back(std::move(deposit));
            }
        }
    }
    return all;
}

std::optional<std::string> ReadDeposit(const std::string& account, const std::string& client,
                                       int64_t time) {
    const auto file = base::ReadFile(FileOf(account, client, time), kMaxHead + kMaxDepositBytes);
    const size_t end = file ? file->find(kEndOfHead) : std::string::npos;
    return end == std::string::npos
               ? std::nullopt
               : std::optional<std::string>(file->substr(end + kEndOfHead.size()));
}

int TakeDepositPiece(const std::string& account, const DepositPiece& piece) {
    const std::string folder = FolderOf(account, piece.deposit.client);
    if (access(folder.c_str(), F_OK) != 0 &&
        EntriesOf(FolderOf(account)).size() >= kMaxDepositClients) {
        return programs::kTooManyDeposits;
    }
    if (!base::MakeFolder(DepositFolder(), 0700) || !base::MakeFolder(FolderOf(account), 0700) ||
        !base::MakeFolder(folder, 0700)) {
        return programs::kRegistryWrite;
    }
    const std::string partial = folder + "/" + kPartial + piece.upload;
    if (piece.offset == 0) {
        RemovePartials(folder);
    }
    struct stat facts = {};
    const int flags =
        O_RDWR | O_APPEND | O_CLOEXEC | O_NOFOLLOW | (piece.offset == 0 ? O_CREAT | O_EXCL : 0);
    const UniqueFd file(open(partial.c_str(), flags, 0600));
    if (!file) {
        return errno == ENOENT ? programs::kBadArgument : programs::kRegistryWrite;
    }
    // A piece that is sent a second time, or out of its turn, would spoil the text.
    if (fstat(file.Get(), &facts) != 0 || static_cast<uint64_t>(facts.st_size) != piece.offset) {
        return programs::kBadArgument;
    }
    if (!base::WriteAll(file.Get(), piece.text)) {
        RemovePartials(folder);
        return programs::kRegistryWrite;
    }
    if (piece.offset + piece.text.size() < piece.deposit.bytes) {
        return programs::kDone;
    }
    const auto text = base::ReadFile(partial, kMaxDepositBytes);
    RemovePartials(folder);
    return text ? Keep(account, piece.deposit, *text) : programs::kRegistryWrite;
}

bool RemoveDeposits(const std::string& account) {
    return RemoveTree(FolderOf(account));
}

bool RemoveDeposits(const std::string& account, const std::string& client) {
    return RemoveTree(FolderOf(account, client));
}

}  // namespace zel_server
