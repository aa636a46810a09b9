#include "platform/tarqrsync/message_keeper.h"

namespace TARQ {
namespace Backup {

namespace {

constexpr size_t kKept = 64 * 1024;

}  // namespace

void MessageKeeper::Feed(std::string_view bytes) {
    kept_ += bytes;
    // Cut only now and then, so that much text does not cost a move of the whole for each piece.
    if (kept_.size() > 2 * kKept) {
        kept_.erase(0, kept_.size() - kKept);
        cut_ = true;
    }
}

std::string MessageKeeper::Text() const {
    size_t start = kept_.size() > kKept ? kept_.size() - kKept : 0;
    if (cut_ || start > 0) {
        const size_t line_end = kept_.find('\n', start);
        start = line_end == std::string::npos ? start : line_end + 1;
    }
    std::string result;
    for (size_t i = start; i < kept_.size(); ++i) {
        const auto c = static_cast<unsigned char>(kept_[i]);
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
