#include "programs/common/copy_push.h"

#include <algorithm>
#include <optional>
#include <string_view>
#include <utility>

#include "ZEL/log.h"
#include "base/percent.h"
#include "base/random_digits.h"
#include "base/section_view.h"
#include "base/text.h"
#include "programs/common/failure.h"
#include "programs/common/mounts_below.h"
#include "programs/common/share_notes.h"
#include "programs/common/text.h"

namespace programs {

namespace {

using std::chrono::steady_clock;

// rsync tells of a file when it begins to send it, and the end of the one before may still be on
// its way then. The server is asked for both.
constexpr size_t kMaxSending = 2;
constexpr size_t kMaxSendingBytes = 2000;  // a command has room for 5 KiB
constexpr char kPlainInPaths[] = "/.-_";
// Files that take a while are noted when they begin, for the case that this machine loses its
// power; smaller ones no more often than this.
constexpr uint64_t kHugeFile = uint64_t{64} << 20;
constexpr std::chrono::seconds kNotedEvery(2);

struct CopyTold {
    std::string identity;
    uint64_t generation = 0;
    std::string partial;
};

std::optional<CopyTold> ParseAnswer(std::string_view answer) {
    CopyTold told;
    std::optional<uint64_t> generation;
    for (std::string_view line; base::TakeLine(answer, line);) {
        const auto pair = base::ParseKeyLine(line);
        if (pair && pair->key == "copy") {
            told.identity = pair->value;
        } else if (pair && pair->key == "generation") {
            generation = base::ParseNumber(pair->value, UINT64_MAX);
        } else if (pair && pair->key == "partial") {
            told.partial = base::PercentDecoded(pair->value).value_or("");
        }
    }
    if (!base::AreRandomDigits(told.identity) || !generation) {
        return std::nullopt;
    }
    told.generation = *generation;
    return told;
}

void Remove(std::vector<std::string>& items, const std::string& item) {
    items.erase(std::remove(items.begin(), items.end(), item), items.end());
}

const KnownCopy* Find(const std::vector<KnownCopy>& copies, const std::string& identity) {
    const auto found = std::find_if(copies.begin(), copies.end(), [&](const KnownCopy& copy) {
        return copy.identity == identity;
    });
    return found == copies.end() ? nullptr : &*found;
}

std::optional<KnownCopy> Take(std::vector<KnownCopy>& copies, const std::string& identity) {
    const KnownCopy* const found = Find(copies, identity);
    if (found == nullptr) {
        return std::nullopt;
    }
    KnownCopy copy = *found;
    copies.erase(copies.begin() + (found - copies.data()));
    return copy;
}

void AddWord(std::string& words, const std::string& word) {
    words += (words.empty() ? "" : " ") + word;
}

}  // namespace

CopyPush::CopyPush(const std::string& share, const std::vector<std::string>& paths)
    : share_(share), mark_(base::RandomDigits()) {
    if (mark_.empty()) {
        throw SystemFailure("no random numbers for a push", FailureKind::kLocal);
    }
    ChangeShareNotes(share, [&](ShareNotes& notes) {
        before_ = notes;
        for (const KnownCopy& copy : notes.copies) {
            AddWord(known_, copy.identity + ":" + std::to_string(copy.generation));
            AddWord(pushes_, copy.push);
        }
        for (const std::string& push : notes.begun) {
            AddWord(pushes_, push);
        }
        for (const std::string& path : notes.sending) {
            const bool is_pushed = std::any_of(
                paths.begin(), paths.end(),
                [&](const std::string& pushed) { return IsAtOrBelow("/" + path, pushed); });
            if (is_pushed) {
                asked_.push_back(path);
            }
        }
        notes.begun.push_back(mark_);
    });
    AddWord(pushes_, mark_);  // for another start of this push
    SetLines();
}

void CopyPush::SetLines() {
    std::string sending;
    for (const std::string& path : asked_) {
        const std::string word = base::PercentEncoded(path, kPlainInPaths);
        if (sending.size() + word.size() < kMaxSendingBytes) {
            AddWord(sending, word);
        }
    }
    lines_ = {"push=\"" + mark_ + "\"", "known=\"" + known_ + "\"",
              "knownPushes=\"" + pushes_ + "\""};
    if (!sending.empty()) {
        lines_.push_back("sending=\"" + sending + "\"");
    }
}

bool CopyPush::AskAgain() {
    if (resumes_.empty() && sending_.empty()) {
        return false;
    }
    std::vector<std::string> asked = sending_;
    for (const std::string& path : asked_) {
        if (std::find(asked.begin(), asked.end(), path) == asked.end()) {
            asked.push_back(path);
        }
    }
    asked_ = std::move(asked);
    resumes_.clear();
    SetLines();
    return true;
}

std::optional<std::list<std::string>> CopyPush::Expected(const std::string& identity) {
    const std::vector<KnownCopy>& copies = before_.copies;
    const KnownCopy* const known = !identity.empty()    ? Find(copies, identity)
                                   : copies.size() == 1 ? &copies.front()
                                                        : nullptr;
    if (known == nullptr || !before_.sending.empty() || !before_.gone_on.empty()) {
        return std::nullopt;
    }
    expected_ = *known;
    std::list<std::string> lines = lines_;
    lines.insert(lines.end(), {"expectedCopy=\"" + known->identity + "\"",
                               "expectedGeneration=\"" + std::to_string(known->generation) + "\"",
                               "expectedPush=\"" + known->push + "\""});
    return lines;
}

void CopyPush::Entered() {
    has_entered_ = true;
    identity_ = expected_->identity;
    generation_ = expected_->generation;
}

void CopyPush::Accepted(const std::string& answer) {
    const auto told = ParseAnswer(answer);
    if (!told) {
        return;
    }
    identity_ = told->identity;
    generation_ = told->generation;
    if (std::find(asked_.begin(), asked_.end(), told->partial) != asked_.end()) {
        resumes_ = "/" + told->partial;
    }
    ShareNotes notes = ReadShareNotes(share_);
    const auto known = Take(notes.copies, identity_);
    must_compare_ = !known || generation_ < known->generation;
}

void CopyPush::Refused(const std::string& answer, bool gone_on) {
    has_entered_ = has_entered_ && !gone_on;
    const auto told = gone_on ? ParseAnswer(answer) : std::nullopt;
    ChangeShareNotes(share_, [&](ShareNotes& notes) {
        Remove(notes.begun, mark_);
        if (told) {
            notes.gone_on = told->identity;
        }
    });
}

void CopyPush::Sends(const TARQ::Backup::RunChange& change) {
    if (change.kind != TARQ::Backup::RunChange::SEND || change.length < kLargeFile) {
        return;
    }
    Remove(sending_, change.path);
    sending_.insert(sending_.begin(), change.path);
    sending_.resize(std::min(sending_.size(), kMaxSending));
    if (change.length >= kHugeFile || steady_clock::now() - noted_ >= kNotedEvery) {
        noted_ = steady_clock::now();
        try {
            ChangeShareNotes(share_, [&](ShareNotes& notes) { notes.sending = sending_; });
        } catch (const Failure& failure) {
            ZEL::Logger::LogMsg(ZEL::Logger::LEVEL_ERROR, "[ERROR] copy_push(%d): share '%s': %s\n",
                                __LINE__, Printable(share_).c_str(), failure.what());
        }
    }
}

void CopyPush::Ended(bool completed, bool whole) {
    try {
        ChangeShareNotes(share_, [&](ShareNotes& notes) {
            Remove(notes.begun, mark_);
            if (!sending_.empty()) {
                notes.sending = sending_;
            }
            for (const std::string& path : completed ? sending_ : std::vector<std::string>()) {
                Remove(notes.sending, path);
            }
            for (const std::string& path : completed ? asked_ : std::vector<std::string>()) {
                Remove(notes.sending, path);
            }
            if (notes.gone_on == identity_) {
                notes.gone_on.clear();
            }
            // A copy that must be compared stays unknown until that has been done.
            if (identity_.empty() || (must_compare_ && !(completed && whole))) {
                return;
            }
            // Another push of this machine's may have ended meanwhile. The server keeps the mark of
            // the one that began last, which may be either.
            const auto noted = Take(notes.copies, identity_);
            const KnownCopy* const first = Find(before_.copies, identity_);
            const bool is_other = noted && (first == nullptr || noted->push != first->push);
            if (is_other) {
                notes.begun.push_back(noted->push);
            }
            const uint64_t reached = generation_ + (completed ? 1 : 0);
            notes.copies.push_back(
                {identity_, is_other ? std::max(noted->generation, reached) : reached, mark_});
        });
    } catch (const Failure& failure) {
        ZEL::Logger::LogMsg(ZEL::Logger::LEVEL_ERROR, "[ERROR] copy_push(%d): share '%s': %s\n",
                            __LINE__, Printable(share_).c_str(), failure.what());
    }
}

}  // namespace programs
