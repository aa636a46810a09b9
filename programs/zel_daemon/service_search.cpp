// The service's search for what changed while nobody watched: one share at a time.
#include <filesystem>
#include <set>

#include "ZEL/log.h"
#include "ZEL/zel.h"
#include "programs/common/share_notes.h"
#include "programs/common/text.h"
#include "programs/zel_daemon/service.h"

namespace zel_daemon {

namespace {

namespace fs = std::filesystem;
using programs::Printable;
using ZEL::Logger;

void Log(Logger::Level level, const char* kind, const std::string& share, const std::string& text) {
    Logger::LogMsg(level, "[%s] zel_daemon(%d): share '%s': %s\n", kind, __LINE__,
                   Printable(share).c_str(), Printable(programs::OneLine(text)).c_str());
}

}  // namespace

IndexPlace Service::IndexesOf(const TaskRecord& record) const {
    return record.IsRealtime()
               ? PlaceOf(indexes_, record.ID(), record.Info().GetSyncInfo(), record.ExcludeRules())
               : IndexPlace();
}

void Service::DropIndexes(uint64_t task_id) {
    if (search_ && search_->Order().task_id == task_id) {
        search_.reset();
    }
    std::error_code error;
    fs::remove_all(indexes_ + "/" + std::to_string(task_id), error);
    if (error) {
        throw programs::Failure("cannot remove " + indexes_ + "/" + std::to_string(task_id) + ": " +
                                error.message());
    }
}

// What a crash has left of tasks that are no more.
void Service::DropLeftIndexes() const {
    std::set<std::string> kept;
    for (const auto& [id, task] : tasks_) {
        kept.insert(std::to_string(id));
    }
    std::error_code ignored;
    for (fs::directory_iterator at(indexes_, ignored), end; !ignored && at != end;
         at.increment(ignored)) {
        if (kept.count(at->path().filename()) == 0) {
            std::error_code stays;
            fs::remove_all(at->path(), stays);
        }
    }
}

// Whoever is not in step with its copy is told so at once; the others are searched in turn, when
// their folders are watched: what changes during the search is notified of. A run of the task has
// to end first: until then nobody knows what the copy has.
void Service::SearchSome() {
    if (search_ && !IsWanted(search_->Order())) {
        search_->Cancel();
    }
    for (auto& [id, task] : tasks_) {
        if (task.machine.ToSearch().empty() || !task.machine.Watches() || task.machine.Running()) {
            continue;
        }
        const std::map<std::string, uint64_t> to_search = task.machine.ToSearch();
        for (const auto& [share, number] : to_search) {
            if (watcher_.Stats(share).scanning) {
                continue;
            }
            uint64_t& searchable = task.searchable[share];
            if (searchable != number && !IsSearchable(task, share)) {
                task.machine.Searched(share, number, std::nullopt);
                continue;
            }
            searchable = number;
            if (!search_) {
                StartSearch(task, share, number);
            }
        }
    }
}

bool Service::IsSearchable(const Task& task, const std::string& share) const {
    const IndexPlace place = IndexesOf(task.machine.Record());
    const std::string file = place.FileOf(share);
    if (!FileIndex::Exists(file)) {
        return false;
    }
    try {
        const std::optional<IndexStamp> stamp = FileIndex(file).Stamp();
        return stamp && IsInStep(*stamp, programs::ReadShareNotes(share), place.settings);
    } catch (const std::exception& error) {
        Log(Logger::LEVEL_WARNING, "WARNING", share,
            "what its copy has cannot be read from " + file + " (" + error.what() +
                "); it is compared whole");
        FileIndex::Remove(file);
        return false;
    }
}

bool Service::IsWanted(const SearchOrder& order) const {
    const auto task = tasks_.find(order.task_id);
    if (task == tasks_.end()) {
        return false;
    }
    const std::map<std::string, uint64_t>& to_search = task->second.machine.ToSearch();
    const auto share = to_search.find(order.share);
    return share != to_search.end() && share->second == order.number &&
           task->second.machine.Watches();
}

void Service::StartSearch(Task& task, const std::string& share, uint64_t number) {
    ForgetSettledProblems(task);
    SearchOrder order;
    order.task_id = task.machine.Record().ID();
    order.share = share;
    order.number = number;
    order.index = IndexesOf(task.machine.Record()).FileOf(share);
    ZEL::ShareInfo facts;
    if (ZEL::GetShareInfo(share, facts) == 0) {
        order.folder = facts.GetModulePath();
    }
    search_ = std::make_unique<IndexSearch>(
        loop_, std::move(order),
        [this](const std::vector<std::string>& paths) {
            if (IsWanted(search_->Order())) {
                TaskMachine& machine = tasks_.at(search_->Order().task_id).machine;
                for (const std::string& path : paths) {
                    machine.Changed(search_->Order().share, path);
                }
                Advance();
            }
        },
        [this](const SearchOutcome& outcome) { EndSearch(outcome); });
}

void Service::EndSearch(const SearchOutcome& outcome) {
    const SearchOrder order = search_->Order();
    search_.reset();
    if (IsWanted(order)) {
        TaskMachine& machine = tasks_.at(order.task_id).machine;
        if (outcome.problem.empty()) {
            Log(Logger::LEVEL_INFO, "INFO", order.share,
                "changed while it was not watched: " + programs::Count(outcome.changes, "path"));
            machine.Searched(order.share, order.number, outcome.compared);
        } else {
            Log(Logger::LEVEL_WARNING, "WARNING", order.share,
                outcome.problem + "; it is compared whole");
            machine.Searched(order.share, order.number, std::nullopt);
        }
    }
    Advance();
}

}  // namespace zel_daemon
