// Lines that are redrawn in place.
#pragma once

#include <string>
#include <vector>

namespace zelctl {

/// A block of lines at the end of the terminal output that is redrawn in place. It never gets
/// taller than the window: lines that do not fit are counted in its last line.
///
/// Only for standard output on a terminal. The destructor leaves the last lines on the screen.
class LiveBlock {
public:
    LiveBlock() = default;
    ~LiveBlock();
    LiveBlock(const LiveBlock&) = delete;
    LiveBlock& operator=(const LiveBlock&) = delete;

    /// Whether standard output is a terminal.
    static bool Possible();
    /// The width of the terminal window.
    static size_t Columns();

    /// Replaces the lines shown before by these, which must be printable.
    void Draw(const std::vector<std::string>& lines);
    /// Removes the lines, so that other output can be written.
    void Clear();

private:
    size_t drawn_ = 0;     // lines on the screen
    bool hidden_ = false;  // whether the cursor is hidden
};

/// The first columns of `text`.
std::string CutToColumns(const std::string& text, size_t columns);

}  // namespace zelctl
