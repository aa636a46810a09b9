// How a program's command line speaks to people: its help, and what it says of a wrong one.
#pragma once

#include <CLI/CLI.hpp>
#include <cstdint>
#include <string>
#include <utility>
#include <vector>

namespace programs {

/// The words behind the program's name. "help task add" is another way to say "task add --help".
std::vector<std::string> CommandWords(int argc, char** argv);

/// Gives `app`, and each command declared below it from then on, the help that people read: lines
/// of at most 80 columns; of an option its value in a word (what option_text() says, or else the
/// last part of its name), its bounds, and what holds unless it is given. Declares the command
/// "help" when commands are below.
void SpeakPlainly(CLI::App& app, bool has_commands);

/// Parses `words`, and runs the callbacks of what was found; a help or a version that is asked for
/// instead goes to standard output. Throws Failure (kUsage), and whatever the callbacks throw.
void Parse(CLI::App& app, const std::vector<std::string>& words);

/// A whole number in decimal digits, from `min` to `max`. The help tells of the bounds.
CLI::Validator Between(uint64_t min, uint64_t max);
/// One of these words, which becomes the number beside it. For transform().
CLI::Validator OneOf(std::vector<std::pair<std::string, int>> words);
/// A whole number that 32 bits hold; the help does not tell of that.
CLI::Validator WholeNumber();

}  // namespace programs
