#pragma once

#include <string>

#include "ZEL/sync_obj.h"

namespace zelctl {

/// A schedule as the command line gives it.
struct NextOptions {
    std::string mode = "weekly";
    std::string week = "1111111";
    std::string begin = "2014-01-01";  ///< YYYY-MM-DD
    std::string start = "00:00";       ///< HH:MM
    std::string period = "00:00";      ///< HH:MM between repeats
    unsigned int repeat = 0;
    unsigned int count = 5;
    std::string from;  ///< "YYYY-MM-DD HH:MM"; empty: now
    bool as_json = false;
};

/// Prints the next runs of the schedule.
void ShowNextRuns(const NextOptions& options);

/// Prints the runs of a schedule after a moment, `count` at most.
void ShowNextRuns(const ZEL::Schedule& schedule, long after, unsigned int count, bool as_json);

}  // namespace zelctl
