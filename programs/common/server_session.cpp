#include "programs/common/server_session.h"

#include <string_view>
#include <utility>

#include "ZEL/zel.h"
#include "base/section_view.h"
#include "base/whole_file.h"
#include "programs/common/server_status.h"
#include "programs/common/task_fields.h"
#include "programs/common/text.h"

namespace programs {

namespace {

using std::chrono::steady_clock;
using TARQ::Backup::RunOptions;
using TARQ::Backup::RunReport;

// A busy server on a far network answers within this time, and a person who has ended a run waits
// for it.
constexpr std::chrono::seconds kLastWord(5);

// A temporary file of the run; deleted with this object.
class TempFile {
public:
    TempFile() : path_(ZEL::GetTempFile()) {}
    ~TempFile() { ZEL::PutTempFile(path_); }
    TempFile(const TempFile&) = delete;
    TempFile& operator=(const TempFile&) = delete;

    const std::string& Path() const { return path_; }  // empty if it could not be created

private:
    std::string path_;
};

std::string Explain(int status, const RunReport& report) {
    std::string server_text = ServerStatusText(status);
    if (!server_text.empty() && (status >= kFirstServerStatus || report.explanation.empty())) {
        return server_text;
    }
    return !report.explanation.empty()
               ? report.explanation
               : "status " + std::to_string(status) + " (see the system log)";
}

}  // namespace

std::list<std::string> ToList(const std::vector<std::string>& items) {
    return {items.begin(), items.end()};
}

void AddFiles(RunReport& sum, const RunReport& part) {
    sum.files_total += part.files_total;
    sum.files_regular += part.files_regular;
    sum.folders_total += part.folders_total;
    sum.bytes_total += part.bytes_total;
}

void AddChanges(RunReport& sum, const RunReport& part) {
    sum.files_sent += part.files_sent;
    sum.files_deleted += part.files_deleted;
}

void AddTraffic(RunReport& sum, const RunReport& part) {
    sum.bytes_sent += part.bytes_sent;
    sum.bytes_received += part.bytes_received;
}

std::string QuotedShare(const std::string& share) {
    return "share '" + Printable(share) + "'";
}

ServerSession::ServerSession(const ZEL::SyncInfo& sync_info, const std::atomic<bool>& cancel_flag)
    : info(sync_info), cancel(cancel_flag) {
    rsyncer.SetTaskSetup([this](ZEL::Rsyncer::RsyncTask& task) {
        task.SetCanceller([this] {
            return (cancel && steady_clock::now() >= patient_until) || (interrupt && interrupt());
        });
        options.server = ServerOf(info);
        task.setRunOptions(options);
    });
}

ZEL::Rsyncer& ServerSession::With(RunOptions wanted) {
    options = std::move(wanted);
    interrupt = nullptr;
    report = RunReport();
    options.report = &report;
    return rsyncer;
}

int ServerSession::LastWord(const std::string& type, const std::string& name, int& status) {
    patient_until = steady_clock::now() + kLastWord;
    const int sent = With().FinishSync(type, name, status);
    patient_until = {};
    return sent;
}

void ServerSession::Find() {
    int status = With().Initialize(info);
    const bool version_failed = report.status > kDone && report.status != kUnknownCommand &&
                                report.status != kUnsupportedCommand;
    if (status == 0 && (version_failed || cancel)) {
        status = report.status;
    }
    connected = status == 0;
    if (!connected) {
        throw Failed("cannot use server " + ServerOf(info), status);
    }
}

int ServerSession::Send(std::list<std::string> lines, std::string& answer,
                        const AnswerLimits& limits) {
    const TempFile file;
    if (file.Path().empty()) {
        throw Failed("there is no place for the server's answer", 0);
    }
    lines.push_back("outfile=\"" + file.Path() + "\"");
    RunOptions wishes;
    wishes.answer_seconds = limits.seconds;
    ZEL::Rsyncer::RsyncTask task;
    With(wishes).InitRsyncTask(task, false);
    const int status = task.ExecuteCmd(lines, nullptr);
    answer = base::ReadFile(file.Path(), limits.bytes).value_or("");
    return status;
}

int ServerSession::Ask(const std::string& command, const std::string& share,
                       const std::list<std::string>& lines, std::string& answer,
                       const AnswerLimits& limits) {
    std::list<std::string> all = {"command=\"" + command + "\"",
                                  "clientID=\"" + ZEL::GetClientID() + "\"",
                                  "shareName=\"" + share + "\""};
    all.insert(all.end(), lines.begin(), lines.end());
    return Send(std::move(all), answer, limits);
}

std::string ServerSession::ModuleIn(const std::string& answer) {
    const auto line = base::ParseKeyLine(std::string_view(answer).substr(0, answer.find('\n')));
    // A name with a slash would be a path inside another module.
    return line && line->key == "module" && line->value.find('/') == std::string_view::npos
               ? std::string(line->value)
               : "";
}

RunFailure ServerSession::Failed(const std::string& what, int status, Reach reach) const {
    if (cancel) {
        return {FailureKind::kCancelled, 0, std::string("ended by the user; ") + goes_on};
    }
    const std::string why = status == 0 ? "see the system log" : Explain(status, report);
    return {status == 0 ? FailureKind::kLocal : KindOf(status), status, what + ": " + why, reach,
            report.details};
}

}  // namespace programs
