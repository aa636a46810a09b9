#include "tarq/rsync_wrapper.h"

#include <syslog.h>

#include <sstream>
#include <utility>

#include "platform/tarqrsync/run.h"
#include "platform/tarqrsync/settings.h"

namespace TARQ {
namespace Backup {

namespace {

// The cause stands in the explanation; the system log is not the place for a line a file.
constexpr int kMaxLoggedLines = 20;

thread_local const RunOptions* current_options = nullptr;

}  // namespace

struct ScopedRunOptions::Impl {
    RunOptions options;
    const RunOptions* before;
};

ScopedRunOptions::ScopedRunOptions(RunOptions options)
    : impl_(new Impl{std::move(options), current_options}) {
    current_options = &impl_->options;
}

ScopedRunOptions::~ScopedRunOptions() {
    current_options = impl_->before;
}

struct RsyncWrapper::Impl {
    Settings settings;
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

int RsyncWrapper::execute(const std::function<bool()>& cancelled) {
    static const RunOptions no_options;
    const RunOptions& options = current_options != nullptr ? *current_options : no_options;
    Run run(impl_->settings, options);
    const int status = run.Execute(cancelled);
    impl_->explanation = run.Outcome().explanation;
    impl_->details = run.Outcome().details;
    if (options.report != nullptr) {
        *options.report = run.Outcome();
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
