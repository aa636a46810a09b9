#include "base/config_file.h"

#include <cerrno>
#include <cstring>
#include <optional>

#include "base/section_view.h"
#include "base/text.h"
#include "base/whole_file.h"

namespace base {

namespace {

constexpr size_t kMaxBytes = size_t{1} << 20;

/// The text as it can be quoted in a message: without control characters, and cut.
std::string Shown(std::string_view text) {
    constexpr size_t kMost = 60;
    std::string shown;
    for (const char c : text.substr(0, kMost)) {
        const auto byte = static_cast<unsigned char>(c);
        shown += byte < ' ' || byte >= 0x7f ? '?' : c;
    }
    return shown + (text.size() > kMost ? "..." : "");
}

/// Takes the values off the lines of a file.
class LineReader {
public:
    LineReader(const std::string& section, const std::set<std::string>& keys,
               std::map<std::string, std::string>& values)
        : section_(section), keys_(keys), values_(values) {}

    /// What is wrong with the next line; empty when it is as it should be.
    std::string Take(std::string_view line) {
        const std::string_view text = Trimmed(line);
        if (text.empty() || text.front() == '#') {
            return "";
        }
        const size_t close = text.find(']');
        if (text.front() == '[' && close != std::string::npos) {
            return TakeHeader(text.substr(1, close - 1));
        }
        const std::optional<KeyLine> entry = ParseKeyLine(line);
        return entry ? TakeValue(std::string(entry->key), entry->value)
                     : "'" + Shown(text) +
                           "' is neither a [section] nor a key=\"value\" (comments begin with #)";
    }

private:
    std::string TakeHeader(std::string_view name) {
        if (name != section_) {
            return "section [" + Shown(name) + "] is unknown, there is only [" + section_ + "]";
        }
        if (inside_) {
            return "section [" + section_ + "] begins twice";
        }
        inside_ = true;
        return "";
    }

    std::string TakeValue(const std::string& key, std::string_view value) {
        if (!inside_) {
            return "key '" + Shown(key) + "' is before section [" + section_ + "]";
        }
        if (keys_.count(key) == 0) {
            std::string known;
            for (const std::string& one : keys_) {
                known += (known.empty() ? "" : ", ") + one;
            }
            return "key '" + Shown(key) + "' is unknown, there are " + known;
        }
        return values_.emplace(key, value).second ? "" : "key '" + key + "' is there twice";
    }

    const std::string& section_;
    const std::set<std::string>& keys_;
    std::map<std::string, std::string>& values_;
    bool inside_ = false;
};

}  // namespace

ConfigFile::ConfigFile(const std::string& path, const std::string& section,
                       const std::set<std::string>& keys)
    : path_(path) {
    const std::optional<std::string> content = ReadFile(path, kMaxBytes);
    if (!content) {
        if (errno == ENOENT || errno == ENOTDIR) {
            return;
        }
        throw ConfigError(path + " cannot be read: " + strerror(errno));
    }
    std::string_view text = *content;
    if (text.substr(0, kByteOrderMark.size()) == kByteOrderMark) {
        text.remove_prefix(kByteOrderMark.size());
    }
    LineReader reader(section, keys, values_);
    std::string_view line;
    for (int number = 1; TakeLine(text, line); ++number) {
        const std::string problem = reader.Take(line);
        if (!problem.empty()) {
            std::string where = path;
            where.append(", line ").append(std::to_string(number)).append(": ").append(problem);
            throw ConfigError(where);
        }
    }
}

std::string ConfigFile::Text(const std::string& key, const std::string& otherwise) const {
    const auto found = values_.find(key);
    return found == values_.end() || found->second.empty() ? otherwise : found->second;
}

uint64_t ConfigFile::Number(const std::string& key, uint64_t otherwise, uint64_t min,
                            uint64_t max) const {
    const std::string text = Text(key);
    const std::optional<uint64_t> number = text.empty() ? otherwise : ParseNumber(text, max);
    if (!number || *number < min) {
        throw Wrong(key, "not a number from " + std::to_string(min) + " to " + std::to_string(max));
    }
    return *number;
}

ConfigError ConfigFile::Wrong(const std::string& key, const std::string& problem) const {
    return ConfigError(path_ + ": " + key + " is '" + Shown(Text(key)) + "', " + problem);
}

}  // namespace base
