#include "programs/zelctl/restore/versions.h"

#include <cstdio>

#include "programs/common/restore_run.h"
#include "programs/common/share_path.h"
#include "programs/common/table.h"
#include "programs/common/text.h"
#include "programs/zelctl/base/interrupt.h"
#include "programs/zelctl/base/prepare.h"
#include "programs/zelctl/restore/source.h"

namespace zelctl {

namespace {

using programs::ShareVersion;

void PrintForPrograms(const programs::ShareVersions& listed) {
    programs::Table table({"UNTIL", "FILES", "BYTES", "SINCE"});
    for (const ShareVersion& version : listed.versions) {
        table.Add({std::to_string(version.until), std::to_string(version.files),
                   std::to_string(version.bytes), std::to_string(version.since)});
    }
    table.Print(true);
}

void PrintForPeople(const programs::ShareVersions& listed) {
    programs::Table table({"UNTIL", "FILES", "SIZE", "SINCE"});
    for (const ShareVersion& version : listed.versions) {
        table.Add({programs::HumanTime(version.until), std::to_string(version.files),
                   programs::HumanBytes(version.bytes),
                   version.since == 0 ? "-" : programs::HumanTime(version.since)});
    }
    table.Print(false);
    puts(listed.more ? "Older ones are not shown: name a path to see more."
                     : "'zelctl restore ... --at TIME' brings back what stood until then.");
}

}  // namespace

void ShowVersions(const VersionsOptions& options) {
    PrepareHost();
    const std::string path = programs::RequirePathInShare(options.path);
    const CopySource source = FindSource(options.task, options.share, options.connection);
    WatchForInterrupt();
    programs::RestoreRun run(source.info, Interrupted());
    run.Connect();
    const programs::ShareVersions listed = run.Versions(source.share, path);
    if (options.as_json) {
        PrintForPrograms(listed);
    } else if (listed.versions.empty()) {
        printf("The server has replaced or deleted nothing of %s%s%s.\n",
               programs::Printable(source.share).c_str(), path.empty() ? "" : ": ",
               programs::Printable(path).c_str());
    } else {
        PrintForPeople(listed);
    }
}

}  // namespace zelctl
