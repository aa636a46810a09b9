#include "programs/common/task_fields.h"

#include <arpa/inet.h>

#include <algorithm>
#include <set>
#include <utility>

#include "ZEL/sync_obj.h"
#include "base/text.h"
#include "programs/common/bandwidth.h"
#include "programs/common/text.h"
#include "programs/common/transport_words.h"
#include "programs/common/wire_text.h"

namespace programs {

namespace {

using ZEL::PObject;

// ---- Further checks of values ----

std::string CheckName(const PObject& name) {
    return IsTaskName(name.asString())
               ? ""
               : "cannot be '" + Printable(name.asString()) +
                     "': it has 1 to 128 bytes, without control characters, quotes and brackets";
}

std::string CheckShareNames(const PObject& shares) {
    std::set<std::string> seen;
    for (const std::string& share : TextsOf(shares)) {
        if (!seen.insert(share).second) {
            return "names share '" + Printable(share) + "' twice";
        }
    }
    return "";
}

std::string CheckPatterns(const PObject& patterns) {
    for (const std::string& pattern : TextsOf(patterns)) {
        if (pattern.empty() || pattern.find('\n') != std::string::npos) {
            return "has a pattern that is empty or has a line break: '" + Printable(pattern) + "'";
        }
    }
    return "";
}

std::string CheckWeek(const PObject& week) {
    const std::string days = week.asString();
    return days.size() == 7 && days != "0000000" &&
                   days.find_first_not_of("01") == std::string::npos
               ? ""
               : "must be seven digits 0 or 1, Sunday first, at least one 1";
}

// ---- Conversion from and to what people read ----

std::string TakeServer(const TaskField&, const std::string& server, PObject& settings) {
    unsigned char address[16];
    const bool is_address = inet_pton(AF_INET, server.c_str(), address) == 1 ||
                            inet_pton(AF_INET6, server.c_str(), address) == 1;
    settings["server_ip"] = is_address ? server : "";
    settings["server_name"] = is_address ? "" : server;
    return "";
}

// "30d" or "30", and "off" for 0.
std::string TakeDays(const TaskField& field, const std::string& word, PObject& settings) {
    const bool has_unit = word.size() > 1 && word.back() == 'd';
    const auto days =
        word == "off"
            ? std::optional<uint64_t>(0)
            : base::ParseNumber(word.substr(0, word.size() - (has_unit ? 1 : 0)), field.max);
    if (!days) {
        return "must be days, 0 to " + std::to_string(field.max) + ", or off";
    }
    settings[field.key] = static_cast<unsigned long long>(*days);
    return "";
}

std::string TakeBandwidth(const TaskField& field, const std::string& word, PObject& settings) {
    const BandwidthWords said = ReadBandwidth(word);
    if (said.fault.empty()) {
        settings[field.key] = said.otherwise;
        settings["bandwidth_windows"] = said.windows;
    }
    return said.fault;
}

std::string TransportOf(const PObject& task) {
    return TransportWords(ServerOf(task), task["ssh"].asBool(), task["ssh_port"].asUInt32());
}

std::string TimeoutWords(const PObject& task) {
    return Count(task["rsync_timeout"].asUInt64(), "second");
}

// "08:00-18:00 1024 KiB/s, else none; now 1024 KiB/s, until 18:00"
std::string LimitWords(const PObject& task) {
    const std::string windows = task["bandwidth_windows"].asString();
    std::string otherwise = RateWords(task["max_bandwidth"].asUInt32());
    if (windows.empty()) {
        return otherwise;
    }
    std::string words;
    for (size_t begin = 0; begin < windows.size();) {
        const size_t end = std::min(windows.find(',', begin), windows.size());
        const size_t equals = windows.find('=', begin);
        words += windows.substr(begin, equals - begin) + " " +
                 RateWords(Bandwidth::RateOf(windows.substr(equals + 1, end - equals - 1))) + ", ";
        begin = end + 1;
    }
    words += "else " + otherwise;
    if (task["bandwidth_now"].isInteger()) {
        words += "; now " + RateWords(task["bandwidth_now"].asUInt32());
        if (task["bandwidth_until"].isInteger()) {
            words += ", until " + HumanTime(task["bandwidth_until"].asInt64());
        }
    }
    return words;
}

std::string CheckWindows(const PObject& windows) {
    return FaultOfWindows(windows.asString());
}

std::string CompareWords(const PObject& task) {
    const uint64_t days = task["compare_days"].asUInt64();
    return days == 0 ? "never" : "every " + Count(days, "day");
}

std::string VerifyWords(const PObject& task) {
    const uint64_t days = task["verify_days"].asUInt64();
    return days == 0 ? "never" : "within " + Count(days, "day");
}

std::string BrakeWords(const PObject& task) {
    const uint64_t percent = task["brake"].asUInt64();
    return percent == 0 ? "off"
                        : "asks before more than " + std::to_string(percent) +
                              " % of a copy's files are lost";
}

std::string ScheduleWordsOf(const PObject& task) {
    return task["schedule"].asString();
}

// ---- The table ----

TaskField Text(const char* key, const char* about) {
    return {key, FieldKind::kText, about};
}
TaskField Texts(const char* key, const char* about) {
    return {key, FieldKind::kTexts, about};
}
TaskField Switch(const char* key, const char* about) {
    return {key, FieldKind::kSwitch, about, 0, 1};
}
TaskField Number(const char* key, uint64_t min, uint64_t max, const char* about) {
    return {key, FieldKind::kNumber, about, min, max};
}

std::vector<TaskField> MakeTable() {
    // clang-format off
    return {
        Text("name", "The task's name").Required().Listed().Checked(CheckName),
        Texts("share_list", "The shares, in the order in which they are sent").Required().Listed()
            .Checked(CheckShareNames).Option("--share").Shown("shares"),
        Text("server_name", "The server's name or address").Listed().Leads()
            .Option("-s,--server").Taken(TakeServer).MustBeSaid().Shown("server", ServerOf),
        Text("server_ip", "The server's address, in place of its name").Listed().Leads(),
        Text("user", "Account on the server").Required().Listed().Leads()
            .Option("-u,--user").Shown("user"),
        Text("pswd", "The account's password").Secret(),
        Switch("ssh", "Through an ssh login; counts for a server that is not trusted yet").Leads()
            .Option("--ssh").Shown("transport", TransportOf),
        Number("ssh_port", 1, 65535, "Port of the ssh server; counts with ssh").Leads()
            .Option("--ssh-port", "PORT", "22"),
        Switch("compress", "Compress on the way")
            .Option("--compress").Shown("compress"),
        Switch("block", "Send only the changed blocks of files")
            .Option("--delta").Shown("delta"),
        Number("rsync_timeout", 600, 86400, "Give up when nothing moves for so many seconds")
            .Option("--timeout", "SECONDS", "600").Shown("time-out", TimeoutWords),
        Number("max_bandwidth", 0, kAnyNumber, "Limit in KiB a second (0: none); --bwlimit takes 08:00-18:00=1M,else=0, too")
            .Option("--bwlimit", "RATE").Taken(TakeBandwidth).Shown("bandwidth limit", LimitWords),
        Text("bandwidth_windows", "Other limits at times of the day, 08:00-18:00=1024,20:00-06:00=0")
            .Checked(CheckWindows).Since(8),
        Texts("exclude", "rsync patterns of files that stay behind").Checked(CheckPatterns)
            .Option("--exclude", "PATTERN").Shown("exclude"),
        Number("brake", 0, 99, "Ask before a run loses more percent of a copy's files (0: never ask)")
            .Default(50).Since(4).Option("--brake", "PERCENT", "50").Shown("brake", BrakeWords),

        Number("verify_days", 0, 3650, "Read all files at both ends within so many days (0: never)")
            .Default(30).Since(7).Option("--verify", "DAYS", "30").Taken(TakeDays).Shown("verified", VerifyWords),

        // The schedule; the options for it are in schedule_words.h.
        Number("schedule_mode", 0, 5, "0 manual, 1 on change, 2 weekly, 3 monthly, 4 yearly, 5 once")
            .Listed().Shown("schedule", ScheduleWordsOf),
        Number("compare_days", 0, 3650, "With on change: compare all again after so many days (0: never)")
            .Default(7).Since(5).Option("--compare-every", "DAYS", "7").Taken(TakeDays).Shown("compared", CompareWords),
        Text("week_schd", "Days of the week, Sunday first, 1 for a run day").Checked(CheckWeek),
        Number("schedule_begin_year", 1970, 9999, "Year of its only run"),
        Number("schedule_begin_month", 1, 12, "Month of its yearly or only run"),
        Number("schedule_begin_day", 1, 31, "Day of its monthly, yearly or only run"),
        Number("schedule_begin_hour", 0, 23, "When a day's first run begins"),
        Number("schedule_begin_min", 0, 59, "The minute of that"),
        Number("period_hour", 0, 23, "Hours between a day's runs; counts together with the minutes"),
        Number("period_minute", 0, 24 * 60 - 1, "Minutes between a day's runs"),
        Number("repeat_times_in_day", 0, 95, "Runs of a day after the first"),
    };
    // clang-format on
}

// ---- Faults ----

std::string FaultOfText(const PObject& text) {
    if (!text.isString()) {
        return "must be a text";
    }
    if (text.asString().size() > kMaxWireText) {
        return "is too long: a text has at most 65535 bytes";
    }
    return text.asString().find('\0') == std::string::npos ? "" : "must not hold a zero byte";
}

std::string FaultOfTexts(const PObject& texts) {
    if (!texts.isArray()) {
        return "must be an array of texts";
    }
    for (const PObject& text : texts.asArray()) {
        const std::string fault = FaultOfText(text);
        if (!fault.empty()) {
            return "each of its elements " + fault;
        }
    }
    return "";
}

std::string FaultOfNumber(const TaskField& field, const PObject& number) {
    const uint64_t value = number.asUInt64();
    if (number.isInteger() && ((value >= field.min && value <= field.max) ||
                               value == DefaultSettings()[field.key].asUInt64())) {
        return "";
    }
    return "must be a whole number from " + std::to_string(field.min) + " to " +
           std::to_string(field.max) + (number.isInteger() ? ", not " + std::to_string(value) : "");
}

std::string FaultOfKind(const TaskField& field, const PObject& value) {
    switch (field.kind) {
        case FieldKind::kText:
            return FaultOfText(value);
        case FieldKind::kTexts:
            return FaultOfTexts(value);
        case FieldKind::kNumber:
            return FaultOfNumber(field, value);
        default:
            return value.isInteger() && value.asUInt64() <= 1
                       ? ""
                       : "must be on or off: true or false in a file, 1 or 0 in a request";
    }
}

}  // namespace

TaskField TaskField::Required() const {
    TaskField field = *this;
    field.required = true;
    return field;
}

TaskField TaskField::Secret() const {
    TaskField field = *this;
    field.secret = true;
    return field;
}

TaskField TaskField::Listed() const {
    TaskField field = *this;
    field.listed = true;
    return field;
}

TaskField TaskField::Leads() const {
    TaskField field = *this;
    field.leads = true;
    return field;
}

TaskField TaskField::Since(int store_layout) const {
    TaskField field = *this;
    field.layout = store_layout;
    return field;
}

TaskField TaskField::Default(uint64_t number) const {
    TaskField field = *this;
    field.fallback = number;
    return field;
}

TaskField TaskField::Checked(Check with) const {
    TaskField field = *this;
    field.check = with;
    return field;
}

TaskField TaskField::Option(const char* names, const char* value_word, const char* unless) const {
    TaskField field = *this;
    field.option = names;
    field.value = value_word;
    field.unless_given = unless;
    return field;
}

TaskField TaskField::Taken(Take by) const {
    TaskField field = *this;
    field.take = by;
    return field;
}

TaskField TaskField::MustBeSaid() const {
    TaskField field = *this;
    field.must_be_said = true;
    return field;
}

TaskField TaskField::Shown(const char* as, Words in) const {
    TaskField field = *this;
    field.label = as;
    field.words = in;
    return field;
}

const std::vector<TaskField>& TaskFields() {
    static const std::vector<TaskField> table = MakeTable();
    return table;
}

const TaskField* FindTaskField(const std::string& key) {
    const std::vector<TaskField>& table = TaskFields();
    const auto found = std::find_if(table.begin(), table.end(),
                                    [&](const TaskField& field) { return key == field.key; });
    return found == table.end() ? nullptr : &*found;
}

const PObject& DefaultSettings() {
    static const PObject defaults = [] {
        PObject map(OwnDefaults());
        ZEL::TaskInfo2PObj(ZEL::TaskInfo(), map);
        return map;
    }();
    return defaults;
}

const PObject& OwnDefaults() {
    static const PObject defaults = [] {
        PObject library;
        ZEL::TaskInfo2PObj(ZEL::TaskInfo(), library);
        PObject own;
        own.asMap();
        for (const TaskField& field : TaskFields()) {
            if (std::as_const(library).hasMember(field.key)) {
                continue;
            }
            if (field.kind == FieldKind::kTexts) {
                own[field.key].asArray();
            } else if (field.kind == FieldKind::kText) {
                own[field.key] = "";
            } else {
                own[field.key] = static_cast<unsigned long long>(field.fallback);
            }
        }
        return own;
    }();
    return defaults;
}

std::string FaultOf(const TaskField& field, const PObject& value) {
    std::string fault = FaultOfKind(field, value);
    if (fault.empty() && field.required && value.isEmpty()) {
        fault = "is empty";
    }
    return fault.empty() && field.check != nullptr ? field.check(value) : fault;
}

std::string NameOf(const TaskField& field) {
    const std::string option = field.option == nullptr ? "" : field.option;
    const size_t begin = option.find("--");
    return field.key + (option.empty() ? "" : " (" + option.substr(begin) + ")");
}

std::string DocumentedRow(const TaskField& field) {
    static constexpr const char* kKinds[] = {"string", "array of strings", "0 or 1", "integer"};
    std::string kind = kKinds[static_cast<int>(field.kind)];
    if (field.kind == FieldKind::kNumber) {
        kind += ", " + std::to_string(field.min) + " to " + std::to_string(field.max);
    }
    const std::string option = field.option == nullptr ? "" : field.option;
    return std::string("| `") + field.key + "` | " + kind + " | " +
           (option.empty() ? "" : "`" + option.substr(option.find("--")) + "` ") + "| " +
           field.about + " |";
}

std::string WordsOf(const TaskField& field, const PObject& task) {
    const PObject& value = task[field.key];
    if (field.words != nullptr) {
        return field.words(task);
    }
    if (field.kind == FieldKind::kSwitch) {
        return value.asBool() ? "yes" : "no";
    }
    std::string joined = value.asString();
    for (const std::string& text : TextsOf(value)) {
        joined += (joined.empty() ? "" : ",") + text;
    }
    return joined;
}

std::string ServerOf(const PObject& task) {
    const std::string name = task["server_name"].asString();
    return name.empty() ? task["server_ip"].asString() : name;
}

std::string ServerOf(const ZEL::SyncInfo& info) {
    const std::string name = info.GetServerName();
    return name.empty() ? info.GetServerIP() : name;
}

bool SameAccount(const PObject& task, const PObject& other) {
    return std::all_of(TaskFields().begin(), TaskFields().end(), [&](const TaskField& field) {
        const PObject& a = task[field.key];
        const PObject& b = other[field.key];
        return !field.leads || (a.asUInt64() == b.asUInt64() && a.asString() == b.asString());
    });
}

std::vector<std::string> TextsOf(const PObject& array) {
    std::vector<std::string> texts;
    for (const PObject& text : array.asArray()) {
        texts.push_back(text.asString());
    }
    return texts;
}

}  // namespace programs
