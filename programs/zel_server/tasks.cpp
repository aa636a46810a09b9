#include "programs/zel_server/tasks.h"

#include <algorithm>
#include <ctime>
#include <limits>

#include "base/text.h"
#include "programs/common/server_status.h"
#include "programs/zel_server/registry.h"

namespace zel_server {

namespace {

using namespace programs;

constexpr char kPrefix[] = "TASK_";
constexpr size_t kPrefixLength = sizeof kPrefix - 1;
constexpr char kStatus[] = "status";  // the library's: "idle", or when it was alive
constexpr char kLastTime[] = "LastTime";
constexpr char kSweep[] = "TaskSweep";  // its LastTime: when expired states were last removed

constexpr int64_t kSweepSeconds = int64_t{24} * 60 * 60;
// Each removal rewrites the whole file while a client waits; the rest is left for the next command.
constexpr size_t kMostRemovals = 64;

std::optional<uint64_t> TimeIn(Section& section, const char* key) {
    return base::ParseNumber(section[key], std::numeric_limits<int64_t>::max());
}

// Entries of earlier versions have no LastTime, and are no longer renewed. A time in the future,
// from a wrong clock, does not expire.
bool IsForgotten(const std::string& name, int64_t now) {
    Section section;
    if (name.compare(0, kPrefixLength, kPrefix) != 0 ||
        ReadSection(name, section) != ReadResult::kRead) {
        return false;
    }
    const auto renewed = TimeIn(section, section.count(kLastTime) != 0 ? kLastTime : kStatus);
    return !renewed || now - static_cast<int64_t>(*renewed) > kTaskKeptSeconds;
}

bool IsSweepDue(int64_t now) {
    Section sweep;
    if (ReadSection(kSweep, sweep) == ReadResult::kFailed) {
        return false;
    }
    const auto last = TimeIn(sweep, kLastTime);
    return !last || static_cast<int64_t>(*last) > now ||
           now - static_cast<int64_t>(*last) > kSweepSeconds;
}

// Failures are ignored: what is left is removed another day.
void RemoveForgotten(int64_t now) {
    if (!IsSweepDue(now)) {
        return;
    }
    size_t removed = 0;
    for (const std::string& name : SectionNames().value_or(std::vector<std::string>())) {
        if (IsForgotten(name, now)) {
            if (removed == kMostRemovals || !RemoveSection(name)) {
                return;
            }
            ++removed;
        }
    }
    WriteSection(kSweep, {{kLastTime, std::to_string(now)}});
}

// The account in TASK_<client>/<account>/<task>; empty for a name of another form.
std::string AccountIn(const std::string& name) {
    const size_t begin = name.find('/');
    const size_t end = begin == std::string::npos ? begin : name.find('/', begin + 1);
    return end == std::string::npos ? "" : name.substr(begin + 1, end - begin - 1);
}

size_t TasksOf(const std::string& account, const std::vector<std::string>& sections) {
    return static_cast<size_t>(
        std::count_if(sections.begin(), sections.end(), [&](const std::string& name) {
            return name.compare(0, kPrefixLength, kPrefix) == 0 && AccountIn(name) == account;
        }));
}

}  // namespace

int RecordTask(const std::string& client, const std::string& account, const std::string& task,
               bool alive) {
    const int64_t now = time(nullptr);
    RemoveForgotten(now);
    const std::string name = kPrefix + client + "/" + account + "/" + task;
    Section section;
    const ReadResult read = ReadSection(name, section);
    if (read == ReadResult::kFailed) {
        return kRegistryRead;
    }
    if (read == ReadResult::kMissing) {
        const auto sections = SectionNames();
        if (!sections) {
            return kRegistryRead;
        }
        if (TasksOf(account, *sections) >= kMaxAccountTasks) {
            return kTooManyTasks;
        }
    }
    const std::string time = std::to_string(now);
    return WriteSection(name, {{kStatus, alive ? time : "idle"}, {kLastTime, time}})
               ? kDone
               : kRegistryWrite;
}

}  // namespace zel_server
