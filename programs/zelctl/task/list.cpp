#include "programs/zelctl/task/list.h"

#include <cstdio>
#include <vector>

#include "programs/common/table.h"
#include "programs/common/task_row.h"
#include "programs/zelctl/base/daemon_client.h"

namespace zelctl {

void ListTasks() {
    ZEL::PObject request;
    request["command"] = "task_list";
    request["rows"] = 1;
    const ZEL::PObject reply = AskDaemon(request);
    std::vector<programs::TaskRow> rows;
    for (const ZEL::PObject& row : reply["rows"].asArray()) {
        if (!programs::UnpackTaskRow(row.asString(), rows.emplace_back())) {
            throw programs::Failure(
                programs::FailureKind::kLocal,
                "the daemon's list is none: are zelctl and zel_daemon of one version?");
        }
    }
    std::string text;
    for (const std::string& line : programs::TaskLines(std::move(rows), programs::OutputWidth())) {
        (text += line) += '\n';
    }
    fwrite(text.data(), 1, text.size(), stdout);
}

}  // namespace zelctl
