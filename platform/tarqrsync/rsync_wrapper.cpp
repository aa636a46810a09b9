#include "tarq/rsync_wrapper.h"

#include <syslog.h>

#include <sstream>

#include "platform/tarqrsync/run.h"
#include "platform/tarqrsync/settings.h"

namespace TARQ {
namespace Backup {

namespace {

// The cause stands in the explanation; the system log is not the place for a line a file.
constexpr int kMaxLoggedLines = 20;

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
    Run run(impl_->settings, impl_->options);
    const int status = run.Execute(cancelled);
    impl_->explanation = run.Outcome().explanation;
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
