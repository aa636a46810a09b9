#include "programs/zel_server/space_debts.h"

#include <fcntl.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <algorithm>
#include <sstream>

#include "base/folder_names.h"
#include "base/make_folder.h"
#include "base/percent.h"
#include "base/replace_file.h"
#include "base/text.h"
#include "base/whole_file.h"
#include "programs/zel_server/file_tree.h"
#include "programs/zel_server/server_config.h"
#include "programs/zel_server/version_retention.h"

namespace zel_server {

namespace {

constexpr size_t kMaxFile = 4096;

std::string Ledger() {
    return AnswerFolder() + "/.space";
}

std::string Due() {
    return Ledger() + "/.due";
}

std::string FileOf(const SpaceDebt& debt) {
    return Ledger() + "/" + debt.account + "@" + base::PercentEncoded(debt.storage, "-_");
}

uint64_t FreeIn(const std::string& storage) {
    struct statvfs disk = {};
    return statvfs(storage.c_str(), &disk) == 0 ? uint64_t{disk.f_bavail} * disk.f_frsize : 0;
}

void Read(const std::string& file, SpaceDebt& debt) {
    std::istringstream words(base::ReadFile(file, kMaxFile).value_or(""));
    words >> debt.bytes >> debt.missed;
}

bool Write(const SpaceDebt& debt) {
    return base::ReplaceFile(FileOf(debt),
                             std::to_string(debt.bytes) + " " + std::to_string(debt.missed), 0600);
}

}  // namespace

bool IsSpaceShort(const std::string& storage, uint64_t reserve) {
    struct statvfs disk = {};
    return statvfs(storage.c_str(), &disk) == 0 &&
           uint64_t{disk.f_bavail} * 100 < uint64_t{disk.f_blocks} * reserve;
}

uint64_t BytesWrittenBy(const std::string& number) {
    const auto text = base::ReadFile("/proc/" + number + "/io", kMaxFile);
    std::istringstream words(text.value_or(""));
    for (std::string word; words >> word;) {
        uint64_t bytes = 0;
        if (word == "wchar:" && words >> bytes) {
            return bytes;
        }
    }
    return 0;
}

void NoteWritten(const std::string& account, const std::string& storage, uint64_t bytes,
                 bool failed) {
    const auto settings = ReadKeepSettings();
    SpaceDebt debt = {account, storage, 0, 0};
    const std::string file = FileOf(debt);
    if (!settings || (!failed && !IsSpaceShort(storage, settings->reserve))) {
        unlink(file.c_str());
        return;
    }
    Read(file, debt);
    debt.bytes += std::min(bytes, UINT64_MAX - debt.bytes);
    debt.missed = failed ? FreeIn(storage) : 0;
    // Without the note nothing is given up, and the disk is full some time sooner.
    if (base::MakeFolder(Ledger(), 0700) && Write(debt)) {
        base::ReplaceFile(Due(), "", 0600);
    }
}

bool IsSpaceDue() {
    return access(Due().c_str(), F_OK) == 0;
}

std::vector<SpaceDebt> SpaceDebts() {
    unlink(Due().c_str());
    std::vector<SpaceDebt> debts;
    const base::UniqueFd folder = OpenFolder(AT_FDCWD, Ledger());
    const auto names = folder ? base::NamesIn(folder.Get()) : std::nullopt;
    for (const std::string& name : names.value_or(std::vector<std::string>())) {
        const size_t at = name.find('@');
        const auto storage =
            at == std::string::npos ? std::nullopt : base::PercentDecoded(name.substr(at + 1));
        if (storage) {
            debts.push_back({name.substr(0, at), *storage, 0, 0});
            Read(Ledger() + "/" + name, debts.back());
        }
    }
    return debts;
}

void PaySpaceDebt(const SpaceDebt& debt, uint64_t paid) {
    SpaceDebt left = {debt.account, debt.storage, 0, 0};
    Read(FileOf(left), left);
    left.bytes -= std::min(left.bytes, paid);
    left.missed -= std::min(left.missed, paid);
    Write(left);
}

}  // namespace zel_server
