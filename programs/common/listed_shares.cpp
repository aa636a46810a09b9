#include "programs/common/listed_shares.h"

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <string_view>

#include "base/section_view.h"
#include "base/text.h"
#include "base/whole_file.h"
#include "programs/common/failure.h"
#include "tarq/root_path.h"
#include "tarq/share.h"

namespace programs {

namespace {

constexpr char kCatalogue[] = "/usr/tarq/etc/tarqshare.conf";

// "acl|windows", or numbers for their bits.
unsigned int FlagsIn(std::string_view text) {
    unsigned int flags = 0;
    while (!text.empty()) {
        const size_t end = std::min(text.find_first_of("|, \t"), text.size());
        const std::string word = base::Lower(std::string(text.substr(0, end)));
        text.remove_prefix(std::min(end + 1, text.size()));
        flags |= word == "acl"       ? unsigned{TARQ_SHARE_ACL}
                 : word == "windows" ? unsigned{TARQ_SHARE_WINDOWS}
                 : word == "encrypted"
                     ? unsigned{TARQ_SHARE_ENCRYPTED}
                     : static_cast<unsigned int>(strtoul(word.c_str(), nullptr, 0));
    }
    return flags;
}

}  // namespace

std::vector<ListedShare> ListedShares() {
    const std::string path = TARQ::RootPath(kCatalogue);
    const auto text = base::ReadFile(path);
    if (!text && errno != ENOENT) {
        throw SystemFailure("cannot read " + path, FailureKind::kLocal);
    }
    std::vector<ListedShare> shares;
    std::string_view rest = text ? std::string_view(*text) : std::string_view();
    for (std::string_view line; base::TakeLine(rest, line);) {
        const std::string_view trimmed = base::Trimmed(line);
        if (trimmed.size() > 2 && trimmed.front() == '[' && trimmed.back() == ']') {
            shares.emplace_back();
            shares.back().name = trimmed.substr(1, trimmed.size() - 2);
            continue;
        }
        const auto pair = base::ParseKeyLine(line);
        if (!pair || shares.empty()) {
            continue;
        }
        ListedShare& share = shares.back();
        if (pair->key == "path") {
            share.folder = pair->value;
        } else if (pair->key == "volume") {
            share.volume = pair->value;
        } else if (pair->key == "flags") {
            const unsigned int flags = FlagsIn(pair->value);
            share.acl = (flags & TARQ_SHARE_ACL) != 0;
            share.windows = (flags & TARQ_SHARE_WINDOWS) != 0;
            share.encrypted = (flags & TARQ_SHARE_ENCRYPTED) != 0;
        }
    }
    shares.erase(std::remove_if(shares.begin(), shares.end(),
                                [](const ListedShare& share) { return share.folder.empty(); }),
                 shares.end());
    std::sort(shares.begin(), shares.end(),
              [](const ListedShare& a, const ListedShare& b) { return a.name < b.name; });
    return shares;
}

}  // namespace programs
