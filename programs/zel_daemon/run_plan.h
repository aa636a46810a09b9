// One run of a task: what it is to send.
#pragma once

#include <map>
#include <string>
#include <vector>

#include "programs/common/run_result.h"
#include "programs/zel_daemon/task_record.h"

namespace zel_daemon {

struct RunPlan {
    programs::RunOrder order;
    RunRecord record;
    std::vector<ZEL::Event> events;  ///< the stored changes that it sends
    std::map<std::string, std::vector<StoredMove>> moves = {};  ///< and the moves, by share
};

}  // namespace zel_daemon
