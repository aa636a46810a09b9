#include "programs/common/run_progress.h"

#include <algorithm>
#include <string_view>

#include "programs/common/text.h"

namespace programs {

namespace {

using TARQ::Backup::RunProgress;
using ZEL::PObject;

constexpr char kShare[] = "progress_share";
constexpr char kPercent[] = "progress_percent";
constexpr char kPercentOf[] = "progress_percent_of";
constexpr char kChecked[] = "progress_files_checked";
constexpr char kTotal[] = "progress_files_total";
constexpr char kFinal[] = "progress_files_final";
constexpr char kBytes[] = "progress_bytes";
constexpr char kRate[] = "progress_rate";
constexpr char kFile[] = "progress_file";
constexpr char kFileBytes[] = "progress_file_bytes";
constexpr char kFileLength[] = "progress_file_length";
constexpr char kStill[] = "progress_still";

constexpr char kOfBytes[] = "bytes";
constexpr char kOfFiles[] = "files";

// A busy disk can pause for some seconds; a person looks again after a minute.
constexpr unsigned int kStalledAfter = 60;
// A file that takes less than this would only flicker on the display.
constexpr uint64_t kLargeFileSeconds = 3;

constexpr size_t kBarWidth = 24;
constexpr size_t kShortestBar = 8;
constexpr size_t kShortestName = 8;

PObject Number(uint64_t value) {
    return PObject(static_cast<unsigned long long>(value));
}

std::string PercentText(unsigned int percent) {
    return std::to_string(percent) + "%";
}

std::string Bar(unsigned int percent, size_t width) {
    const size_t filled = std::min<size_t>(percent, 100) * width / 100;
    return "[" + std::string(filled, '#') + std::string(width - filled, '.') + "]";
}

std::string Rate(const RunProgress& progress) {
    return HumanBytes(progress.bytes_per_second) + "/s";
}

std::string FilesText(const RunProgress& progress) {
    if (!progress.totals_final) {
        // The total is not final: show the number of checked files as soon as there are any.
        return progress.files_checked == 0
                   ? (progress.files_total == 0
                          ? "looking for files"
                          : "looking for files, " + std::to_string(progress.files_total) + " found")
                   : Count(progress.files_checked, "file") + " checked";
    }
    return std::to_string(progress.files_checked) + " of " + Count(progress.files_total, "file") +
           " checked";
}

std::string SentText(const RunProgress& progress) {
    return progress.bytes_done == 0 ? "" : ", " + HumanBytes(progress.bytes_done) + " sent";
}

// The text for a run that makes progress, without the current file.
std::string MovingText(const RunProgress& progress) {
    if (progress.percent_of != RunProgress::BYTES) {
        return FilesText(progress) + SentText(progress) +
               (progress.bytes_done == 0 ? "" : ", " + Rate(progress));
    }
    std::string text = PercentText(progress.percent) + "  " + HumanBytes(progress.bytes_done) +
                       ", " + Rate(progress);
    if (progress.percent > 0 && progress.percent < 100 && progress.bytes_per_second > 0) {
        const uint64_t left = progress.bytes_done / progress.percent * (100 - progress.percent);
        text += ", " + HumanDuration(left / progress.bytes_per_second) + " left";
    }
    return text;
}

std::string StalledText(const RunProgress& progress) {
    return "nothing has moved for " + HumanDuration(progress.seconds_still);
}

// The progress of a large file, without its name; empty when the current file is not large.
std::string LargeFileText(const RunProgress& progress) {
    const bool large =
        !progress.file.empty() &&
        progress.file_length / kLargeFileSeconds > std::max<uint64_t>(progress.bytes_per_second, 1);
    if (!large || progress.percent_of == RunProgress::BYTES) {
        return "";
    }
    // In floating point, as a multiplication by 100 could overflow.
    const double part = static_cast<double>(std::min(progress.file_bytes, progress.file_length)) *
                        100 / static_cast<double>(progress.file_length);
    return PercentText(static_cast<unsigned int>(part)) + " of " + HumanBytes(progress.file_length);
}

// Shortens a long name to its end, which says more than the beginning.
std::string LastColumns(const std::string& text, size_t columns) {
    constexpr std::string_view kCut = "...";
    std::vector<size_t> characters;  // byte offset of each
    for (size_t i = 0; i < text.size(); ++i) {
        if ((static_cast<unsigned char>(text[i]) & 0xc0) != 0x80) {
            characters.push_back(i);
        }
    }
    return characters.size() <= columns
               ? text
               : std::string(kCut) +
                     text.substr(characters[characters.size() - columns + kCut.size()]);
}

}  // namespace

const std::vector<std::string>& ProgressKeys() {
    static const std::vector<std::string> keys = {kShare, kPercent,   kPercentOf,  kChecked,
                                                  kTotal, kFinal,     kBytes,      kRate,
                                                  kFile,  kFileBytes, kFileLength, kStill};
    return keys;
}

void AddProgress(const std::string& share, const RunProgress& progress, PObject& map) {
    map[kShare] = share;
    if (progress.percent_of != RunProgress::NOTHING) {
        map[kPercent] = progress.percent;
        map[kPercentOf] = progress.percent_of == RunProgress::BYTES ? kOfBytes : kOfFiles;
    }
    map[kChecked] = Number(progress.files_checked);
    map[kTotal] = Number(progress.files_total);
    map[kFinal] = progress.totals_final ? 1 : 0;
    map[kBytes] = Number(progress.bytes_done);
    map[kRate] = Number(progress.bytes_per_second);
    if (!progress.file.empty()) {
        map[kFile] = progress.file;
        map[kFileBytes] = Number(progress.file_bytes);
        map[kFileLength] = Number(progress.file_length);
    }
    map[kStill] = progress.seconds_still;
}

RunProgress ProgressOf(const PObject& map) {
    RunProgress progress;
    if (map[kPercent].isInteger()) {
        progress.percent_of =
            map[kPercentOf].asString() == kOfBytes ? RunProgress::BYTES : RunProgress::FILES;
        progress.percent = std::min(map[kPercent].asUInt32(), 100U);
    }
    progress.files_checked = map[kChecked].asUInt64();
    progress.files_total = std::max<uint64_t>(map[kTotal].asUInt64(), progress.files_checked);
    progress.totals_final = map[kFinal].asBool();
    progress.bytes_done = map[kBytes].asUInt64();
    progress.bytes_per_second = map[kRate].asUInt64();
    progress.file = map[kFile].asString();
    progress.file_bytes = map[kFileBytes].asUInt64();
    progress.file_length = map[kFileLength].asUInt64();
    progress.seconds_still = map[kStill].asUInt32();
    return progress;
}

bool IsStalled(const RunProgress& progress) {
    return progress.seconds_still >= kStalledAfter;
}

std::string ProgressState(const RunProgress& progress) {
    if (IsStalled(progress)) {
        return StalledText(progress);
    }
    switch (progress.percent_of) {
        case RunProgress::BYTES:
            return "running " + PercentText(progress.percent);
        case RunProgress::FILES:
            return "running, " + PercentText(progress.percent) + " checked";
        case RunProgress::NOTHING:
            break;
    }
    return "running";
}

std::string ProgressWords(const RunProgress& progress) {
    if (IsStalled(progress)) {
        return StalledText(progress) + "; " + FilesText(progress) + SentText(progress);
    }
    const std::string large = LargeFileText(progress);
    return MovingText(progress) +
           (large.empty() ? "" : "; " + Printable(progress.file) + " " + large);
}

std::string ProgressLine(const std::string& what, const RunProgress& progress, size_t columns) {
    std::string line = LastColumns(Printable(what), std::max(columns / 3, kShortestName)) + " ";
    if (IsStalled(progress)) {
        return line + ProgressWords(progress);
    }
    const std::string text = MovingText(progress);
    const size_t used = line.size() + text.size();
    if (progress.percent_of == RunProgress::BYTES) {
        const size_t room = columns - std::min(columns, used + 3);
        return room < kShortestBar
                   ? line + text
                   : line + Bar(progress.percent, std::min(room, kBarWidth)) + " " + text;
    }
    line += text;
    const std::string large = LargeFileText(progress);
    const size_t room = columns - std::min(columns, used + large.size() + 3);
    if (!large.empty() && room >= kShortestName) {
        line += "; " + LastColumns(Printable(progress.file), room) + " " + large;
    }
    return line;
}

}  // namespace programs
