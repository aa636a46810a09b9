// The command line: who declares which commands. Each function declares one top-level command, or
// what is below one, on an app of its own; a command that runs throws Failure.
#pragma once

#include "programs/common/help.h"

namespace zelctl {

void DeclareTask(CLI::App& task);

void DeclareShare(CLI::App& share);
void DeclarePair(CLI::App& pair);
void DeclarePush(CLI::App& push);
void DeclareNext(CLI::App& next);

void DeclareStatus(CLI::App& status);
void DeclareReload(CLI::App& reload);
void DeclareDoctor(CLI::App& doctor);
void DeclareExport(CLI::App& exporting);
void DeclareImport(CLI::App& importing);

}  // namespace zelctl
