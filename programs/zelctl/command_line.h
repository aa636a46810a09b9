#pragma once

/// All of zelctl's command line; gives its exit code. In a library of its own, which the program
/// loads when it needs it.
extern "C" __attribute__((visibility("default"))) int RunCommandLine(int argc, char** argv);
