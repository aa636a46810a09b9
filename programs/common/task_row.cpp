#include "programs/common/task_row.h"

#include <charconv>
#include <ctime>
#include <iterator>
#include <utility>

#include "base/utf8.h"
#include "programs/common/table.h"
#include "programs/common/text.h"

namespace programs {

namespace {

constexpr char kSeparator = '\x1f';
// Texts are cut so that the packed row stays below the maximum length of a string in a message; the
// numbers take less than 200 bytes.
constexpr size_t kMaxText = 9000;

// ZEL::TASK_STATUS and ZEL::TASK_RESULT, by number.
constexpr const char* kStatusWords[] = {"idle", "waiting", "running", "paused", "confirm"};
constexpr const char* kResultWords[] = {"not yet", "done", "failed", "cancelled"};
constexpr int kRunning = 2;
constexpr int kConfirm = 4;

template <int N>
const char* WordOf(const char* const (&words)[N], int number) {
    return words[number >= 0 && number < N ? number : 0];
}

// The fields, in the order in which they are packed.
template <typename Row, typename Visit>
void EachField(Row& row, Visit& visit) {
    visit(row.name);
    visit(row.shares);
    visit(row.server);
    visit(row.schedule);
    visit(row.status);
    visit(row.result);
    visit(row.last_end);
    visit(row.next_run);
    visit(row.retry_in);
    visit(row.progress);
    visit(row.pending);
    visit(row.note);
    visit(row.error);
}

/// Packs a row, field by field.
class Packer {
public:
    Packer() { packed_.reserve(256); }

    void operator()(const std::string& text) {
        const size_t begin = packed_.size();
        packed_ += base::Utf8Head(text, kMaxText);
        for (size_t i = begin; i < packed_.size(); ++i) {
            if (static_cast<unsigned char>(packed_[i]) < 0x20) {
                packed_[i] = '?';
            }
        }
        packed_ += kSeparator;
    }
    template <typename T>
    void operator()(const T& number) {
        (*this)(std::to_string(number));
    }
    template <typename T>
    void operator()(const std::optional<T>& number) {
        (*this)(number ? std::to_string(*number) : "");
    }
    std::string Packed() { return std::move(packed_); }

private:
    std::string packed_;
};

/// Unpacks a row, field by field.
class Unpacker {
public:
    explicit Unpacker(std::string_view packed) : rest_(packed) {}

    void operator()(std::string& text) { text = Next(); }
    template <typename T>
    void operator()(T& number) {
        Parse(Next(), number);
    }
    template <typename T>
    void operator()(std::optional<T>& number) {
        const std::string_view text = Next();
        number.reset();
        T value = 0;
        if (!text.empty()) {
            Parse(text, value);
            number = value;
        }
    }
    /// Whether all fields were there and valid, and nothing followed.
    bool Good() const { return good_ && rest_.empty(); }

private:
    std::string_view Next() {
        const size_t end = rest_.find(kSeparator);
        if (end == std::string_view::npos) {
            good_ = false;
            return {};
        }
        const std::string_view field = rest_.substr(0, end);
        rest_.remove_prefix(end + 1);
        return field;
    }
    template <typename T>
    void Parse(std::string_view text, T& number) {
        const auto [stopped, error] =
            std::from_chars(text.data(), text.data() + text.size(), number);
        good_ = good_ && error == std::errc() && stopped == text.data() + text.size();
    }

    std::string_view rest_;
    bool good_ = true;
};

}  // namespace

std::string PackTaskRow(const TaskRow& row) {
    Packer packer;
    EachField(row, packer);
    return packer.Packed();
}

bool UnpackTaskRow(std::string_view packed, TaskRow& row) {
    Unpacker fields(packed);
    EachField(row, fields);
    return fields.Good();
}

const char* TaskStatusWord(int status) {
    return WordOf(kStatusWords, status);
}

const char* TaskResultWord(int result) {
    return WordOf(kResultWords, result);
}

std::string TaskStateWords(const TaskRow& row) {
    if (row.status == kRunning) {
        return row.progress.empty() ? "running" : row.progress;
    }
    return row.retry_in && row.status != kConfirm ? "retry in " + HumanDuration(*row.retry_in)
                                                  : TaskStatusWord(row.status);
}

std::string TaskLastRunWords(const TaskRow& row) {
    std::string words = TaskResultWord(row.result);
    if (row.last_end) {
        words += " " + HumanTime(*row.last_end);
    }
    return words;
}

std::vector<std::string> TaskLines(std::vector<TaskRow> rows, size_t width) {
    const int64_t now = time(nullptr);
    Table table({{"NAME", 8},
                 {"SHARES", 8, 3},
                 {"SERVER", 8, 2},
                 {"SCHEDULE", 12, 1},
                 {"STATE", 12},
                 "LAST RUN",
                 "NEXT RUN",
                 "PENDING"});
    table.Reserve(rows.size());
    std::vector<std::vector<std::string>> remarks;
    remarks.reserve(rows.size());
    for (TaskRow& row : rows) {
        std::vector<std::string>& told = remarks.emplace_back();
        for (const std::string& remark : {row.error, row.note}) {
            if (!remark.empty()) {
                const std::string line = "  ! " + Printable(remark);
                told.push_back(width == 0 ? line : CutTo(line, width));
            }
        }
        std::string state = TaskStateWords(row);
        std::string last_run = TaskResultWord(row.result);
        if (row.last_end) {
            last_run += " " + BriefTime(*row.last_end, now);
        }
        table.Add({std::move(row.name), std::move(row.shares), std::move(row.server),
                   std::move(row.schedule), std::move(state), std::move(last_run),
                   row.next_run ? BriefTime(*row.next_run, now) : "-",
                   std::to_string(row.pending)});
    }
    std::vector<std::string> table_lines = table.Lines(width);
    std::vector<std::string> lines = {std::move(table_lines.front())};
    for (size_t i = 0; i < remarks.size(); ++i) {
        lines.push_back(std::move(table_lines[i + 1]));
        std::move(remarks[i].begin(), remarks[i].end(), std::back_inserter(lines));
    }
    return lines;
}

}  // namespace programs
