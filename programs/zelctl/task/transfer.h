// Taking all tasks along: to another machine, or through a new installation.
#pragma once

#include <string>

namespace zelctl {

/// Writes all tasks to `path`, or to standard output when it is empty or "-". With passwords only
/// to a file, which then is its owner's alone.
void ExportTasks(const std::string& path, bool with_passwords);

/// Adds the tasks of a file ("-": standard input); nothing at all unless every one is possible on
/// this machine. `replace`: a task whose name is there already becomes that of the file. Passwords
/// that the file does not have are asked for, or read from `password_file`, one for all.
void ImportTasks(const std::string& path, bool replace, const std::string& password_file);

}  // namespace zelctl
