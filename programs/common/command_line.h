// A program that does by itself what must be quick, and loads the rest, with all that stands below
// it, when it is asked for more: loading the whole takes longer than a short command.
#pragma once

/// All of a program's command line; gives its exit code. In the library that the program loads.
extern "C" __attribute__((visibility("default"))) int RunCommandLine(int argc, char** argv);

namespace programs {

/// Loads `library`, which lies beside the program's libraries, and gives what its RunCommandLine()
/// gives. Without it, says so as `program` and gives `missing`.
int RunFromLibrary(const char* program, const char* library, int missing, int argc, char** argv);

}  // namespace programs
