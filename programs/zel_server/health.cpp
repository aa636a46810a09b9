#include "programs/zel_server/health.h"

#include <pwd.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <filesystem>
#include <map>

#include "programs/common/text.h"
#include "programs/zel_server/accounts.h"
#include "programs/zel_server/connections.h"
#include "programs/zel_server/registry_repair.h"
#include "programs/zel_server/share_copy.h"
#include "programs/zel_server/share_record.h"
#include "tarq/core.h"
#include "tarq/root_path.h"

namespace zel_server {

namespace {

namespace fs = std::filesystem;
using programs::Count;
using programs::Printable;

// Space that a push needs for its own bookkeeping.
constexpr uint64_t kFullBelow = 1048576;
constexpr size_t kNamed = 3;  // further names are only counted

std::string InQuotes(const std::string& text) {
    return "'" + Printable(text) + "'";
}

class Examination {
public:
    explicit Examination(const ServerConfig& config) : config_(config) {}

    Health Run() {
        LookAtRegistry();
        LookAtDaemon();
        LookAtConfiguration();
        LookAtAccounts();
        for (const std::string& folder : config_.Folders()) {
            LookAtStorage(folder);
        }
        LookAtCopies();
        return std::move(health_);
    }

private:
    void Found(const std::string& what, const std::string& mend, bool stops_pushes = true) {
        health_.problems.push_back({what, mend, stops_pushes});
    }

    void LookAtRegistry() {
        const auto damage = FindDamage();
        if (!damage) {
            health_.registry = "unreadable";
            Found("the registry " + RegistryFile() + " or the folder " + ShareRecords() +
                      " cannot be read: " + KAPICErrText(KAPICErrGet()),
                  geteuid() == 0 ? "if the file is no longer one, move it away and run "
                                   "'zel_server repair'"
                                 : "look as root");
            return;
        }
        health_.registry = damage->None() ? "whole" : "damaged";
        if (damage->switch_lost || !damage->shares.empty()) {
            std::string lost = damage->switch_lost ? "the service's switch" : "";
            if (!damage->shares.empty()) {
                lost += (lost.empty() ? "" : " and ") + Count(damage->shares.size(), "share") +
                        " (" + Listed(damage->shares) + ")";
            }
            Found("the registry " + RegistryFile() + " is damaged: it has lost " + lost +
                      "; clients are refused",
                  "zel_server repair");
        }
        if (!damage->ownerless.empty()) {
            Found("the registry has lost to whom " + Listed(damage->ownerless) +
                      " belongs, and nothing else tells; nobody may push there",
                  "zel_server shares --release NAME: the next client and account that push it own "
                  "it");
        }
        health_.on = ReadSwitch();
        if (health_.on == Switch::kOff) {
            Found("the service is switched off", "zel_server enable");
        }
        shares_ = KnownShares().value_or(std::vector<std::string>());
        health_.shares = shares_.size();
    }

    // Without it nobody is served.
    void LookAtConfiguration() {
        struct stat info = {};
        if (stat(RsyncdConfig().c_str(), &info) != 0 && errno == ENOENT) {
            Found(RsyncdConfig() + " is not there", "zel_server setup, which makes it again");
        }
    }

    // Checks the units, what listens, and whether that is what is configured.
    void LookAtDaemon() {
        Health& now = health_;
        now.unit = AskUnit();
        now.listeners = Listeners(config_);
        now.other_holder = OtherHolder(config_, now.listeners);
        now.daemon = ServingProcess();
        for (const Listener& listener : now.listeners) {
            if (!now.front && IsOurFront(listener.pid)) {
                now.front = listener.pid;
            }
        }
        now.fingerprint = Fingerprint();
        // Other users see neither the owners of these sockets nor what root's daemon answers.
        const bool blind = geteuid() != 0 && now.unit.active == "active";
        now.listens = blind || (now.daemon && ServesAll(config_, now.listeners));
        now.configuration_newer = now.front && IsOutdated(config_, *now.front);
        const std::string restart = now.unit.managed ? "systemctl restart zel_rsyncd"
                                                     : "end it, and run 'zel_server serve'";
        if (!now.listens) {
            FoundSilent(restart);
        } else if (now.configuration_newer) {
            Found("the front runs with an older configuration", restart, false);
        }
        if (now.unit.managed && !now.unit.enabled && !now.unit.masked) {
            Found("the server will not start with the machine", "systemctl enable zel_rsyncd",
                  false);
        }
        if (now.unit.managed && now.listens && now.unit.active != "active") {
            Found("the server was started by hand, the unit zel_rsyncd is " + now.unit.active,
                  "end process " + std::to_string(now.daemon.value_or(0)) +
                      ", then systemctl start zel_rsyncd",
                  false);
        }
        if (config_.plain) {
            Found("port " + std::to_string(config_.plain_port) +
                      " serves the network without encryption: what travels there is unprotected",
                  "when all clients use TLS: zel_server setup --no-plain", false);
        }
    }

    // Why the server does not answer where clients connect.
    void FoundSilent(const std::string& restart) {
        const Health& now = health_;
        if (now.unit.masked) {
            Found("the unit zel_rsyncd is masked",
                  "systemctl unmask zel_rsyncd, then systemctl enable --now zel_rsyncd");
        } else if (now.other_holder) {
            Found("port " + std::to_string(now.other_holder->port) + " is held by " +
                      NameOf(*now.other_holder),
                  "end that, or choose another port with 'zel_server setup'");
        } else if (now.daemon && now.front) {
            Found("the front runs, but does not listen on all that is configured", restart);
        } else if (now.daemon) {
            Found("the front, HAProxy, is not running" +
                      (now.unit.managed ? ": the unit zel_front is " + AskUnit(kFrontUnit).active
                                        : std::string()),
                  now.unit.managed ? "systemctl restart zel_rsyncd; journalctl -u zel_front says "
                                     "why it ended"
                                   : restart);
        } else if (now.unit.managed) {
            Found("the rsync daemon is not running: the unit zel_rsyncd is " + now.unit.active +
                      (now.unit.active == "failed" ? " (" + now.unit.result + ")" : ""),
                  "systemctl start zel_rsyncd; journalctl -u zel_rsyncd says why it ended");
        } else {
            Found("the rsync daemon is not running", "zel_server serve");
        }
    }

    void LookAtAccounts() {
        struct stat info = {};
        const auto accounts = Accounts();
        const int error = errno;
        std::vector<std::string> weak;
        if (accounts) {
            health_.accounts = 0;
            for (const Account& account : *accounts) {
                *health_.accounts += account.enabled ? 1 : 0;
                if (account.enabled && account.weak) {
                    weak.push_back(account.name);
                }
            }
        }
        if (!accounts && error == EACCES && geteuid() != 0) {
            return;
        }
        if (!accounts) {
            Found("the accounts in " + SecretsFile() + " cannot be read",
                  "zel_server account list says why");
        } else if (*health_.accounts == 0) {
            Found("no account may log in", accounts->empty()
                                               ? "zel_server account add NAME"
                                               : "zel_server account enable NAME; 'zel_server "
                                                 "account list' shows those that are disabled");
        } else if (stat(SecretsFile().c_str(), &info) == 0 &&
                   ((info.st_mode & (S_IROTH | S_IWOTH)) != 0 ||
                    (geteuid() == 0 && info.st_uid != 0))) {
            Found("rsync does not use " + SecretsFile() + ", which is open to others",
                  "chmod 600 " + SecretsFile() + " && chown " +
                      (geteuid() == 0 ? "root" : std::to_string(geteuid())) + " " + SecretsFile());
        }
        if (!weak.empty()) {
            Found("the password of " + Listed(weak) + " is shorter than a new one may be",
                  "zel_server account add NAME --reset makes another; at its client, 'zelctl task "
                  "edit TASK --password'",
                  false);
        }
    }

    void LookAtStorage(const std::string& folder) {
        StorageHealth storage;
        storage.folder = folder;
        storage.state = CheckStorage(config_, folder);
        // The daemon may have access where the calling user has not.
        if (storage.state == StorageState::kNotPermitted && geteuid() != 0 &&
            !config_.user.empty()) {
            storage.state = StorageState::kReady;
        }
        struct statvfs space = {};
        if (storage.state != StorageState::kAbsent && storage.state != StorageState::kOtherDisk &&
            statvfs(folder.c_str(), &space) == 0) {
            storage.free_bytes = static_cast<uint64_t>(space.f_bavail) * space.f_frsize;
            storage.full =
                *storage.free_bytes < kFullBelow || (space.f_files != 0 && space.f_favail == 0);
        }
        FoundInStorage(storage);
        health_.storage.push_back(storage);
    }

    void FoundInStorage(const StorageHealth& storage) {
        const std::string named = "the storage folder " + storage.folder;
        const std::string disk = RecordedDiskOf(storage.folder);
        std::error_code error;
        const std::string why =
            health_.unit.confinement.Forbids(fs::weakly_canonical(storage.folder, error));
        switch (storage.state) {
            case StorageState::kAbsent:
                return Found(named + " is not there",
                             "mount its disk" + (disk.empty() ? "" : " at " + disk) +
                                 ", or run 'zel_server setup' to make it anew");
            case StorageState::kOtherDisk:
                return Found(
                    named + " is not on the disk mounted at " + disk + " any more",
                    "mount that disk; if the storage has moved, run 'zel_server setup' again");
            case StorageState::kReadOnly:
                return Found(named + " is on a disk that is mounted read-only",
                             "mount -o remount,rw " + disk +
                                 "; a disk that became so by itself may be failing: see dmesg");
            case StorageState::kNotPermitted:
                return Found(named + " may not be written by this user",
                             "look at its owner and mode: ls -ld " + storage.folder);
            case StorageState::kOpen:
                return Found(named + " " + WhyOpen(config_, storage.folder) +
                                 ", so others could get at the copies; pushes are refused",
                             "zel_server setup, which closes it, or says what to do");
            case StorageState::kNoAttributes:
                return Found(named +
                                 " is on a file system that keeps no user attributes: owners "
                                 "and special files would be lost",
                             "mount it with user_xattr, or 'zel_server setup --no-attributes'");
            case StorageState::kReady:
                break;
        }
        if (!why.empty()) {
            Found("the unit zel_rsyncd cannot write to " + storage.folder + " (" + why + ")",
                  "move the storage, and run 'zel_server setup' for its new folder");
        } else if (storage.full) {
            Found("the disk of " + storage.folder + " is full", "make room on it");
        }
    }

    // Where the copies of known shares are, and whether the daemon will be able to change them.
    void LookAtCopies() {
        if (!config_.user.empty() && getpwnam(config_.user.c_str()) == nullptr) {
            Found("there is no user '" + config_.user + "', to whom the copies belong",
                  "zel_server setup, which makes it");
            return;
        }
        std::vector<std::string> copies;
        std::vector<std::string> lost;
        std::vector<std::string> other;
        std::vector<std::string> open;
        std::map<std::string, StorageState> folders;
        for (const std::string& share : shares_) {
            ShareState state;
            if (ReadShare(share, state) != ReadResult::kRead || state.path.empty()) {
                continue;
            }
            copies.push_back(state.path);
            const std::string folder = FolderAbove(state.path);
            auto known = folders.find(folder);
            if (known == folders.end()) {
                known = folders.emplace(folder, CheckStorage(config_, folder)).first;
            }
            const StorageState storage = known->second;
            if (storage == StorageState::kOpen) {
                open.push_back(share);
            } else if (storage == StorageState::kReady) {
                const CopyFolder copy = LookAtCopy(RecordedCopy(share), state.path);
                if (copy == CopyFolder::kGone) {
                    lost.push_back(share);
                } else if (copy == CopyFolder::kAnother) {
                    other.push_back(share);
                }
            }
        }
        if (!lost.empty()) {
            Found("there is no copy of " + Listed(lost) + " any more: is another disk mounted?",
                  "nothing, if that is meant: the next push sends all of it", false);
        }
        if (!other.empty()) {
            Found("the copy of " + Listed(other) +
                      " is in another folder than it was: is another disk mounted there?",
                  "nothing, if that is meant: the next push compares all of it", false);
        }
        if (!open.empty()) {
            Found("the copy of " + Listed(open) +
                      " lies where others could get at it; pushes into "
                      "it are refused",
                  "zel_server setup, which moves or closes it, or says what to do");
        }
        const std::vector<std::string> foreign = ForeignFolders(config_, copies);
        if (!foreign.empty()) {
            health_.problems.push_back(ForeignCopies(config_, foreign));
        }
    }

    const ServerConfig& config_;
    Health health_;
    std::vector<std::string> shares_;
};

}  // namespace

bool Health::PushesCanSucceed() const {
    return std::none_of(problems.begin(), problems.end(),
                        [](const Problem& problem) { return problem.stops_pushes; });
}

Health Examine(const ServerConfig& config) {
    return Examination(config).Run();
}

std::string Listed(const std::vector<std::string>& names) {
    std::string text;
    for (size_t i = 0; i < std::min(names.size(), kNamed); ++i) {
        text += (i == 0 ? "" : ", ") + InQuotes(names[i]);
    }
    return names.size() <= kNamed
               ? text
               : text + " and " + std::to_string(names.size() - kNamed) + " more";
}

std::string NameOf(const Listener& listener) {
    return listener.pid == 0
               ? "somebody who cannot be seen from here"
               : Printable(listener.program) + ", process " + std::to_string(listener.pid);
}

std::vector<std::string> ForeignFolders(const ServerConfig& config,
                                        const std::vector<std::string>& folders) {
    const struct passwd* const owner =
        config.user.empty() ? nullptr : getpwnam(config.user.c_str());
    std::vector<std::string> foreign;
    for (const std::string& folder : folders) {
        struct stat info = {};
        if (owner != nullptr && lstat(folder.c_str(), &info) == 0 && info.st_uid != owner->pw_uid) {
            foreign.push_back(folder);
        }
    }
    return foreign;
}

Problem ForeignCopies(const ServerConfig& config, const std::vector<std::string>& folders) {
    struct stat info = {};
    const bool told = lstat(folders.front().c_str(), &info) == 0;
    std::string all = folders.size() > kNamed ? " " + config.storage : "";
    for (size_t i = 0; i < folders.size() && folders.size() <= kNamed; ++i) {
        all += " " + InQuotes(folders[i]);
    }
    return {
        Listed(folders) + (folders.size() == 1 ? " belongs" : " belong") + " to " +
            (told ? "the user with the number " + std::to_string(info.st_uid) : "another user") +
            ", not to '" + config.user +
            "': a disk from another server, or from before this system was installed",
        "if these are copies: chown -hR " + config.user + ":" + all};
}

const char* Word(StorageState state) {
    switch (state) {
        case StorageState::kReady:
            return "ready";
        case StorageState::kAbsent:
            return "absent";
        case StorageState::kOtherDisk:
            return "other_disk";
        case StorageState::kReadOnly:
            return "read_only";
        case StorageState::kNotPermitted:
            return "not_permitted";
        case StorageState::kOpen:
            return "open";
        case StorageState::kNoAttributes:
            return "no_attributes";
    }
    return "";
}

}  // namespace zel_server
