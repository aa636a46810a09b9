#include "programs/zelctl/restore/confine.h"

#include <fcntl.h>
#include <linux/landlock.h>
#include <stdlib.h>
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <unistd.h>

#include "base/unique_fd.h"
#include "tarq/root_path.h"

namespace zelctl {

namespace {

using base::UniqueFd;

constexpr long kHasRefer = 2;

// Not LANDLOCK_ACCESS_FS_TRUNCATE: rsync truncates nothing by its name, and to look for that right
// the kernel would walk up from each file and folder that is opened, for reading, too.
constexpr uint64_t kChangeFile = LANDLOCK_ACCESS_FS_WRITE_FILE;
constexpr uint64_t kChangeFolder = kChangeFile | LANDLOCK_ACCESS_FS_REMOVE_DIR |
                                   LANDLOCK_ACCESS_FS_REMOVE_FILE | LANDLOCK_ACCESS_FS_MAKE_CHAR |
                                   LANDLOCK_ACCESS_FS_MAKE_DIR | LANDLOCK_ACCESS_FS_MAKE_REG |
                                   LANDLOCK_ACCESS_FS_MAKE_SOCK | LANDLOCK_ACCESS_FS_MAKE_FIFO |
                                   LANDLOCK_ACCESS_FS_MAKE_BLOCK | LANDLOCK_ACCESS_FS_MAKE_SYM;

/// What this process may not do any more but where it is allowed.
class Rules {
public:
    Rules() {
        const long version =
            syscall(SYS_landlock_create_ruleset, nullptr, 0, LANDLOCK_CREATE_RULESET_VERSION);
        if (version < 1) {
            return;
        }
        folders_ = kChangeFolder | (version >= kHasRefer ? LANDLOCK_ACCESS_FS_REFER : 0);
        landlock_ruleset_attr handled = {};
        handled.handled_access_fs = folders_;
        rules_ = UniqueFd(static_cast<int>(
            syscall(SYS_landlock_create_ruleset, &handled, sizeof handled.handled_access_fs, 0)));
    }
    // What is not there needs no rule.
    void AllowFolder(const std::string& path) { Allow(path, folders_); }
    void AllowFile(const std::string& path) { Allow(path, kChangeFile); }
    void Enter() const {
        if (rules_ && prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) == 0) {
            syscall(SYS_landlock_restrict_self, rules_.Get(), 0);
        }
    }

private:
    void Allow(const std::string& path, uint64_t access) const {
        const UniqueFd place(open(path.c_str(), O_PATH | O_CLOEXEC));
        if (rules_ && place) {
            landlock_path_beneath_attr rule = {};
            rule.allowed_access = access;
            rule.parent_fd = place.Get();
            syscall(SYS_landlock_add_rule, rules_.Get(), LANDLOCK_RULE_PATH_BENEATH, &rule, 0);
        }
    }

    UniqueFd rules_;
    uint64_t folders_ = 0;
};

}  // namespace

void WriteOnlyBelow(const std::string& folder) {
    Rules rules;
    rules.AllowFolder(folder);
    // Scratch files come there alone, rather than anywhere in a folder that all share; below a root
    // folder of one's own that is no matter.
    const std::string scratch = TARQ::RootPath(TARQ::RootFolder().empty() ? "/tmp/ZEL" : "/tmp");
    setenv("TMPDIR", scratch.c_str(), 1);
    rules.AllowFolder(scratch);
    rules.AllowFile(TARQ::RootPath("/var/log/tarqrsync.log"));
    rules.AllowFile(TARQ::RootPath("/usr/tarq/etc/tarqrsync_known_hosts"));
    rules.AllowFile("/dev/null");
    rules.AllowFile("/dev/tty");
    rules.Enter();
}

}  // namespace zelctl
