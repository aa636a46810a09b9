// Lines that are redrawn in place.
#pragma once

#include <string>
#include <vector>

namespace zelctl {

/// A block of lines at the bottom of what has been written to a terminal. It never grows taller
/// than the window: what does not fit is counted in its last line.
///
/// Only for a standard output that is a terminal. Destroyed, it leaves its last lines standing.
class LiveBlock {
public:
    LiveBlock() = default;
    ~LiveBlock();
    LiveBlock(const LiveBlock&) = delete;
    LiveBlock& operator=(const LiveBlock&) = delete;

    /// Whether standard output is a terminal.
    static bool Possible();
    /// The width of its window.
    static size_t Columns();

    /// Shows these lines, which must be printable, in place of those of before.
    void Draw(const std::vector<std::string>& lines);
    /// Takes the lines away, before others are written.
    void Clear();

private:
    size_t drawn_ = 0;     // lines that stand
    bool hidden_ = false;  // the cursor
};

/// The first columns of `text`.
std::string CutToColumns(const std::string& text, size_t columns);

}  // namespace zelctl
