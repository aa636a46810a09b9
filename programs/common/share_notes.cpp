#include "programs/common/share_notes.h"

#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <string_view>

#include "base/file_lock.h"
#include "base/make_folder.h"
#include "base/percent.h"
#include "base/random_digits.h"
#include "base/replace_file.h"
#include "base/section_view.h"
#include "base/text.h"
#include "base/whole_file.h"
#include "programs/common/failure.h"
#include "tarq/root_path.h"

namespace programs {

namespace {

constexpr size_t kMaxFile = size_t{1} << 20;
constexpr std::chrono::seconds kLongestWait(20);
// A share has few copies, and of few pushes the end stays unknown: these are far more.
constexpr size_t kMaxCopies = 16;
constexpr size_t kMaxBegun = 8;
constexpr char kPlainInPaths[] = "/.-_";

std::string Folder() {
    return TARQ::RootPath("/usr/tarq/etc/zel_shares");
}

// The name of a share may hold anything, that of a file may not.
std::string FileOf(const std::string& share) {
    return Folder() + "/" + base::PercentEncoded(share, "-_");
}

Failure Unusable(const char* verb, const std::string& file) {
    return SystemFailure(std::string("cannot ") + verb + " " + file, FailureKind::kLocal);
}

// "IDENTITY GENERATION PUSH"; what is damaged is as good as forgotten.
void TakeCopy(std::string_view value, std::vector<KnownCopy>& copies) {
    const size_t first = value.find(' ');
    const size_t second = first == std::string_view::npos ? first : value.find(' ', first + 1);
    if (second == std::string_view::npos) {
        return;
    }
    const std::string_view identity = value.substr(0, first);
    const std::string_view push = value.substr(second + 1);
    const auto generation =
        base::ParseNumber(value.substr(first + 1, second - first - 1), UINT64_MAX);
    if (generation && base::AreRandomDigits(identity) && base::AreRandomDigits(push)) {
        copies.push_back({std::string(identity), *generation, std::string(push)});
    }
}

// A path may hold a line break; two slashes, which the kernel writes in none, stand for it.
std::string Replaced(std::string text, const std::string& from, const std::string& to) {
    for (size_t at = 0; (at = text.find(from, at)) != std::string::npos; at += to.size()) {
        text.replace(at, from.size(), to);
    }
    return text;
}

ShareNotes Parse(std::string_view text) {
    ShareNotes notes;
    for (std::string_view line; base::TakeLine(text, line);) {
        const auto pair = base::ParseKeyLine(line);
        if (!pair) {
            continue;
        }
        if (pair->key == "copy") {
            TakeCopy(pair->value, notes.copies);
        } else if (pair->key == "begun" && base::AreRandomDigits(pair->value)) {
            notes.begun.emplace_back(pair->value);
        } else if (pair->key == "mount" && !pair->value.empty() && pair->value.front() == '/') {
            notes.mounts.push_back(Replaced(std::string(pair->value), "//", "\n"));
        } else if (pair->key == "sending") {
            const auto path = base::PercentDecoded(pair->value);
            if (path && !path->empty()) {
                notes.sending.push_back(*path);
            }
        } else if (pair->key == "gone_on" && base::AreRandomDigits(pair->value)) {
            notes.gone_on = pair->value;
        }
    }
    return notes;
}

std::string TextOf(const ShareNotes& notes) {
    std::string text;
    const auto add = [&](const char* key, const std::string& value) {
        text += std::string(key) + "=\"" + value + "\"\n";
    };
    for (const KnownCopy& copy : notes.copies) {
        add("copy", copy.identity + " " + std::to_string(copy.generation) + " " + copy.push);
    }
    for (const std::string& push : notes.begun) {
        add("begun", push);
    }
    for (const std::string& mount : notes.mounts) {
        add("mount", Replaced(mount, "\n", "//"));
    }
    for (const std::string& path : notes.sending) {
        add("sending", base::PercentEncoded(path, kPlainInPaths));
    }
    if (!notes.gone_on.empty()) {
        add("gone_on", notes.gone_on);
    }
    return text;
}

template <typename Items>
void KeepLast(Items& items, size_t count) {
    if (items.size() > count) {
        items.erase(items.begin(), items.end() - static_cast<std::ptrdiff_t>(count));
    }
}

}  // namespace

ShareNotes ReadShareNotes(const std::string& share) {
    const auto text = base::ReadFile(FileOf(share), kMaxFile);
    if (!text && errno != ENOENT && errno != ENOTDIR) {
        throw Unusable("read", FileOf(share));
    }
    return text ? Parse(*text) : ShareNotes();
}

void ChangeShareNotes(const std::string& share, const std::function<void(ShareNotes&)>& change) {
    const std::string file = FileOf(share);
    if (!base::MakeFolder(Folder(), 0700)) {
        throw Unusable("make", Folder());
    }
    const base::FileLock lock(Folder() + "/.lock", kLongestWait);
    if (!lock) {
        throw Failure(FailureKind::kLocal, lock.Problem());
    }
    ShareNotes notes = ReadShareNotes(share);
    const std::string before = TextOf(notes);
    change(notes);
    KeepLast(notes.copies, kMaxCopies);
    KeepLast(notes.begun, kMaxBegun);
    const std::string text = TextOf(notes);
    if (text != before && !base::ReplaceFile(file, text, 0600)) {
        throw Unusable("write", file);
    }
}

void RemoveShareNotes(const std::string& share) {
    unlink(FileOf(share).c_str());
}

}  // namespace programs
