// The help of a program's command line, and its error texts.
#pragma once

#include <CLI/CLI.hpp>
#include <cstdint>
#include <string>
#include <utility>
#include <vector>

namespace programs {

/// The words after the program's name. "help task add" is turned into "task add --help".
std::vector<std::string> CommandWords(int argc, char** argv);

/// Gives `app`, and each command declared on it later, a help in plain form: lines of at most 80
/// columns and, for each option, its value as a word (from option_text(), or the last part of its
/// name), its bounds and its default. If it has commands, also declares the command "help".
void SpeakPlainly(CLI::App& app, bool has_commands);

/// Parses `words` and runs the callbacks of what was found. If help or the version is requested,
/// prints that to standard output instead. Throws Failure (kUsage), and whatever the callbacks
/// throw.
void Parse(CLI::App& app, const std::vector<std::string>& words);

/// A whole number in decimal digits, from `min` to `max`. The help shows the bounds.
CLI::Validator Between(uint64_t min, uint64_t max);
/// One of these words, converted into the number beside it. For transform().
CLI::Validator OneOf(std::vector<std::pair<std::string, int>> words);
/// A whole number of 32 bits; the help does not mention the bounds.
CLI::Validator WholeNumber();

}  // namespace programs
