#include "programs/zelctl/task/next.h"

#include <algorithm>
#include <cstdio>
#include <ctime>

#include "programs/common/failure.h"
#include "programs/common/schedule_words.h"
#include "programs/common/table.h"
#include "programs/common/task_settings.h"
#include "programs/common/text.h"
#include "programs/zelctl/base/moment.h"

namespace zelctl {

namespace {

using programs::Failure;
using programs::FailureKind;

// What to say about a schedule without runs after the given moment; empty when it has some.
std::string WithoutRuns(const ZEL::Schedule& schedule, const std::string& name, long after) {
    switch (schedule.GetMode()) {
        case ZEL::SCHD_MODE_MANUAL:
            return "It runs when you ask for it" +
                   (name.empty() ? "." : ": zelctl task run " + name);
        case ZEL::SCHD_MODE_REALTIME:
            return "It runs whenever something changes in its shares.";
        default:
            return schedule.GetNextScheduledSeconds(after) == 0
                       ? "Its schedule is over: no further run will come."
                       : "";
    }
}

void Show(const ZEL::Schedule& schedule, const std::string& name, long after, unsigned int count,
          bool as_json) {
    const std::string words = WithoutRuns(schedule, name, after);
    if (!words.empty() && !as_json) {
        puts(words.c_str());
        return;
    }
    programs::Table table(as_json ? std::vector<programs::Column>{"NEXT RUN", "SECONDS"}
                                  : std::vector<programs::Column>{"NEXT RUN"});
    long moment = after;
    for (unsigned int i = 0; i < count && words.empty(); ++i) {
        moment = schedule.GetNextScheduledSeconds(moment);
        if (moment < 0) {
            throw Failure("the next run cannot be computed (see the system log)");
        }
        if (moment == 0) {
            break;  // no further run
        }
        std::vector<std::string> row = {programs::HumanTime(moment)};
        if (as_json) {
            row.push_back(std::to_string(moment));
        }
        table.Add(std::move(row));
    }
    table.Print(as_json);
}

}  // namespace

void ShowNextRuns(const NextOptions& options) {
    const ZEL::Schedule schedule = programs::ScheduleFrom(options.said);
    if (!options.said.hasMember("schedule_mode")) {
        throw Failure(FailureKind::kUsage,
                      "say when it runs, as for 'zelctl task add': --weekly daily --at 02:00");
    }
    const auto moment =
        options.from.empty() ? std::optional<int64_t>(time(nullptr)) : ParseMoment(options.from);
    if (!moment) {
        throw Failure(FailureKind::kUsage, "--from: '" + programs::Printable(options.from) +
                                               "' is not a moment 'YYYY-MM-DD HH:MM'");
    }
    Show(schedule, "", static_cast<long>(*moment), options.count, options.as_json);
}

void ShowNextRuns(const ZEL::Schedule& schedule, const std::string& name, unsigned int count,
                  bool as_json) {
    Show(schedule, name, time(nullptr), count, as_json);
}

}  // namespace zelctl
