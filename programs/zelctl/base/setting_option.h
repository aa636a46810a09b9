// Command-line options for a task's settings, shared by `task add`, `task edit`, `push` and `pair
// check`.
#pragma once

#include "programs/common/help.h"
#include "programs/common/task_fields.h"

namespace zelctl {

/// Declares the option of `field`. Its value is stored in `said`, which must outlive the command,
/// under the field's key. `is_new`: the command starts from nothing, so the help shows defaults and
/// which options are required.
void AddSetting(CLI::App& command, const programs::TaskField& field, ZEL::PObject& said,
                bool is_new);

}  // namespace zelctl
