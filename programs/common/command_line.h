// For programs that implement only quick commands themselves, and load a library with all others on
// demand: loading everything would take longer than running a short command.
#pragma once

/// The whole command line of a program; returns its exit code. Defined in the loaded library.
extern "C" __attribute__((visibility("default"))) int RunCommandLine(int argc, char** argv);

namespace programs {

/// Loads `library` from the folder of the program's libraries and returns the result of its
/// RunCommandLine(). If it is missing, prints an error as `program` and returns `missing`.
int RunFromLibrary(const char* program, const char* library, int missing, int argc, char** argv);

}  // namespace programs
