// Configuration files that people write: one section of key="value" lines.
#pragma once

#include <cstdint>
#include <map>
#include <set>
#include <stdexcept>
#include <string>
#include <string_view>

namespace base {

/// A file is not as it should be: what() says where, and what is wrong.
class ConfigError : public std::runtime_error {
public:
    using std::runtime_error::runtime_error;
};

/// What a file says. A key that it does not have, or has with nothing behind it, has its default;
/// without a file all have.
class ConfigFile {
public:
    /// Throws ConfigError when the file cannot be read, and for the first line that nobody would
    /// read, so that a misspelt key is never taken for its default: another section, a key that is
    /// not one of `keys`, a section or key that is there twice, a line that is neither.
    ConfigFile(const std::string& path, const std::string& section,
               const std::set<std::string>& keys);

    std::string Text(const std::string& key, const std::string& otherwise = "") const;
    /// Throws ConfigError for what is no number from `min` to `max`.
    uint64_t Number(const std::string& key, uint64_t otherwise, uint64_t min, uint64_t max) const;
    /// The error for a value that is none: `problem` goes on from "<key> is '<value>', ".
    ConfigError Wrong(const std::string& key, const std::string& problem) const;

private:
    std::string path_;
    std::map<std::string, std::string> values_;
};

}  // namespace base
