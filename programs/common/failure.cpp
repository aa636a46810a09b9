#include "programs/common/failure.h"

#include <cerrno>
#include <cstdio>
#include <cstring>

#include "programs/common/text.h"

namespace programs {

Failure SystemFailure(const std::string& what, FailureKind kind) {
    return {kind, what + ": " + strerror(errno)};
}

Failure ReportedFailure(FailureKind kind) {
    return {kind, ""};
}

void Report(const char* program, const std::string& text) {
    if (!text.empty()) {
        fprintf(stderr, "%s: %s\n", program, PrintableLines(text).c_str());
    }
}

int RunReporting(const char* program, const std::function<void()>& command) {
    try {
        command();
        return 0;
    } catch (const Failure& failure) {
        Report(program, failure.what());
        return ExitStatusOf(failure.Kind());
    } catch (const std::exception& error) {
        Report(program, error.what());
        return ExitStatusOf(FailureKind::kFailed);
    }
}

}  // namespace programs
