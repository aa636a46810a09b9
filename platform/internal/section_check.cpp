#include "platform/internal/section_check.h"

#include <optional>

#include "platform/internal/config.h"
#include "platform/tarqcore/section_image.h"

namespace tarq_internal {

namespace {

constexpr char kByteOrderMark[] = "\xef\xbb\xbf";

/// Within the quotes of a message, in which a file's odd bytes have no place.
std::string Shown(std::string_view text) {
    constexpr size_t kMost = 60;
    std::string shown;
    for (const char c : text.substr(0, kMost)) {
        const auto byte = static_cast<unsigned char>(c);
        shown += byte < ' ' || byte >= 0x7f ? '?' : c;
    }
    return shown + (text.size() > kMost ? "..." : "");
}

class Check {
public:
    Check(std::string_view section, const std::set<std::string>& keys)
        : section_(section), keys_(keys) {}

    /// What is wrong with the next line; empty when it is as it should be.
    std::string Line(std::string_view line) {
        const std::string text = Trimmed(std::string(line));
        if (text.empty() || text.front() == '#') {
            return "";
        }
        const size_t close = text.find(']');
        if (text.front() == '[' && close != std::string::npos) {
            return Header(text.substr(1, close - 1));
        }
        const std::optional<tarqcore::KeyLine> entry = tarqcore::ParseKeyLine(line);
        return entry ? Key(std::string(entry->key))
                     : "'" + Shown(text) +
                           "' is neither a [section] nor a key=\"value\" (comments begin with #)";
    }

private:
    std::string Header(const std::string& name) {
        if (name != section_) {
            return "section [" + Shown(name) + "] is unknown, there is only [" + section_ + "]";
        }
        if (inside_) {
            return "section [" + section_ + "] begins twice";
        }
        inside_ = true;
        return "";
    }
    std::string Key(const std::string& key) {
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
        return seen_.insert(key).second ? "" : "key '" + key + "' is there twice";
    }

    const std::string section_;
    const std::set<std::string>& keys_;
    bool inside_ = false;
    std::set<std::string> seen_;
};

}  // namespace

std::string FindStray(std::string_view text, std::string_view section,
                      const std::set<std::string>& keys) {
    if (text.substr(0, 3) == kByteOrderMark) {
        text.remove_prefix(3);
    }
    Check check(section, keys);
    std::string_view line;
    for (int number = 1; tarqcore::TakeLine(text, line); ++number) {
        const std::string problem = check.Line(line);
        if (!problem.empty()) {
            return "line " + std::to_string(number) + ": " + problem;
        }
    }
    return "";
}

}  // namespace tarq_internal
