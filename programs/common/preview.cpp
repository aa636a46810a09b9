#include "programs/common/preview.h"

#include "programs/common/host.h"
#include "programs/common/text.h"

namespace programs {

using TARQ::Backup::RunChange;

void Preview(TaskRun& run, const RunOrder& order, const PreviewListener& listener) {
    std::vector<std::string> names;
    for (const ShareOrder& share : order.shares) {
        const std::string problem = ShareProblem(share.share);
        if (!problem.empty()) {
            throw RunFailure(FailureKind::kLocal, 0, problem);
        }
        names.push_back(share.share);
    }
    run.Connect();
    run.CheckPairing(names);
    for (const ShareOrder& share : order.shares) {
        RunOrder alone = order;
        alone.shares = {share};
        PreviewSum sum;
        run.List(
            alone,
            [&](const std::string& name, const RunChange& change) {
                if (change.kind == RunChange::SEND) {
                    ++sum.files;
                    sum.bytes += change.length;
                    sum.damaged += change.damaged ? 1 : 0;
                } else if (change.kind == RunChange::DELETE) {
                    ++sum.deletions;
                } else {
                    return;
                }
                listener.on_change(name, change);
            },
            [&](const std::string&) { sum.missing = true; });
        listener.on_share(share.share, sum);
    }
}

std::string ChangeLine(const RunChange& change) {
    return change.kind == RunChange::DELETE
               ? "delete  " + Printable(change.path)
               : "send    " + Printable(change.path) + " (" + HumanBytes(change.length) + ")";
}

std::string SumLine(const std::string& share, const PreviewSum& sum) {
    if (sum.missing) {
        return Printable(share) + ": the server holds no copy yet; all of it would be sent.";
    }
    return Printable(share) + ": " + Count(sum.files, "file") + " (" + HumanBytes(sum.bytes) +
           ") would be sent, " + std::to_string(sum.deletions) + " deleted.";
}

std::string DifferenceLine(const RunChange& change) {
    return change.kind == RunChange::DELETE
               ? "extra    " + Printable(change.path)
               : (change.damaged ? "DAMAGED  " : "differs  ") + Printable(change.path) + " (" +
                     HumanBytes(change.length) + ")";
}

std::string DifferencesLine(const std::string& share, const PreviewSum& sum) {
    const std::string name = Printable(share) + ": ";
    if (sum.missing) {
        return name + "the server holds no copy yet.";
    }
    if (sum.files == 0 && sum.deletions == 0) {
        return name + "the same at both ends, byte by byte.";
    }
    return name + std::to_string(sum.damaged) + " damaged, " +
           std::to_string(sum.files - sum.damaged) + " missing or other at the server, " +
           std::to_string(sum.deletions) + " that are only there.";
}

}  // namespace programs
