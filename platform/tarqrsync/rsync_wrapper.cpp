#include "tarq/rsync_wrapper.h"

#include <syslog.h>

#include <algorithm>
#include <filesystem>
#include <sstream>
#include <system_error>

#include "platform/tarqrsync/run.h"
#include "platform/tarqrsync/settings.h"

namespace TARQ {
namespace Backup {

namespace {

// The cause stands in the explanation; the system log is not the place for a line a file.
constexpr int kMaxLoggedLines = 20;
// Neither end says anything while it reads a file for its checksum. A far end that is gone is
// noticed long before.
constexpr int kReadingSeconds = 86400;

// Where an open folder is, as rsync will call it when it runs in it; else `otherwise`.
std::string PathNow(int folder, const std::string& otherwise) {
    std::error_code error;
    const std::filesystem::path now =
        std::filesystem::read_symlink("/proc/self/fd/" + std::to_string(folder), error);
    return error ? otherwise : now.string();
}

}  // namespace

struct RsyncWrapper::Impl {
    Settings settings;
    RunOptions options;
    std::string explanation;
    std::string details;
};

RsyncWrapper::RsyncWrapper() : impl_(new Impl) {}

RsyncWrapper::~RsyncWrapper() = default;

void RsyncWrapper::setDelete(bool enable) {
    impl_->settings.delete_missing = enable;
}

void RsyncWrapper::setNumericIds(bool enable) {
    impl_->settings.numeric_ids = enable;
}

void RsyncWrapper::setTarqAuth(bool account, bool required) {
    impl_->settings.account = account;
    impl_->settings.account_required = required;
}

void RsyncWrapper::setTarqPseudoRoot(bool enable) {
    impl_->settings.pseudo_root = enable;
}

void RsyncWrapper::setSsh(bool enable) {
    impl_->settings.ssh = enable;
}

void RsyncWrapper::setPort(int port) {
    impl_->settings.port = port;
}

void RsyncWrapper::setCompress(bool enable) {
    impl_->settings.compress = enable;
}

void RsyncWrapper::setDeltaCopy(bool enable) {
    impl_->settings.delta_copy = enable;
}

void RsyncWrapper::setListOnly(bool enable) {
    impl_->settings.list_only = enable;
}

void RsyncWrapper::setRelativePath(bool enable) {
    impl_->settings.relative_path = enable;
}

void RsyncWrapper::setTarqAcl(bool enable) {
    impl_->settings.acl = enable;
}

void RsyncWrapper::setDebugLog(bool enable) {
    impl_->settings.debug_log = enable;
}

void RsyncWrapper::setTimeout(int seconds) {
    impl_->settings.timeout = seconds;
}

void RsyncWrapper::setTarqCustCmdRule(const std::list<std::string>& lines) {
    impl_->settings.is_command = true;
    impl_->settings.command = lines;
}

void RsyncWrapper::setExcludeRule(const std::list<std::string>& rules) {
    impl_->settings.exclude_rules = rules;
}

void RsyncWrapper::setSrcPath(const std::string& path) {
    impl_->settings.source = path;
}

void RsyncWrapper::setDestPath(const std::string& user, const std::string& host,
                               const std::string& password, const std::string& module,
                               const std::string& sub_path) {
    impl_->settings.user = user;
    impl_->settings.host = host;
    impl_->settings.password = password;
    impl_->settings.module = module;
    impl_->settings.sub_path = sub_path;
}

void RsyncWrapper::setRunOptions(const RunOptions& options) {
    impl_->options = options;
}

int RsyncWrapper::execute(const std::function<bool()>& cancelled) {
    Settings settings = impl_->settings;
    if (!impl_->options.module.empty()) {
        settings.module = impl_->options.module;
    }
    const bool starts = !settings.is_command && !impl_->options.start.empty();
    if (starts) {
        settings.module = kPushModule;
    }
    settings.pull = impl_->options.pull;
    settings.delete_missing =
        settings.delete_missing && !impl_->options.keep_missing && impl_->options.files.empty();
    if (impl_->options.by_content && settings.timeout != 0) {
        settings.timeout = std::max(settings.timeout, kReadingSeconds);
    }
    if (impl_->options.source_folder >= 0) {
        settings.source = PathNow(impl_->options.source_folder, settings.source) + "/";
    }
    settings.deletes_changes = settings.delete_missing && impl_->options.deletes_changes;
    Run run(settings, impl_->options);
    const int status = run.Execute(cancelled);
    const RunCause cause = run.Outcome().cause;
    const bool is_expected =
        starts && (cause == RunCause::NOT_STARTED || cause == RunCause::UNKNOWN_MODULE);
    impl_->explanation = is_expected ? "" : run.Outcome().explanation;
    impl_->details = run.Outcome().details;
    if (impl_->options.report != nullptr) {
        *impl_->options.report = run.Outcome();
    }
    return status;
}

void RsyncWrapper::logError() {
    if (impl_->explanation.empty()) {
        return;
    }
    std::istringstream lines(impl_->explanation + "\n" + impl_->details);
    int count = 0;
    for (std::string line; count < kMaxLoggedLines && std::getline(lines, line); ++count) {
        syslog(LOG_ERR, "tarqrsync: %s", line.c_str());
    }
}

}  // namespace Backup
}  // namespace TARQ
