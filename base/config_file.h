// Configuration files that people write: one section of key="value" lines.
#pragma once

#include <cstdint>
#include <map>
#include <set>
#include <stdexcept>
#include <string>
#include <string_view>

namespace base {

/// An error in a configuration file: what() names the place and the problem.
class ConfigError : public std::runtime_error {
public:
    using std::runtime_error::runtime_error;
};

/// The values in a file. A key that is missing or empty has its default, and so have all keys when
/// there is no file.
class ConfigFile {
public:
    /// Throws ConfigError when the file cannot be read, and for the first line that nobody would
    /// read, so that a misspelt key is never taken for its default: another section, a key that is
    /// not one of `keys`, a section or key that is there twice, a line that is neither.
    ConfigFile(const std::string& path, const std::string& section,
               const std::set<std::string>& keys);

    std::string Text(const std::string& key, const std::string& otherwise = "") const;
    /// Throws ConfigError for anything but a number from `min` to `max`.
    uint64_t Number(const std::string& key, uint64_t otherwise, uint64_t min, uint64_t max) const;
    /// The error for an invalid value: `problem` goes on from "<key> is '<value>', ".
    ConfigError Wrong(const std::string& key, const std::string& problem) const;

private:
    std::string path_;
    std::map<std::string, std::string> values_;
};

}  // namespace base
