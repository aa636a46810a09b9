#pragma once

#include <string>
#include <string_view>

namespace TARQ {
namespace Backup {

/// Keeps the last 64 KiB of what programs write to their standard error.
class MessageKeeper {
public:
    void Feed(std::string_view bytes);

    /// What is kept, from a line's start on, ready to be shown: tabs and newlines stand, any other
    /// control character is written as \#ooo.
    std::string Text() const;

private:
    std::string kept_;
    bool cut_ = false;
};

}  // namespace Backup
}  // namespace TARQ
