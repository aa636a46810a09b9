// The command line: who declares which commands. Each function declares one top-level command, or
// what is below one, on an app of its own; the command that runs leaves its exit code in `result`.
#pragma once

#include "programs/common/help.h"
#include "programs/zelctl/base/exit_codes.h"

namespace zelctl {

void DeclareTask(CLI::App& task, ExitCode& result);

void DeclareShare(CLI::App& share, ExitCode& result);
void DeclarePair(CLI::App& pair, ExitCode& result);
void DeclarePush(CLI::App& push, ExitCode& result);
void DeclareNext(CLI::App& next, ExitCode& result);

void DeclareStatus(CLI::App& status, ExitCode& result);
void DeclareReload(CLI::App& reload, ExitCode& result);
void DeclareDoctor(CLI::App& doctor, ExitCode& result);
void DeclareExport(CLI::App& exporting, ExitCode& result);
void DeclareImport(CLI::App& importing, ExitCode& result);

}  // namespace zelctl
