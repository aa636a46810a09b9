#include "platform/tarqrsync/output_parser.h"

#include <algorithm>
#include <array>
#include <charconv>

#include "platform/tarqrsync/arguments.h"

namespace TARQ {
namespace Backup {

namespace {

// Intervals of progress reports: at most one in the first and, while nothing changes, about one in
// the second.
constexpr std::chrono::milliseconds kProgressInterval(200);
constexpr std::chrono::milliseconds kSilentInterval(900);
// A name of PATH_MAX bytes, each escaped as four, and the figures before it.
constexpr size_t kMaxLine = size_t{64} * 1024;
constexpr size_t kMaxOtherText = 4096;

constexpr std::string_view kDeleting = "*deleting";
constexpr std::string_view kDeletingPlain = "deleting ";
// The letters that tell what happens to an entry, and of which kind it is.
constexpr size_t kItemizeWidth = 11;
constexpr char kNewEntry = '+';
constexpr std::string_view kTopFolder = "./";

// A reader of the words and numbers of a line.
class Scanner {
public:
    explicit Scanner(std::string_view text) : text_(text) {}

    Scanner& SkipSpaces() {
        text_.remove_prefix(std::min(text_.find_first_not_of(' '), text_.size()));
        return *this;
    }

    bool Literal(std::string_view expected) {
        if (text_.substr(0, expected.size()) != expected) {
            return false;
        }
        text_.remove_prefix(expected.size());
        return true;
    }

    template <typename Number>
    bool Read(Number* value) {
        const auto [rest, error] =
            std::from_chars(text_.data(), text_.data() + text_.size(), *value);
        if (error != std::errc()) {
            return false;
        }
        text_.remove_prefix(static_cast<size_t>(rest - text_.data()));
        return true;
    }

    std::string_view Word() {
        const std::string_view word = text_.substr(0, std::min(text_.find(' '), text_.size()));
        text_.remove_prefix(word.size());
        return word;
    }

    std::string_view Take(size_t count) {
        const std::string_view taken = text_.substr(0, count);
        text_.remove_prefix(taken.size());
        return taken;
    }

    std::string_view Rest() const { return text_; }

private:
    std::string_view text_;
};

// "9.78MB/s": two decimals, in units of 1024.
bool ReadRate(Scanner* scanner, uint64_t* bytes_per_second) {
    double number = 0;
    if (!scanner->Read(&number) || !(number >= 0)) {
        return false;
    }
    constexpr std::string_view kUnits = "kMGT";
    const size_t unit = kUnits.find(scanner->Take(1));
    if (unit == std::string_view::npos || !scanner->Literal("B/s")) {
        return false;
    }
    for (size_t i = 0; i <= unit; ++i) {
        number *= 1024;
    }
    constexpr double kLargest = 1e18;
    *bytes_per_second = static_cast<uint64_t>(std::min(number, kLargest));
    return true;
}

struct Figure {
    std::string_view label;
    uint64_t RunReport::*member;
};

constexpr std::array<Figure, 6> kFigures = {{
    {"Number of files: ", &RunReport::files_total},
    {"Number of regular files transferred: ", &RunReport::files_sent},
    {"Number of deleted files: ", &RunReport::files_deleted},
    {"Total file size: ", &RunReport::bytes_total},
    {"Total bytes sent: ", &RunReport::bytes_sent},
    {"Total bytes received: ", &RunReport::bytes_received},
}};

// What rsync says when it turns to the files: one if it looks for all of them first, and then the
// line ends much later, the other if it does so as it goes.
bool SaysBegun(std::string_view line) {
    constexpr std::string_view kFindingFirst = "building file list";
    constexpr std::string_view kFindingAsItGoes = "sending incremental file list";
    constexpr std::string_view kReceiving = "receiving ";  // the same of what comes from the server
    return line.substr(0, kFindingFirst.size()) == kFindingFirst ||
           line.substr(0, kFindingAsItGoes.size()) == kFindingAsItGoes ||
           line.substr(0, kReceiving.size()) == kReceiving;
}

// " (reg: 10, dir: 2, link: 1)"
uint64_t FoldersIn(std::string_view kinds) {
    constexpr std::string_view kFolders = "dir: ";
    const size_t begin = kinds.find(kFolders);
    uint64_t folders = 0;
    if (begin != std::string_view::npos) {
        Scanner(kinds.substr(begin + kFolders.size())).Read(&folders);
    }
    return folders;
}

bool IsOctal(char c) {
    return c >= '0' && c <= '7';
}

}  // namespace

OutputParser::OutputParser(const RunOptions& options, bool listing)
    : options_(options), listing_(listing) {}

void OutputParser::Feed(std::string_view bytes) {
    while (!bytes.empty()) {
        // Progress lines end in a carriage return and overwrite each other.
        const size_t end = bytes.find_first_of("\r\n");
        const std::string_view piece = bytes.substr(0, end);
        if (line_.size() + piece.size() > kMaxLine) {
            line_dropped_ = true;
            line_.clear();
        } else if (!line_dropped_) {
            line_ += piece;
        }
        begun_ = begun_ || SaysBegun(line_);
        if (end == std::string_view::npos) {
            return;
        }
        bytes.remove_prefix(end + 1);
        if (!line_dropped_) {
            TakeLine(line_);
        }
        line_.clear();
        line_dropped_ = false;
    }
}

void OutputParser::Finish() {
    Feed("\n");
    if (held_back_) {
        TellProgress();
    }
}

void OutputParser::Tick(unsigned int seconds_still) {
    if (!options_.on_progress) {
        return;
    }
    progress_.seconds_still = seconds_still;
    const auto now = std::chrono::steady_clock::now();
    if (now >= next_progress_ &&
        (held_back_ || now >= next_progress_ + kSilentInterval - kProgressInterval)) {
        TellProgress();
    }
}

void OutputParser::FillReport(RunReport* report) const {
    report->folders_total = figures_.folders_total;
    for (const Figure& figure : kFigures) {
        report->*figure.member = figures_.*figure.member;
    }
    report->files_regular = figures_.files_regular;
    report->files_deleted = std::max(report->files_deleted, deletions_told_);
}

void OutputParser::TakeLine(std::string_view line) {
    const bool known = TakeEntry(line) || TakeProgress(line) || TakeFound(line) ||
                       TakeListed(line) || TakeFigure(line);
    if (!known && !line.empty() && other_text_.size() + line.size() < kMaxOtherText) {
        other_text_.append(line).append("\n");
    }
}

// " 10100 files..." while rsync looks for files, then "10103 files to consider".
bool OutputParser::TakeFound(std::string_view line) {
    Scanner scanner(line);
    uint64_t found = 0;
    if (!options_.on_progress || !scanner.SkipSpaces().Read(&found) || !scanner.Literal(" file")) {
        return false;
    }
    const std::string_view rest = scanner.Rest();
    const bool all = rest == " to consider" || rest == "s to consider";
    if (!all && rest != "s...") {
        return false;
    }
    progress_.files_total = std::max(progress_.files_total, found);
    progress_.totals_final = progress_.totals_final || all;
    held_back_ = true;
    return true;
}

// "   21004288  66%    9.77MB/s    0:00:01 (xfr#1, to-chk=4/6)"; the last part comes with each
// file's end, and says ir-chk until all files are known. The bytes are those of the files that were
// sent, the percentage is of the bytes of all files.
bool OutputParser::TakeProgress(std::string_view line) {
    if (!options_.on_progress) {
        return false;
    }
    Scanner scanner(line);
    uint64_t bytes = 0;
    uint64_t rate = 0;
    unsigned int percent = 0;
    if (!scanner.SkipSpaces().Read(&bytes) || !scanner.SkipSpaces().Read(&percent) ||
        !scanner.Literal("%") || !ReadRate(&scanner.SkipSpaces(), &rate)) {
        return false;
    }
    progress_.bytes_done = bytes;
    progress_.bytes_per_second = rate;
    percent_of_bytes_ = percent;
    progress_.file_bytes =
        std::min(bytes - std::min(bytes, bytes_before_file_), progress_.file_length);
    scanner.SkipSpaces().Word();  // the time left, which is the listener's to work out
    uint64_t number = 0;
    if (scanner.SkipSpaces().Literal("(xfr#") && scanner.Read(&number) && scanner.Literal(", ")) {
        EndFile();
        const bool all_found = scanner.Literal("to-chk=");
        uint64_t left = 0;
        uint64_t total = 0;
        if ((all_found || scanner.Literal("ir-chk=")) && scanner.Read(&left) &&
            scanner.Literal("/") && scanner.Read(&total) && left <= total) {
            progress_.totals_final = all_found;
            progress_.files_total = std::max(progress_.files_total, total);
            progress_.files_checked = std::max(progress_.files_checked, total - left);
        }
    }
    held_back_ = true;
    if (std::chrono::steady_clock::now() >= next_progress_) {
        TellProgress();
    }
    return true;
}

// "@@ <f+++++++++ 31457280 folder/name", "@@ *deleting   0 name", and "@@ .f          12 name" for
// what is as it should be.
bool OutputParser::TakeEntry(std::string_view line) {
    Scanner scanner(line);
    if ((!options_.on_change && !options_.on_progress) || !scanner.Literal(kChangeMark)) {
        return false;
    }
    const std::string_view itemized = scanner.Take(kItemizeWidth);
    RunChange change;
    if (!scanner.Literal(" ") || !scanner.Read(&change.length) || !scanner.Literal(" ")) {
        return false;
    }
    if (itemized.substr(0, kDeleting.size()) == kDeleting) {
        change.kind = RunChange::DELETE;
        ++deletions_told_;
    } else if (itemized[0] == '<' || itemized[0] == '>') {
        change.kind = RunChange::SEND;
        // "<fc......": nothing but the checksum, where the size and the time have their place.
        change.damaged = options_.by_content && itemized.substr(2, 3) == "c..";
    }
    if (change.kind != RunChange::SEND) {
        change.length = 0;
    }
    const bool differs = itemized.find_first_not_of(' ', 2) != std::string_view::npos;
    if (differs) {
        change.path = UnescapeName(scanner.Rest());
        change.is_new = itemized[kItemizeWidth - 1] == kNewEntry;
    }
    if (options_.on_progress && change.kind != RunChange::DELETE) {
        NoteEntry(itemized, change);
    }
    if (options_.on_change && differs) {
        options_.on_change(change);
    }
    return true;
}

// The line of a file that is sent comes before its bytes, any other once its entry is done.
void OutputParser::NoteEntry(std::string_view itemized, const RunChange& entry) {
    EndFile();
    const bool is_new = itemized[itemized.size() - 1] == kNewEntry;
    if (entry.path == kTopFolder && progress_.files_checked == 0) {
        // The server may have made the copy's folder just now: nobody has given it its mode yet.
        new_copy_ = is_new || itemized.find('p') != std::string_view::npos;
    } else {
        new_copy_ = new_copy_ && is_new;
    }
    if (entry.kind == RunChange::SEND) {
        progress_.file = entry.path;
        progress_.file_length = entry.length;
        progress_.file_bytes = 0;
        bytes_before_file_ = progress_.bytes_done;
    } else {
        ++progress_.files_checked;
    }
    held_back_ = true;
}

void OutputParser::EndFile() {
    if (!progress_.file.empty()) {
        ++progress_.files_checked;
        progress_.file.clear();
        progress_.file_bytes = 0;
        progress_.file_length = 0;
    }
}

void OutputParser::TellProgress() {
    held_back_ = false;
    next_progress_ = std::chrono::steady_clock::now() + kProgressInterval;
    RunProgress& now = progress_;
    now.files_total = std::max(now.files_total, now.files_checked);
    now.percent_of = RunProgress::NOTHING;
    now.percent = 0;
    if (now.totals_final && now.files_total > 0) {
        const bool bytes = new_copy_ && now.bytes_done > 0;
        now.percent_of = bytes ? RunProgress::BYTES : RunProgress::FILES;
        const uint64_t of_files = now.files_checked * 100 / now.files_total;
        now.percent = bytes ? percent_of_bytes_ : static_cast<unsigned int>(of_files);
        // rsync rounds, and a file without bytes may still be to come.
        now.percent = std::min(now.percent, now.files_checked < now.files_total ? 99U : 100U);
    }
    options_.on_progress(now);
}

// "-rw-r--r--    31457280 2026/11/21 11:37:51 folder/name".
bool OutputParser::TakeListed(std::string_view line) {
    if (!listing_) {
        return false;
    }
    Scanner scanner(line);
    const std::string_view mode = scanner.Word();
    RunChange entry;
    if (mode.size() < 10 || !scanner.SkipSpaces().Read(&entry.length)) {
        return false;
    }
    for (const std::string_view word : {scanner.SkipSpaces().Word(), scanner.SkipSpaces().Word()}) {
        for (const char c : word) {
            entry.time = c >= '0' && c <= '9' ? entry.time * 10 + static_cast<uint64_t>(c - '0')
                                              : entry.time;
        }
    }
    if (!scanner.Literal(" ")) {
        return false;
    }
    entry.path = UnescapeName(scanner.Rest()) + (mode[0] == 'd' ? "/" : "");
    entry.kind = mode[0] == '-' ? RunChange::SEND : RunChange::OTHER;
    if (entry.kind != RunChange::SEND) {
        entry.length = 0;
    }
    if (options_.on_change) {
        options_.on_change(entry);
    }
    return true;
}

bool OutputParser::TakeFigure(std::string_view line) {
    if (options_.report == nullptr) {
        return false;
    }
    if (line.substr(0, kDeletingPlain.size()) == kDeletingPlain) {
        ++deletions_told_;
        return true;
    }
    for (const Figure& figure : kFigures) {
        Scanner scanner(line);
        uint64_t value = 0;
        if (scanner.Literal(figure.label) && scanner.Read(&value)) {
            figures_.*figure.member = value;
            if (figure.member == &RunReport::files_total) {
                figures_.folders_total = FoldersIn(scanner.Rest());
            }
            // "Number of files: 6 (reg: 2, dir: 3, link: 1)"
            if (figure.member == &RunReport::files_total && scanner.Literal(" (reg: ")) {
                scanner.Read(&figures_.files_regular);
            }
            return true;
        }
    }
    return false;
}

std::string UnescapeName(std::string_view name) {
    constexpr size_t kEscapeSize = 5;
    std::string result;
    result.reserve(name.size());
    while (!name.empty()) {
        if (name.size() >= kEscapeSize && name[0] == '\\' && name[1] == '#' && name[2] <= '3' &&
            IsOctal(name[2]) && IsOctal(name[3]) && IsOctal(name[4])) {
            result += static_cast<char>((name[2] - '0') * 64 + (name[3] - '0') * 8 + name[4] - '0');
            name.remove_prefix(kEscapeSize);
        } else {
            result += name[0];
            name.remove_prefix(1);
        }
    }
    return result;
}

}  // namespace Backup
}  // namespace TARQ
