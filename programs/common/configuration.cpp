#include "programs/common/configuration.h"

#include <algorithm>
#include <nlohmann/json.hpp>
#include <set>
#include <utility>

#include "base/utf8.h"
#include "programs/common/failure.h"
#include "programs/common/json_text.h"
#include "programs/common/task_fields.h"
#include "programs/common/task_settings.h"
#include "programs/common/text.h"

namespace programs {

namespace {

using nlohmann::ordered_json;
using ZEL::PObject;

constexpr char kFormat[] = "zelctl tasks";
constexpr int kVersion = 1;

ordered_json ToJson(const TaskField& field, const PObject& value) {
    switch (field.kind) {
        case FieldKind::kText:
            return value.asString();
        case FieldKind::kTexts:
            return TextsOf(value);
        case FieldKind::kSwitch:
            return value.asBool();
        default:
            return value.asInt64();
    }
}

// Null when the JSON value is not of the setting's kind.
PObject FromJson(const TaskField& field, const ordered_json& json) {
    if (field.kind == FieldKind::kSwitch) {
        return json.is_boolean() ? PObject(json.get<bool>()) : PObject();
    }
    if (json.is_number_unsigned()) {
        return PObject(json.get<unsigned long long>());
    }
    if (json.is_string()) {
        return PObject(json.get<std::string>());
    }
    PObject texts;
    if (json.is_array()) {
        for (const ordered_json& element : json) {
            texts.asArray().push_back(FromJson(field, element));
        }
        texts.asArray();
    }
    return texts;
}

/// Reads one task, and collects what is wrong with it.
class TaskReader {
public:
    TaskReader(size_t index, std::vector<std::string>& faults)
        : place_("tasks[" + std::to_string(index) + "]"), faults_(faults), before_(faults.size()) {}

    PObject Read(const ordered_json& json) {
        PObject task;
        if (!json.is_object()) {
            Fault("", "must be an object");
            return task;
        }
        if (json.contains("name") && json["name"].is_string()) {
            place_ += " ('" + Printable(json["name"].get<std::string>()) + "')";
        }
        for (const auto& [key, value] : json.items()) {
            const TaskField* const field = FindTaskField(key);
            if (field == nullptr) {
                Fault(key, "is no key of a task");
                continue;
            }
            task[key] = FromJson(*field, value);
            const std::string fault = FaultOf(*field, std::as_const(task)[key]);
            if (!fault.empty()) {
                Fault(key, fault);
            }
        }
        CheckWhole(task);
        return task;
    }

private:
    void Fault(const std::string& key, const std::string& fault) {
        faults_.push_back(place_ + ": " + (key.empty() ? "" : Printable(key) + " ") + fault);
    }
    // Checks across settings, once each value by itself is valid.
    void CheckWhole(const PObject& task) {
        if (faults_.size() == before_) {
            try {
                TaskSettings().Apply(task);
            } catch (const Failure& failure) {
                Fault("", failure.what());
            }
        }
    }

    std::string place_;
    std::vector<std::string>& faults_;
    size_t before_;  // number of faults of earlier tasks
};

void ReadShare(const ordered_json& json, size_t index, Configuration& file) {
    ListedShare share;
    const auto take = [&](const char* key, auto& value) {
        const auto found = json.is_object() ? json.find(key) : json.end();
        if (!json.is_object() || found == json.end()) {
            return;
        }
        try {
            value = found->template get<std::decay_t<decltype(value)>>();
        } catch (const ordered_json::exception&) {
            file.faults.push_back("shares[" + std::to_string(index) + "]: " + key +
                                  " is of the wrong kind");
        }
    };
    take("name", share.name);
    take("folder", share.folder);
    take("volume", share.volume);
    take("acl", share.acl);
    take("windows", share.windows);
    take("encrypted", share.encrypted);
    const bool is_text = (share.name + share.folder + share.volume).find('\0') == std::string::npos;
    if (share.name.empty() || share.folder.empty() || share.folder.front() != '/' || !is_text) {
        file.faults.push_back("shares[" + std::to_string(index) +
                              "]: must have a name, and a folder that is an absolute path");
    }
    file.shares.push_back(std::move(share));
}

}  // namespace

std::string WriteConfiguration(const PObject::Array& tasks, const std::vector<ListedShare>& shares,
                               bool with_passwords) {
    ordered_json file;
    file["format"] = kFormat;
    file["version"] = kVersion;
    file["tasks"] = ordered_json::array();
    for (const PObject& task : tasks) {
        ordered_json json = ordered_json::object();
        for (const TaskField& field : TaskFields()) {
            if (task.hasMember(field.key) && (with_passwords || !field.secret)) {
                json[field.key] = ToJson(field, task[field.key]);
            }
        }
        file["tasks"].push_back(std::move(json));
    }
    file["shares"] = ordered_json::array();
    for (const ListedShare& share : shares) {
        if (base::IsUtf8(share.name) && base::IsUtf8(share.folder) && base::IsUtf8(share.volume)) {
            file["shares"].push_back({{"name", share.name},
                                      {"folder", share.folder},
                                      {"volume", share.volume},
                                      {"acl", share.acl},
                                      {"windows", share.windows},
                                      {"encrypted", share.encrypted}});
        }
    }
    return JsonText(file) + "\n";
}

Configuration ReadConfiguration(const std::string& text) {
    Configuration file;
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
                                  Printable(task["name"].asString()) + "' already");
        }
    }
    for (size_t i = 0; json.contains("shares") && i < json["shares"].size(); ++i) {
        ReadShare(json["shares"][i], i, file);
    }
    return file;
}

}  // namespace programs
