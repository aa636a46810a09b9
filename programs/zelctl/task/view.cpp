#include "programs/zelctl/task/view.h"

#include <algorithm>
#include <cstdio>
#include <iterator>
#include <nlohmann/json.hpp>

#include "programs/common/json_text.h"
#include "programs/common/run_progress.h"
#include "programs/common/table.h"
#include "programs/common/task_fields.h"
#include "programs/common/text.h"

namespace zelctl {

namespace {

using nlohmann::ordered_json;
using programs::HumanTime;
using programs::Table;
using ZEL::PObject;

std::string TimeOf(const PObject& moment, const char* otherwise) {
    return moment.isInteger() ? HumanTime(moment.asInt64()) : otherwise;
}

/// Output about one item: a line for each fact, or JSON.
class Facts {
public:
    void Add(const char* what, const std::string& value) {
        if (!value.empty()) {
            lines_.emplace_back(what, value);
        }
    }
    void Print() const {
        size_t width = 0;
        for (const auto& line : lines_) {
            width = std::max(width, line.first.size());
        }
        for (const auto& [what, value] : lines_) {
            printf("%-*s  %s\n", static_cast<int>(width), what.c_str(),
                   programs::Printable(value).c_str());
        }
    }

private:
    std::vector<std::pair<std::string, std::string>> lines_;
};

// The daemon's keys unchanged, with words added for its numbers.
ordered_json TaskJson(const PObject& task) {
    ordered_json json = ToJson(task);
    json.erase("pswd");  // never shown, even if the daemon sent it
    json.erase("row");   // the same data in compact form
    json["state"] = programs::TaskStatusWord(task["status"].asInt32());
    json["result"] = programs::TaskResultWord(task["sync_result"].asInt32());
    return json;
}

ordered_json ListJson(const PObject::Array& list, ordered_json (*to_json)(const PObject&)) {
    ordered_json array = ordered_json::array();
    for (const PObject& element : list) {
        array.push_back(to_json(element));
    }
    return array;
}

// Line by line, as text from outside may contain anything else.
void PrintIndented(const std::string& text) {
    for (size_t begin = 0; begin < text.size();) {
        const size_t end = std::min(text.find('\n', begin), text.size());
        printf("    %s\n", programs::Printable(text.substr(begin, end - begin)).c_str());
        begin = end + 1;
    }
}

// What would be lost, of one share; the sentence about it is the task's note.
void PrintQuestion(const PObject& question) {
    const PObject::Array& list = question["list"].asArray();
    const uint64_t amount = question["amount"].asUInt64();
    if (!list.empty()) {
        printf("\n%s:\n", programs::Printable(question["share"].asString()).c_str());
    }
    for (const PObject& line : list) {
        printf("    %s\n", programs::Printable(line.asString()).c_str());
    }
    if (amount > list.size() && !list.empty()) {
        printf("    ... and %llu more\n", static_cast<unsigned long long>(amount - list.size()));
    }
}

// The files of a task with other bytes at the two ends.
void PrintDamage(const PObject::Array& files) {
    if (!files.empty()) {
        printf("\nDamaged at one of the two ends:\n");
    }
    for (const PObject& file : files) {
        printf("    %s: %s (%s)\n", programs::Printable(file["share"].asString()).c_str(),
               programs::Printable(file["path"].asString()).c_str(),
               programs::HumanBytes(file["length"].asUInt64()).c_str());
    }
}

ordered_json RunJson(const PObject& run) {
    ordered_json json = ToJson(run);
    json["result"] =
        run["end"].isInteger() ? programs::TaskResultWord(run["sync_result"].asInt32()) : "running";
    return json;
}

}  // namespace

programs::TaskRow RowOf(const PObject& task) {
    programs::TaskRow row;
    programs::UnpackTaskRow(task["row"].asString(), row);
    return row;
}

std::vector<std::string> TaskLines(const PObject::Array& tasks) {
    std::vector<programs::TaskRow> rows;
    rows.reserve(tasks.size());
    std::transform(tasks.begin(), tasks.end(), std::back_inserter(rows), RowOf);
    return programs::TaskLines(std::move(rows), programs::OutputWidth());
}

void PrintTasks(const PObject::Array& tasks) {
    PrintJson(ListJson(tasks, TaskJson));
}

void PrintTask(const PObject& task, bool as_json) {
    if (as_json) {
        PrintJson(TaskJson(task));
        return;
    }
    Facts facts;
    facts.Add("name", task["name"].asString());
    facts.Add("id", std::to_string(task["id"].asUInt64()));
    for (const programs::TaskField& field : programs::TaskFields()) {
        if (field.label != nullptr) {
            facts.Add(field.label, WordsOf(field, task));
        }
    }
    facts.Add("next run", TimeOf(task["next_run"], "-"));
    facts.Add("state", programs::TaskStateWords(RowOf(task)));
    if (task["progress_share"].isString()) {
        facts.Add("progress", task["progress_share"].asString() + ": " +
                                  programs::ProgressWords(programs::ProgressOf(task)));
    }
    facts.Add("last run", programs::TaskLastRunWords(RowOf(task)));
    facts.Add("last compared", TimeOf(task["last_compared"], "not yet"));
    facts.Add("last verified", TimeOf(task["last_verified"], "not yet"));
    facts.Add("verified up to", task["verify_place"].asString());
    facts.Add("not verified", programs::OneLine(task["verify_problem"].asString()));
    facts.Add("error", programs::OneLine(task["last_error"].asString()));
    facts.Add("pending changes", std::to_string(task["pending"].asUInt64()));
    facts.Add("note", task["note"].asString());
    facts.Print();
    for (const PObject& question : task["confirm"].asArray()) {
        PrintQuestion(question);
    }
    PrintDamage(task["damage"].asArray());
}

void PrintRuns(const PObject::Array& runs, bool as_json) {
    if (as_json) {
        PrintJson(ListJson(runs, RunJson));
        return;
    }
    Table table({"RUN", "START", "TOOK", "RESULT", "REASON", "FILES", "DELETED", "SENT", "ERROR"});
    for (const PObject& run : runs) {
        const bool ended = run["end"].isInteger();
        const int64_t took = run["end"].asInt64() - run["start"].asInt64();
        table.Add(
            {std::to_string(run["run"].asUInt64()), HumanTime(run["start"].asInt64()),
             ended ? programs::HumanDuration(took < 0 ? 0 : static_cast<uint64_t>(took)) : "-",
             ended ? programs::TaskResultWord(run["sync_result"].asInt32()) : "running",
             run["reason"].asString(), std::to_string(run["files_sent"].asUInt64()),
             std::to_string(run["files_deleted"].asUInt64()),
             programs::HumanBytes(run["bytes_sent"].asUInt64()),
             programs::OneLine(run["error"].asString())});
    }
    table.Print(false);
    for (const PObject& run : runs) {
        if (run["details"].isString()) {
            printf("\nRun %llu:\n", run["run"].asUInt64());
            PrintIndented(run["details"].asString());
        }
    }
}

void PrintDaemonStatus(const PObject& status, bool as_json) {
    if (as_json) {
        ordered_json json = ToJson(status);
        json.erase("result");
        PrintJson(json);
        return;
    }
    Facts facts;
    facts.Add("version", status["version"].asString());
    facts.Add("process", std::to_string(status["pid"].asUInt64()));
    facts.Add("started", TimeOf(status["started"], "-"));
    facts.Add("tasks", std::to_string(status["tasks"].asUInt64()) + ", " +
                           std::to_string(status["running"].asUInt64()) + " running (" +
                           programs::Count(status["workers"].asUInt64(), "worker") + ")");
    if (const uint64_t damaged = status["damaged"].asUInt64()) {
        facts.Add("damaged", programs::Count(damaged, "file") +
                                 " with other bytes at the two ends: zelctl task list says whose");
    }
    facts.Add("watching", programs::Count(status["folders"].asUInt64(), "folder") +
                              (status["searching"].asBool() ? ", still searching" : ""));
    facts.Add("store", status["store"].asString());
    facts.Print();
}

ordered_json ToJson(const PObject& value) {
    if (value.isMap()) {
        ordered_json object = ordered_json::object();
        for (const auto& [key, element] : value.asMap()) {
            object[key] = ToJson(element);
        }
        return object;
    }
    if (value.isArray()) {
        return ListJson(value.asArray(), ToJson);
    }
    if (value.isString()) {
        return value.asString();
    }
    return value.isInteger() ? ordered_json(value.asInt64()) : ordered_json();
}

void PrintJson(const ordered_json& json) {
    puts(programs::JsonText(json).c_str());
}

}  // namespace zelctl
