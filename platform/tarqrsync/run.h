#pragma once

#include <cstdint>
#include <functional>
#include <string>

#include "base/child_process.h"
#include "base/rsync_config.h"
#include "platform/tarqrsync/arguments.h"
#include "platform/tarqrsync/explain.h"
#include "platform/tarqrsync/output_parser.h"
#include "platform/tarqrsync/private_folder.h"
#include "platform/tarqrsync/route.h"
#include "platform/tarqrsync/run_watch.h"
#include "platform/tarqrsync/settings.h"
#include "tarq/rsync_wrapper.h"

namespace TARQ {
namespace Backup {

/// One execute(): from settings to an outcome.
class Run {
public:
    /// Settings and options must outlive the run.
    Run(const Settings& settings, const RunOptions& options)
        : settings_(settings), options_(options) {}

    /// Runs, and returns execute()'s status. Call once. Throws only what a function of the caller's
    /// throws.
    int Execute(const std::function<bool()>& cancelled);

    /// What it came to. The figures are there when the options ask for a report.
    const RunReport& Outcome() const { return outcome_; }

private:
    /// What a command's rsync may do, beyond what a copy's may.
    struct ChildLimits {
        uint64_t max_file_bytes = 0;
        base::EarlyEnd early_end;
    };

    Patience PatienceOfRun() const;
    int FailByWatch(RunWatch::Fault fault);

    int Attempt(const std::function<bool()>& cancelled);
    int RunCommand(const std::function<bool()>& cancelled);
    int TakeAnswer(const std::string& answer_file);
    int RunCopy(const std::function<bool()>& cancelled);
    int RunRsync(const std::function<bool()>& cancelled, const Invocation& invocation,
                 OutputParser* parser, const ChildLimits& limits);
    int Fail(int status, const std::string& first_line);
    RunFacts Facts(int exit_code) const {
        return {settings_, route_, config_, exit_code, messages_};
    }

    const Settings& settings_;
    const RunOptions& options_;
    base::RsyncConfig config_;
    Route route_;
    PrivateFolder folder_;
    std::string log_file_;
    std::string messages_;  // what rsync and ssh wrote
    RunReport outcome_;
};

}  // namespace Backup
}  // namespace TARQ
