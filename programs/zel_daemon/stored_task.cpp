#include "programs/zel_daemon/stored_task.h"

#include <iterator>
#include <nlohmann/json.hpp>

#include "base/utf8.h"
#include "programs/common/task_fields.h"

namespace zel_daemon {

namespace {

using nlohmann::json;
using ZEL::PObject;

using Bytes = std::vector<unsigned char>;

// Columns beside those of the settings, which are named like the settings' keys.
constexpr const char* kOwnColumns[] = {"paused", "checked_until", "compared"};

// A list as a JSON array. An element that is no text, which JSON cannot hold, is an array of its
// bytes.
std::string ToJson(const PObject& strings) {
    json list = json::array();
    for (const std::string& string : programs::TextsOf(strings)) {
        list.push_back(base::IsUtf8(string) ? json(string)
                                            : json(Bytes(string.begin(), string.end())));
    }
    return list.dump();
}

PObject FromJson(const std::string& text) {
    PObject strings;
    strings.asArray();
    for (const json& item : json::parse(text).get<std::vector<json>>()) {
        if (item.is_array()) {
            const Bytes bytes = item.get<Bytes>();
            strings.asArray().emplace_back(std::string(bytes.begin(), bytes.end()));
        } else {
            strings.asArray().emplace_back(item.get<std::string>());
        }
    }
    return strings;
}

std::string Repeat(const std::string& separator, const char* (*text)(const char* column)) {
    std::string all;
    for (const programs::TaskField& field : programs::TaskFields()) {
        all += text(field.key) + separator;
    }
    for (const char* const column : kOwnColumns) {
        all += text(column) + (column == std::end(kOwnColumns)[-1] ? "" : separator);
    }
    return all;
}

}  // namespace

std::string TaskColumns() {
    return Repeat(", ", [](const char* column) { return column; });
}

std::string TaskParameters() {
    return Repeat(", ", [](const char*) { return "?"; });
}

void BindTask(Query& query, const TaskRecord& record) {
    const PObject settings = record.ToMap();
    for (const programs::TaskField& field : programs::TaskFields()) {
        const PObject& value = settings[field.key];
        if (field.kind == programs::FieldKind::kTexts) {
            query.Bind(ToJson(value));
        } else if (field.kind == programs::FieldKind::kText) {
            query.Bind(value.asString());
        } else {
            query.Bind(value.asInt64());
        }
    }
    query.Bind(record.paused);
    query.Bind(record.checked_until);
    query.Bind(record.compared);
}

TaskRecord ReadTask(Query& query) {
    const uint64_t id = static_cast<uint64_t>(query.Number());
    PObject settings;
    for (const programs::TaskField& field : programs::TaskFields()) {
        PObject& value = settings[field.key];
        if (field.kind == programs::FieldKind::kTexts) {
            try {
                value = FromJson(query.Text());
            } catch (const json::exception& error) {
                throw RowError("the lists of task " + std::to_string(id) +
                               " cannot be read: " + error.what());
            }
        } else if (field.kind == programs::FieldKind::kText) {
            value = query.Text();
        } else {
            value = query.Number();
        }
    }
    TaskRecord record;
    record.SetMap(settings);
    record.task.SetID(id);
    record.paused = query.Number() != 0;
    record.checked_until = query.Number();
    record.compared = query.Number();
    return record;
}

}  // namespace zel_daemon
