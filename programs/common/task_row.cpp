#include "programs/common/task_row.h"

#include <charconv>

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

void Pack(const std::string& text, std::string& packed) {
    const size_t begin = packed.size();
    packed.append(text, 0, kMaxText);
    for (size_t i = begin; i < packed.size(); ++i) {
        if (static_cast<unsigned char>(packed[i]) < 0x20) {
            packed[i] = '?';
        }
    }
    packed += kSeparator;
}

template <typename T>
void Pack(const std::optional<T>& number, std::string& packed) {
    Pack(number ? std::to_string(*number) : "", packed);
}

/// Takes a packed row apart, field after field.
class Unpacker {
public:
    explicit Unpacker(std::string_view packed) : rest_(packed) {}

    void Take(std::string& text) { text = Next(); }
    template <typename T>
    void Take(std::optional<T>& number) {
        const std::string_view text = Next();
        number.reset();
        T value = 0;
        if (!text.empty()) {
            Parse(text, value);
            number = value;
        }
    }
    template <typename T>
    void TakeNumber(T& number) {
        Parse(Next(), number);
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
    std::string packed;
    packed.reserve(256);
    Pack(row.name, packed);
    Pack(row.shares, packed);
    Pack(row.server, packed);
    Pack(row.schedule, packed);
    Pack(std::to_string(row.status), packed);
    Pack(std::to_string(row.result), packed);
    Pack(row.last_end, packed);
    Pack(row.next_run, packed);
    Pack(row.retry_in, packed);
    Pack(row.percent, packed);
    Pack(std::to_string(row.pending), packed);
    Pack(row.note, packed);
    return packed;
}

bool UnpackTaskRow(std::string_view packed, TaskRow& row) {
    Unpacker fields(packed);
    fields.Take(row.name);
    fields.Take(row.shares);
    fields.Take(row.server);
    fields.Take(row.schedule);
    fields.TakeNumber(row.status);
    fields.TakeNumber(row.result);
    fields.Take(row.last_end);
    fields.Take(row.next_run);
    fields.Take(row.retry_in);
    fields.Take(row.percent);
    fields.TakeNumber(row.pending);
    fields.Take(row.note);
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
        return row.percent ? "running " + std::to_string(*row.percent) + "%" : "running";
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
