#include "programs/zel_daemon/stored_task.h"

#include <nlohmann/json.hpp>
#include <utility>

#include "base/utf8.h"

namespace zel_daemon {

namespace {

using nlohmann::json;
using ZEL::PObject;

using Bytes = std::vector<unsigned char>;

constexpr char kShareList[] = "share_list";
constexpr char kExclude[] = "exclude";
constexpr char kPaused[] = "paused";
constexpr char kCheckedUntil[] = "checked_until";

// A row is the task's map with the daemon's own keys beside it.
constexpr const char* kColumns[] = {
    "name",
    kShareList,
    "user",
    "pswd",
    "server_ip",
    "server_name",
    "compress",
    "block",
    "ssh",
    "ssh_port",
    "max_bandwidth",
    "rsync_timeout",
    "schedule_mode",
    "week_schd",
    "repeat_times_in_day",
    "period_hour",
    "period_minute",
    "schedule_begin_year",
    "schedule_begin_month",
    "schedule_begin_day",
    "schedule_begin_hour",
    "schedule_begin_min",
    kExclude,
    kPaused,
    kCheckedUntil,
};

// A list as a JSON array. An element that is no text, which JSON cannot hold, is an array of its
// bytes.
template <typename Strings>
std::string ToJson(const Strings& strings) {
    json list = json::array();
    for (const std::string& string : strings) {
        list.push_back(base::IsUtf8(string) ? json(string)
                                            : json(Bytes(string.begin(), string.end())));
    }
    return list.dump();
}

template <typename Strings>
Strings FromJson(const std::string& text) {
    Strings strings;
    for (const json& item : json::parse(text).get<std::vector<json>>()) {
        if (item.is_array()) {
            const Bytes bytes = item.get<Bytes>();
            strings.emplace_back(std::string(bytes.begin(), bytes.end()));
        } else {
            strings.emplace_back(item.get<std::string>());
        }
    }
    return strings;
}

std::string Repeat(const std::string& separator, const char* (*text)(const char* column)) {
    std::string all;
    for (const char* const column : kColumns) {
        all += (all.empty() ? "" : separator) + text(column);
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
    PObject row;
    ZEL::TaskInfo2PObj(record.Info(), row);
    row[kShareList] = ToJson(record.Info().GetShareList());
    row[kExclude] = ToJson(record.excludes);
    row[kPaused] = record.paused;
    row[kCheckedUntil] = record.checked_until;
    for (const char* const column : kColumns) {
        const PObject& value = std::as_const(row)[column];
        if (value.isString()) {
            query.Bind(value.asString());
        } else {
            query.Bind(value.asInt64());
        }
    }
}

TaskRecord ReadTask(Query& query) {
    PObject row;
    const uint64_t id = static_cast<uint64_t>(query.Number());
    for (const char* const column : kColumns) {
        if (query.NextIsNumber()) {
            row[column] = query.Number();
        } else {
            row[column] = query.Text();
        }
    }
    TaskRecord record;
    try {
        row[kShareList] = FromJson<PObject::Array>(row[kShareList].asString());
        record.excludes = FromJson<std::vector<std::string>>(row[kExclude].asString());
    } catch (const json::exception& error) {
        throw RowError("the lists of task " + std::to_string(id) +
                       " cannot be read: " + error.what());
    }
    ZEL::PObj2SyncTask(row, record.task);
    record.task.SetID(id);
    record.paused = row[kPaused].asBool();
    record.checked_until = row[kCheckedUntil].asInt64();
    return record;
}

}  // namespace zel_daemon
