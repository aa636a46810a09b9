#include "programs/zel_daemon/index_stamp.h"

#include <algorithm>

namespace zel_daemon {

namespace {

using programs::KnownCopy;
using programs::ShareNotes;

bool Has(const std::vector<std::string>& marks, const std::string& mark) {
    return std::find(marks.begin(), marks.end(), mark) != marks.end();
}

bool Has(const ShareNotes& notes, const KnownCopy& copy) {
    return std::any_of(notes.copies.begin(), notes.copies.end(), [&](const KnownCopy& noted) {
        return noted.identity == copy.identity && noted.generation == copy.generation &&
               noted.push == copy.push;
    });
}

}  // namespace

bool IsInStep(const IndexStamp& stamp, const ShareNotes& now, const std::string& settings) {
    return stamp.settings == settings && Has(now, stamp.copy) &&
           std::all_of(now.begun.begin(), now.begun.end(),
                       [&](const std::string& mark) { return Has(stamp.begun, mark); });
}

std::optional<KnownCopy> CopyAfter(const ShareNotes& before, const ShareNotes& after,
                                   const std::string& mark, const std::optional<KnownCopy>& known) {
    const bool alone = std::all_of(
        after.begun.begin(), after.begun.end(),
        [&](const std::string& begun) { return begun == mark || Has(before.begun, begun); });
    if (!alone || mark.empty()) {
        return std::nullopt;
    }
    const auto left = std::find_if(after.copies.begin(), after.copies.end(),
                                   [&](const KnownCopy& copy) { return copy.push == mark; });
    if (left == after.copies.end()) {
        return known && Has(after, *known) ? known : std::nullopt;
    }
    const bool went_on =
        known && known->identity == left->identity && left->generation > known->generation + 1;
    return went_on ? std::nullopt : std::optional(*left);
}

}  // namespace zel_daemon
