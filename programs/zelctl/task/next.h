#pragma once

#include <string>

#include "ZEL/pobject.h"
#include "ZEL/sync_obj.h"

namespace zelctl {

struct NextOptions {
    ZEL::PObject said;  ///< of a schedule, by the keys of a task's settings
    unsigned int count = 5;
    std::string from;  ///< "YYYY-MM-DD HH:MM"; empty: now
    bool as_json = false;
};

/// Prints the next runs of the schedule.
void ShowNextRuns(const NextOptions& options);

/// Prints the next runs of a task, `count` at most, or what there is to say without any. `name` is
/// printable.
void ShowNextRuns(const ZEL::Schedule& schedule, const std::string& name, unsigned int count,
                  bool as_json);

}  // namespace zelctl
