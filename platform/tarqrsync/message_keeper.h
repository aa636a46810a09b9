#pragma once

#include <string>
#include <string_view>

namespace TARQ {
namespace Backup {

/// Stands in a text for lines that were not kept.
constexpr char kLeftOut[] = "[...]";

/// Keeps of what programs write to their standard error the first 4 KiB, where the cause stands,
/// and the last 12, whatever a far end has to complain of.
class MessageKeeper {
public:
    void Feed(std::string_view bytes);

    /// What is kept, whole lines, with kLeftOut between the two parts when there was more; ready to
    /// be shown: tabs and newlines stand, any other control character is written as \#ooo.
    std::string Text() const;

private:
    std::string first_;
    std::string last_;
    bool cut_ = false;
};

}  // namespace Backup
}  // namespace TARQ
