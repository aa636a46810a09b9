#include "programs/zel_server/transfer_arguments.h"

#include <algorithm>

#include "base/random_digits.h"
#include "base/text.h"
#include "programs/common/text.h"
#include "tarq/rsync_wrapper.h"

namespace zel_server {

namespace {

// Single-letter options come in one word, in this order, each at most once: the result of -v
// --backup --dry-run -l --dirs --whole-file -o -g -D -t -p -A -X -r -c --relative -z in rsync 3.2.1
// to 3.5.
constexpr char kLetters[] = "vbnldWogDtpAXrcRz";
constexpr char kBackupLetter = 'b';
constexpr char kDryRunLetter = 'n';
constexpr char kDirsLetter = 'd';
constexpr char kChecksumLetter = 'c';
// After them follow letters for the capabilities of the client's rsync, which depend on its
// version.
constexpr char kCapabilities[] = "e.";

// Ends the options; the paths follow.
constexpr char kEndOfOptions[] = ".";

constexpr char kBackupWord[] = "--backup-dir";
constexpr char kPartialWord[] = "--partial-dir";

// rsync truncates longer words before it passes them on.
constexpr size_t kMaxWord = 4096;

enum Runs : unsigned { kPush = 1, kPull = 2, kBoth = kPush | kPull };

struct Word {
    const char* text;
    unsigned runs;
    enum Value { kNone, kNumber, kNextWord, kOwnFolder } value = kNone;
    const char* next = nullptr;  // the word, or the folder in which the run has its own
};
// What platform/tarqrsync/arguments.cpp requests, in the form in which rsync passes it on.
constexpr Word kWords[] = {
    {"--timeout=", kBoth, Word::kNumber},
    {"--bwlimit=", kBoth, Word::kNumber},
    {"--numeric-ids", kBoth},
    {"--log-format=%i", kPush},    // --out-format
    {"--log-format=%i%I", kPush},  // and -ii
    {"--delete-after", kPush},
    {"--delete-missing-args", kPush},  // of a list of changes, what is gone
    {"--no-r", kPush},                 // --dirs: folders by their own entries
    {"--stats", kPush},
    {"-@-1", kPush},  // --modify-window=-1
    {kBackupWord, kPush, Word::kOwnFolder, TARQ::Backup::kVersionsFolder},
    {"--temp-dir", kPush, Word::kOwnFolder, TARQ::Backup::kPartialsFolder},
    {kPartialWord, kPush, Word::kNextWord, TARQ::Backup::kResumedFolder},
    {"--info=DEL", kPush},
    {"--list-only", kPull},
    {"--files-from=-", kPull},  // the list travels as data, and no name in it is a pattern
    {"--from0", kPull},
};

bool IsNumber(const std::string& text) {
    return base::ParseNumber(text, INT32_MAX).has_value();
}

// Whether the letters of `word` are a subset of kLetters in the same order.
bool IsLetterWord(const std::string& word) {
    const size_t end = word.find(kCapabilities);
    if (word.size() < 2 || word.front() != '-' || end == std::string::npos) {
        return false;
    }
    const std::string all = kLetters;
    size_t next = 0;
    for (const char letter : word.substr(1, end - 1)) {
        const size_t found = all.find(letter, next);
        if (found == std::string::npos) {
            return false;
        }
        next = found + 1;
    }
    return std::all_of(word.begin() + static_cast<long>(end + std::string(kCapabilities).size()),
                       word.end(), base::IsLetter);
}

// The ID in "ABOVE/ID"; empty for any other folder.
std::string IdIn(const std::string& folder, const char* above) {
    const std::string head = std::string(above) + "/";
    const bool fits = folder.compare(0, head.size(), head) == 0;
    return fits && base::AreRandomDigits(folder.substr(head.size())) ? folder.substr(head.size())
                                                                     : "";
}

// How many words, starting at `position`, form a permitted option; 0: none. A run has one ID: the
// first folder of its own sets `id`.
size_t OptionAt(const std::vector<std::string>& words, size_t position, Runs run, std::string& id) {
    const std::string& word = words[position];
    for (const Word& entry : kWords) {
        const std::string text = entry.text;
        if ((entry.runs & run) == 0) {
            continue;
        }
        switch (entry.value) {
            case Word::kNone:
                if (word == text) {
                    return 1;
                }
                break;
            case Word::kNumber:
                if (word.compare(0, text.size(), text) == 0 && IsNumber(word.substr(text.size()))) {
                    return 1;
                }
                break;
            case Word::kNextWord:
                if (word == text && position + 1 < words.size() &&
                    words[position + 1] == entry.next) {
                    return 2;
                }
                break;
            case Word::kOwnFolder:
                if (word == text && position + 1 < words.size()) {
                    const std::string found = IdIn(words[position + 1], entry.next);
                    if (!found.empty() && (id.empty() || id == found)) {
                        id = found;
                        return 2;
                    }
                }
                break;
        }
    }
    return 0;
}

// The module's folder itself, as rsync calls it in a chroot and outside of one. The versions that a
// run leaves stand under their paths below the place that it writes to, so that is always this one.
bool IsTopFolder(const std::string& word) {
    return word == "/" || word == ".";
}

// A path within the module. rsync leaves a leading slash when the module's folder is "/".
bool IsPath(const std::string& word) {
    return !word.empty() && word.size() < kMaxWord && word.front() != '-' &&
           ("/" + word + "/").find("/../") == std::string::npos;
}

std::string Refusal(const std::string& word) {
    constexpr size_t kShown = 100;
    return "rsync's argument '" + programs::Printable(word.substr(0, kShown)) +
           "' is none that the synchronisation service's client uses";
}

}  // namespace

std::optional<Transfer> JudgeTransfer(const std::vector<std::string>& words, std::string& why) {
    const bool pull = words.size() > 1 && words[1] == "--sender";
    const Runs run = pull ? kPull : kPush;
    const size_t letters = pull ? 2 : 1;
    if (words.size() <= letters || words[0] != "--server") {
        why = "this is no run of the synchronisation service's client";
        return std::nullopt;
    }
    if (!IsLetterWord(words[letters])) {
        why = Refusal(words[letters]);
        return std::nullopt;
    }
    Transfer transfer;
    bool keeps = false;
    size_t position = letters + 1;
    while (position < words.size() && words[position] != kEndOfOptions) {
        const size_t taken = OptionAt(words, position, run, transfer.id);
        const bool is_backup = words[position] == kBackupWord;
        if (taken == 0 || (is_backup && keeps)) {
            why = Refusal(words[position]);
            return std::nullopt;
        }
        keeps = keeps || is_backup;
        // As in rsync, the last one counts.
        if (words[position] == kPartialWord) {
            transfer.resumes = words[position + 1] == TARQ::Backup::kResumedFolder;
        }
        position += taken;
    }
    // Only one path, so that no file name in the share that matches a pattern can become an
    // argument.
    if (position + 2 != words.size() || !IsPath(words[position + 1])) {
        why = "a run names one path of the share, below it and as it is called";
        return std::nullopt;
    }
    const std::string& word = words[letters];
    const auto has = [options = word.substr(0, word.find(kCapabilities))](char letter) {
        return options.find(letter) != std::string::npos;
    };
    if (pull && has(kDirsLetter)) {
        why = Refusal(word);
        return std::nullopt;
    }
    transfer.does = pull ? Access::kRead : has(kDryRunLetter) ? Access::kCompare : Access::kWrite;
    transfer.by_content = has(kChecksumLetter);
    if (transfer.does != Access::kWrite) {
        return transfer;
    }
    if (!has(kBackupLetter) || !keeps) {
        why =
            "this server keeps what a push replaces or deletes, and this client is of an earlier "
            "version, which does not ask for that: upgrade it";
        return std::nullopt;
    }
    if (!IsTopFolder(words[position + 1])) {
        why = "a push names the folder of the share itself";
        return std::nullopt;
    }
    return transfer;
}

}  // namespace zel_server
