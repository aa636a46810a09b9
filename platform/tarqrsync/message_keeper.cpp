#include "platform/tarqrsync/message_keeper.h"

namespace TARQ {
namespace Backup {

namespace {

constexpr size_t kFirst = size_t{4} * 1024;
constexpr size_t kLast = size_t{12} * 1024;

}  // namespace

void MessageKeeper::Feed(std::string_view bytes) {
    const std::string_view head = bytes.substr(0, kFirst - first_.size());
    first_ += head;
    last_ += bytes.substr(head.size());
    // Cut only now and then, so that much text does not cost a move of the whole for each piece.
    if (last_.size() > 2 * kLast) {
        last_.erase(0, last_.size() - kLast);
        cut_ = true;
    }
}

std::string MessageKeeper::Text() const {
    std::string kept = first_;
    size_t start = last_.size() > kLast ? last_.size() - kLast : 0;
    if (cut_ || start > 0) {
        const size_t line_end = last_.find('\n', start);
        start = line_end == std::string::npos ? start : line_end + 1;
        // Half a line at the end of the first part goes, unless it is all that there is.
        const size_t whole = kept.rfind('\n');
        kept = (whole == std::string::npos ? kept + "\n" : kept.substr(0, whole + 1)) + kLeftOut +
               "\n";
    }
    kept += last_.substr(start);
    std::string result;
    for (const char byte : kept) {
        const auto c = static_cast<unsigned char>(byte);
        if (c == '\r') {
            continue;  // ssh ends its lines with one
        }
        if ((c < 0x20 && c != '\n' && c != '\t') || c == 0x7f) {
            result += "\\#";
            result += static_cast<char>('0' + c / 64);
            result += static_cast<char>('0' + c / 8 % 8);
            result += static_cast<char>('0' + c % 8);
        } else {
            result += static_cast<char>(c);
        }
    }
    return result;
}

}  // namespace Backup
}  // namespace TARQ
