// One run of a task: what it is to send, and what becomes of the changes that it was for.
#pragma once

#include <cstdint>
#include <vector>

#include "programs/common/task_run.h"
#include "programs/zel_daemon/task_record.h"

namespace zel_daemon {

struct RunPlan {
    programs::RunOrder order;
    RunRecord record;
    std::vector<ZEL::Event> events;  ///< the stored changes that it sends
};

/// The numbers of a run's stored changes, after its end.
struct RunEnd {
    std::vector<uint64_t> sent;    ///< the server has taken these
    std::vector<uint64_t> unsent;  ///< and these not
};

}  // namespace zel_daemon
