#include "programs/common/brake.h"

#include <sys/stat.h>
#include <time.h>

#include <algorithm>
#include <utility>

#include "programs/common/preview.h"
#include "programs/common/text.h"

namespace programs {

namespace {

using TARQ::Backup::RunChange;

// So few files may always be lost. Of a copy that this machine does not know, fewer: an empty
// folder on a machine that was set up anew must not empty the copy of the old one.
constexpr uint64_t kFewFiles = 100;
constexpr uint64_t kFewFilesAtFirst = 10;
constexpr size_t kListed = 200;
constexpr int64_t kForgetEvery = 600;

bool IsFolder(const RunChange& change) {
    return !change.path.empty() && change.path.back() == '/';
}

uint64_t KeyOf(uint64_t size, uint64_t digits) {
    return size * 0x9e3779b97f4a7c15U ^ digits;
}

// As a listing has it: 20261231235959 in local time.
uint64_t Digits(time_t moment) {
    struct tm local = {};
    localtime_r(&moment, &local);
    uint64_t digits = static_cast<uint64_t>(local.tm_year) + 1900;
    for (const int part :
         {local.tm_mon + 1, local.tm_mday, local.tm_hour, local.tm_min, local.tm_sec}) {
        digits = digits * 100 + static_cast<uint64_t>(part);
    }
    return digits;
}

void ForgetBefore(int64_t moment, std::unordered_map<PathHash, int64_t>& files) {
    for (auto file = files.begin(); file != files.end();) {
        file = file->second < moment ? files.erase(file) : std::next(file);
    }
}

}  // namespace

PathHash HashOf(std::string_view path) {
    return std::hash<std::string_view>()(path);
}

void CopyChanges::Add(const RunChange& change) {
    if (IsFolder(change)) {
        return;
    }
    if (change.kind == RunChange::DELETE) {
        --growth;
        lost.push_back(HashOf(change.path));
    } else if (change.is_new) {
        ++growth;
        born.push_back(HashOf(change.path));
    } else if (change.kind == RunChange::SEND) {
        lost.push_back(HashOf(change.path));
    }
}

// ---- RecentLosses ----

void RecentLosses::Add(const CopyChanges& changes, int64_t now) {
    if (now - forgotten_ >= kForgetEvery) {
        forgotten_ = now;
        ForgetBefore(now - kSeconds, born_);
        ForgetBefore(now - kSeconds, lost_);
    }
    for (const PathHash file : changes.lost) {
        if (IsMore(file)) {
            lost_.emplace(file, now);
        }
    }
    for (const PathHash file : changes.born) {
        if (born_.size() < kMaxBorn && lost_.count(file) == 0) {
            born_.emplace(file, now);
        }
    }
}

void RecentLosses::Clear() {
    born_.clear();
    lost_.clear();
}

// ---- Brake ----

uint64_t Brake::Limit(uint64_t of_files) const {
    return std::max(of_files / 100 * percent + of_files % 100 * percent / 100,
                    files || is_known ? kFewFiles : kFewFilesAtFirst);
}

bool Brake::MustLook() const {
    if (percent == 0) {
        return false;
    }
    if (!files) {
        return true;
    }
    const bool is_bounded = at_most && folders.empty();
    const uint64_t possible = is_bounded ? std::min(*at_most, *files) : *files;
    return possible + (recent ? recent->Count() : 0) > Limit(*files);
}

// ---- LossCount ----

LossCount::LossCount(const Brake& brake, std::string folder)
    : brake_(brake), folder_(std::move(folder)) {}

void LossCount::Add(const RunChange& change) {
    nothing_ = false;
    if (IsFolder(change)) {
        return;
    }
    const bool deleted = change.kind == RunChange::DELETE;
    if (!deleted && change.is_new) {
        ++made_;
        struct stat info = {};
        if (change.kind == RunChange::SEND &&
            lstat((folder_ + "/" + change.path).c_str(), &info) == 0) {
            ++sent_[KeyOf(change.length, Digits(info.st_mtime))];
        }
        return;
    }
    if (!deleted && change.kind != RunChange::SEND) {
        return;
    }
    const PathHash file = HashOf(change.path);
    ++(deleted ? deleted_ : replaced_);
    more_recent_ += !brake_.recent || brake_.recent->IsMore(file) ? 1U : 0U;
    if (deleted) {
        gone_.insert(file);
    }
    if (list_.size() < kListed) {
        list_.push_back(ChangeLine(change));
    }
}

void LossCount::AddOfCopy(const RunChange& file) {
    const PathHash hash = HashOf(file.path);
    const auto sent = sent_.find(KeyOf(file.length, file.time));
    if (file.kind == RunChange::SEND && sent != sent_.end() && sent->second > 0 &&
        gone_.erase(hash) != 0) {
        --sent->second;
        --deleted_;
        ++moved_;
        more_recent_ -= !brake_.recent || brake_.recent->IsMore(hash) ? 1U : 0U;
    }
}

uint64_t LossCount::FilesOfCopy(uint64_t in_share) const {
    const uint64_t files = in_share + deleted_ + moved_;
    return files - std::min(files, made_);
}

bool LossCount::IsTooMuch(uint64_t files) const {
    const uint64_t before = brake_.recent ? brake_.recent->Count() : 0;
    return std::max(Lost(), more_recent_ == 0 ? 0 : before + more_recent_) > brake_.Limit(files);
}

// As much as the person was shown, and a little more: files go on changing.
bool LossCount::IsAllowed(const std::optional<Consent>& consent) const {
    return consent && consent->reason == kLosses &&
           Lost() <= consent->amount + consent->amount / 10 + kFewFilesAtFirst;
}

Question LossCount::ToQuestion(const std::string& share, uint64_t files) const {
    const uint64_t before = brake_.recent ? brake_.recent->Count() : 0;
    Question question;
    question.reason = kLosses;
    question.amount = Lost();
    question.list = list_;
    question.text = "share '" + Printable(share) + "' waits: a push would delete " +
                    std::to_string(deleted_) + " and replace " + std::to_string(replaced_) +
                    " of the " + Count(files, "file") + " of its copy";
    if (before > 0) {
        question.text += ", after " + std::to_string(before) + " within a day";
    }
    if (!brake_.files && !brake_.is_known) {
        question.text += ", into which this machine has not pushed before";
    }
    return question;
}

}  // namespace programs
