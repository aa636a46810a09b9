#include "programs/common/task_row.h"

#include <charconv>
#include <utility>

#include "programs/common/text.h"

namespace programs {

namespace {

constexpr char kSeparator = '\x1f';
// Texts are cut so that the whole stays below what a string may have on the wire; the numbers take
// less than 200 bytes.
constexpr size_t kMaxText = 12000;

// ZEL::TASK_STATUS and ZEL::TASK_RESULT, by number.
constexpr const char* kStatusWords[] = {"idle", "waiting", "running", "paused"};
constexpr const char* kResultWords[] = {"not yet", "done", "failed", "cancelled"};
constexpr int kRunning = 2;

const char* WordOf(const char* const (&words)[4], int number) {
    return words[number >= 0 && number < 4 ? number : 0];
}

// The fields in the order that they are packed in.
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
}

/// Puts a row together, field after field.
class Packer {
public:
    Packer() { packed_.reserve(256); }

    void operator()(const std::string& text) {
        const size_t begin = packed_.size();
        packed_.append(text, 0, kMaxText);
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

/// Takes a packed row apart, field after field.
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
    /// Whether all were there, in their form, and nothing else.
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
    return row.retry_in ? "retry in " + HumanDuration(*row.retry_in) : TaskStatusWord(row.status);
}

std::string TaskLastRunWords(const TaskRow& row) {
    std::string words = TaskResultWord(row.result);
    if (row.last_end) {
        words += " " + HumanTime(*row.last_end);
    }
    return words;
}

Table NewTaskTable() {
    return Table(
        {"NAME", "SHARES", "SERVER", "SCHEDULE", "STATE", "LAST RUN", "NEXT RUN", "PENDING"});
}

void AddTaskRow(TaskRow row, Table& table) {
    std::vector<std::string> cells;
    cells.reserve(8);
    std::string state = TaskStateWords(row);
    std::string last_run = TaskLastRunWords(row);
    cells.push_back(std::move(row.name));
    cells.push_back(std::move(row.shares));
    cells.push_back(std::move(row.server));
    cells.push_back(std::move(row.schedule));
    cells.push_back(std::move(state));
    cells.push_back(std::move(last_run));
    cells.push_back(row.next_run ? HumanTime(*row.next_run) : "-");
    cells.push_back(std::to_string(row.pending));
    table.Add(std::move(cells));
}

}  // namespace programs
