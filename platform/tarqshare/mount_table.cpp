#include "platform/tarqshare/mount_table.h"

#include <algorithm>
#include <charconv>
#include <sstream>

namespace tarq_share {
namespace {

/// Blanks, line ends and backslashes stand as a backslash and three octal digits.
std::string Unescaped(const std::string& field) {
    const auto is_octal = [](char c) { return c >= '0' && c <= '7'; };
    std::string text;
    for (size_t i = 0; i < field.size(); ++i) {
        if (field[i] == '\\' && i + 3 < field.size() && field[i + 1] <= '3' &&
            is_octal(field[i + 1]) && is_octal(field[i + 2]) && is_octal(field[i + 3])) {
            text += static_cast<char>((field[i + 1] - '0') * 64 + (field[i + 2] - '0') * 8 +
                                      (field[i + 3] - '0'));
            i += 3;
        } else {
            text += field[i];
        }
    }
    return text;
}

template <typename Integer>
bool ParseNumber(const std::string& text, Integer* number) {
    const char* end = text.data() + text.size();
    const auto [stop, error] = std::from_chars(text.data(), end, *number);
    return error == std::errc() && stop == end;
}

bool ParseDevice(const std::string& text, Mount* mount) {
    const size_t colon = text.find(':');
    return colon != std::string::npos && ParseNumber(text.substr(0, colon), &mount->major) &&
           ParseNumber(text.substr(colon + 1), &mount->minor);
}

/// ID PARENT MAJ:MIN ROOT MOUNT_POINT OPTIONS [OPTIONAL...] - TYPE SOURCE SUPER_OPTIONS
std::optional<Mount> ParseLine(const std::string& line) {
    std::istringstream fields(line);
    std::string id;
    std::string parent;
    std::string device;
    std::string root;
    std::string mount_point;
    std::string field;
    Mount mount{};
    if (!(fields >> id >> parent >> device >> root >> mount_point >> field) ||
        !ParseNumber(id, &mount.id) || !ParseNumber(parent, &mount.parent_id) ||
        !ParseDevice(device, &mount)) {
        return std::nullopt;
    }
    while (fields >> field && field != "-") {
    }
    if (!(fields >> mount.type)) {
        return std::nullopt;
    }
    // A file system may be mounted without any source: two blanks then stand side by side.
    fields.ignore(1);
    std::getline(fields, field, ' ');
    mount.root = Unescaped(root);
    mount.mount_point = Unescaped(mount_point);
    mount.source = Unescaped(field);
    return mount;
}

}  // namespace

std::vector<Mount> ParseMountTable(const std::string& text) {
    std::vector<Mount> table;
    std::istringstream lines(text);
    for (std::string line; std::getline(lines, line);) {
        if (auto mount = ParseLine(line)) {
            table.push_back(std::move(*mount));
        }
    }
    return table;
}

const Mount* FindMount(const std::vector<Mount>& table, const std::string& real_path,
                       std::optional<uint64_t> mount_id) {
    if (mount_id) {
        const auto found = std::find_if(table.begin(), table.end(),
                                        [&](const Mount& mount) { return mount.id == *mount_id; });
        if (found != table.end()) {
            return &*found;
        }
    }
    const Mount* best = nullptr;
    for (const Mount& mount : table) {
        if (IsWithin(real_path, mount.mount_point) &&
            (best == nullptr || mount.mount_point.size() >= best->mount_point.size())) {
            best = &mount;
        }
    }
    return best;
}

bool IsWithin(const std::string& path, const std::string& folder) {
    if (folder == "/") {
        return !path.empty() && path.front() == '/';
    }
    return path.compare(0, folder.size(), folder) == 0 &&
           (path.size() == folder.size() || path[folder.size()] == '/');
}

}  // namespace tarq_share
