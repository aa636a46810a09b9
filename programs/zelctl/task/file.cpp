#include "programs/zelctl/task/file.h"

#include <climits>
#include <nlohmann/json.hpp>
#include <set>

#include "programs/common/text.h"

namespace zelctl {

namespace {

using nlohmann::ordered_json;
using ZEL::PObject;

constexpr char kFormat[] = "zelctl tasks";
constexpr int kVersion = 1;
constexpr size_t kMaxText = 65535;  // bytes; what a request to the daemon can carry

enum class Kind { kText, kTexts, kSwitch, kNumber };

struct Field {
    const char* key;
    Kind kind;
    uint64_t min = 0;  // of a number
    uint64_t max = 0;
};

constexpr Field kFields[] = {{"name", Kind::kText},
                             {"share_list", Kind::kTexts},
                             {"server_name", Kind::kText},
                             {"server_ip", Kind::kText},
                             {"user", Kind::kText},
                             {"pswd", Kind::kText},
                             {"ssh", Kind::kSwitch},
                             {"ssh_port", Kind::kNumber, 0, 65535},
                             {"compress", Kind::kSwitch},
                             {"block", Kind::kSwitch},
                             {"rsync_timeout", Kind::kNumber, 600, 86400},
                             {"max_bandwidth", Kind::kNumber, 0, UINT32_MAX},
                             {"exclude", Kind::kTexts},
                             {"schedule_mode", Kind::kNumber, 0, 5},
                             {"week_schd", Kind::kText},
                             {"schedule_begin_year", Kind::kNumber, 1970, 9999},
                             {"schedule_begin_month", Kind::kNumber, 1, 12},
                             {"schedule_begin_day", Kind::kNumber, 1, 31},
                             {"schedule_begin_hour", Kind::kNumber, 0, 23},
                             {"schedule_begin_min", Kind::kNumber, 0, 59},
                             {"period_hour", Kind::kNumber, 0, 23},
                             {"period_minute", Kind::kNumber, 0, 59},
                             {"repeat_times_in_day", Kind::kNumber, 0, 95}};

const Field* FindField(const std::string& key) {
    for (const Field& field : kFields) {
        if (key == field.key) {
            return &field;
        }
    }
    return nullptr;
}

ordered_json ValueToJson(const Field& field, const PObject& value) {
    switch (field.kind) {
        case Kind::kText:
            return value.asString();
        case Kind::kSwitch:
            return value.asBool();
        case Kind::kNumber:
            return value.asInt64();
        default: {
            ordered_json texts = ordered_json::array();
            for (const PObject& text : value.asArray()) {
                texts.push_back(text.asString());
            }
            return texts;
        }
    }
}

// What is wrong with a text; empty when nothing is.
std::string FaultOfText(const ordered_json& json) {
    if (!json.is_string()) {
        return "must be a text";
    }
    const auto& text = json.get_ref<const std::string&>();
    if (text.size() > kMaxText) {
        return "is too long: a text has at most 65535 bytes";
    }
    return text.find('\0') == std::string::npos ? "" : "must not hold a zero byte";
}

// Takes a value over; what is wrong with it, or nothing.
std::string TakeValue(const Field& field, const ordered_json& json, PObject& value) {
    std::string fault;
    switch (field.kind) {
        case Kind::kText:
            fault = FaultOfText(json);
            if (fault.empty()) {
                value = json.get<std::string>();
            }
            break;
        case Kind::kSwitch:
            if (!json.is_boolean()) {
                return "must be true or false";
            }
            value = json.get<bool>();
            break;
        case Kind::kNumber:
            if (!json.is_number_unsigned() || json.get<uint64_t>() < field.min ||
                json.get<uint64_t>() > field.max) {
                return "must be a whole number from " + std::to_string(field.min) + " to " +
                       std::to_string(field.max);
            }
            value = json.get<uint64_t>();
            break;
        case Kind::kTexts:
            if (!json.is_array()) {
                return "must be an array of texts";
            }
            value.asArray();
            for (const ordered_json& element : json) {
                fault = FaultOfText(element);
                if (!fault.empty()) {
                    return "each of its elements " + fault;
                }
                value.asArray().emplace_back(element.get<std::string>());
            }
            break;
    }
    return fault;
}

/// Reads one task and gathers what is wrong with it.
class TaskReader {
public:
    TaskReader(size_t index, std::vector<std::string>& faults)
        : place_("tasks[" + std::to_string(index) + "]"), faults_(faults) {}

    PObject Read(const ordered_json& json) {
        PObject task;
        if (!json.is_object()) {
            Fault("", "must be an object");
            return task;
        }
        if (json.contains("name") && json["name"].is_string()) {
            place_ += " ('" + programs::Printable(json["name"].get<std::string>()) + "')";
        }
        for (const auto& [key, value] : json.items()) {
            const Field* const field = FindField(key);
            if (field == nullptr) {
                Fault(key, "is no key of a task");
                continue;
            }
            const std::string fault = TakeValue(*field, value, task[key]);
            if (!fault.empty()) {
                Fault(key, fault);
            }
        }
        const PObject& taken = task;
        for (const char* key : {"name", "share_list", "user"}) {
            if (!json.contains(key)) {
                Fault(key, "is missing");
            } else if (taken[key].isEmpty()) {
                Fault(key, "is empty");
            }
        }
        if (taken["server_name"].isEmpty() && taken["server_ip"].isEmpty()) {
            Fault("server_name", "is missing, and so is server_ip");
        }
        CheckWeek(taken["week_schd"]);
        return task;
    }

private:
    void Fault(const std::string& key, const std::string& fault) {
        faults_.push_back(place_ + ": " + (key.empty() ? "" : programs::Printable(key) + " ") +
                          fault);
    }
    void CheckWeek(const PObject& week) {
        const std::string days = week.asString();
        if (week.isString() && (days.size() != 7 || days == "0000000" ||
                                days.find_first_not_of("01") != std::string::npos)) {
            Fault("week_schd", "must be seven digits 0 or 1, Sunday first, at least one 1");
        }
    }

    std::string place_;
    std::vector<std::string>& faults_;
};

}  // namespace

std::string WriteTaskFile(const PObject::Array& tasks, bool with_passwords) {
    ordered_json file;
    file["format"] = kFormat;
    file["version"] = kVersion;
    file["tasks"] = ordered_json::array();
    for (const PObject& task : tasks) {
        ordered_json json = ordered_json::object();
        for (const Field& field : kFields) {
            const bool is_password = std::string("pswd") == field.key;
            if (task.hasMember(field.key) && (with_passwords || !is_password)) {
                json[field.key] = ValueToJson(field, task[field.key]);
            }
        }
        file["tasks"].push_back(std::move(json));
    }
    return file.dump(2, ' ', false, ordered_json::error_handler_t::replace) + "\n";
}

TaskFile ReadTaskFile(const std::string& text) {
    TaskFile file;
    ordered_json json;
    try {
        json = ordered_json::parse(text);
    } catch (const ordered_json::parse_error& error) {
        const auto line = std::count(
            text.begin(),
            text.begin() + static_cast<std::ptrdiff_t>(std::min(error.byte, text.size())), '\n');
        file.faults.push_back("line " + std::to_string(line + 1) + " is no JSON");
        return file;
    }
    if (!json.is_object() || json.value("format", ordered_json()) != kFormat) {
        file.faults.push_back("the file was not written by 'zelctl export': its format is not '" +
                              std::string(kFormat) + "'");
        return file;
    }
    if (json.value("version", ordered_json()) != kVersion) {
        file.faults.push_back("its version is not 1: it is from a newer zelctl");
        return file;
    }
    const auto tasks = json.find("tasks");
    if (tasks == json.end() || !tasks->is_array()) {
        file.faults.push_back("tasks must be an array");
        return file;
    }
    std::set<std::string> names;
    for (size_t i = 0; i < tasks->size(); ++i) {
        file.tasks.push_back(TaskReader(i, file.faults).Read((*tasks)[i]));
        const PObject& task = file.tasks.back();
        if (task["name"].isString() && !names.insert(task["name"].asString()).second) {
            file.faults.push_back("tasks[" + std::to_string(i) + "]: a task before has the name '" +
                                  programs::Printable(task["name"].asString()) + "' already");
        }
    }
    return file;
}

}  // namespace zelctl
