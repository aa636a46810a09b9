// The parts of the command line. Each function declares one top-level command, with its
// subcommands, on the given app. The callbacks of commands throw Failure.
#pragma once

#include "programs/common/help.h"

namespace zelctl {

void DeclareTask(CLI::App& task);

void DeclareShare(CLI::App& share);
void DeclareTrust(CLI::App& trust);
void DeclarePair(CLI::App& pair);
void DeclarePush(CLI::App& push);
void DeclareVerify(CLI::App& verify);
void DeclareNext(CLI::App& next);
void DeclareRestore(CLI::App& restore);
void DeclareRecover(CLI::App& recover);
void DeclareVersions(CLI::App& versions);

void DeclareStatus(CLI::App& status);
void DeclareReload(CLI::App& reload);
void DeclareDoctor(CLI::App& doctor);
void DeclareExport(CLI::App& exporting);
void DeclareImport(CLI::App& importing);

}  // namespace zelctl
