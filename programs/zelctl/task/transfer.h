// Export and import of all tasks: to another machine, or across a reinstallation.
#pragma once

#include <string>

namespace zelctl {

/// Writes all tasks to `path`, or to standard output when that is empty or "-". Passwords are
/// written only to a file, which is then readable by its owner alone.
void ExportTasks(const std::string& path, bool with_passwords);

/// Adds the tasks of a file ("-": standard input). All of them are checked first: when one is not
/// possible on this machine, none is added. `replace`: overwrites existing tasks of the same name.
/// Passwords that are missing from the file are asked for, or read from `password_file`, one for
/// all.
void ImportTasks(const std::string& path, bool replace, const std::string& password_file);

}  // namespace zelctl
