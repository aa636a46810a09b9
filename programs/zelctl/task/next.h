#pragma once

#include <string>

#include "ZEL/pobject.h"
#include "ZEL/sync_obj.h"

namespace zelctl {

struct NextOptions {
    ZEL::PObject said;  ///< settings of the schedule, by key
    unsigned int count = 5;
    std::string from;  ///< "YYYY-MM-DD HH:MM"; empty: now
    bool as_json = false;
};

/// Prints the next runs of the schedule.
void ShowNextRuns(const NextOptions& options);

/// Prints the next runs of a task, at most `count`, or why there are none. `name` must be
/// printable.
void ShowNextRuns(const ZEL::Schedule& schedule, const std::string& name, unsigned int count,
                  bool as_json);

}  // namespace zelctl
