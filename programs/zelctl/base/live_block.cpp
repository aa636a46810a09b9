#include "programs/zelctl/base/live_block.h"

#include <sys/ioctl.h>
#include <unistd.h>

#include <cstdio>

#include "programs/common/text.h"

namespace zelctl {

namespace {

struct WindowSize {
    size_t rows = 24;
    size_t columns = 80;
};

WindowSize GetWindowSize() {
    struct winsize window = {};
    WindowSize size;
    if (ioctl(STDOUT_FILENO, TIOCGWINSZ, &window) == 0 && window.ws_row > 0 && window.ws_col > 0) {
        size.rows = window.ws_row;
        size.columns = window.ws_col;
    }
    return size;
}

// A line may be wider than calculated (some terminals show certain characters in two columns).
// Without automatic wrapping it still takes only one row.
constexpr char kNoWrap[] = "\033[?7l";
constexpr char kWrap[] = "\033[?7h";
constexpr char kHideCursor[] = "\033[?25l";
constexpr char kShowCursor[] = "\033[?25h";
constexpr char kToLineEnd[] = "\033[K";
constexpr char kToScreenEnd[] = "\033[J";

}  // namespace

LiveBlock::~LiveBlock() {
    if (hidden_) {
        fputs(kShowCursor, stdout);
        fflush(stdout);
    }
}

bool LiveBlock::Possible() {
    return isatty(STDOUT_FILENO) != 0;
}

size_t LiveBlock::Columns() {
    return GetWindowSize().columns;
}

void LiveBlock::Draw(const std::vector<std::string>& lines) {
    const WindowSize window = GetWindowSize();
    const size_t room = window.rows - 1;  // one row is left for the cursor
    const size_t shown = lines.size() <= room ? lines.size() : room - (room > 0 ? 1 : 0);
    std::string text = hidden_ ? "" : kHideCursor;
    hidden_ = true;
    if (drawn_ > 0) {
        text += "\r\033[" + std::to_string(drawn_) + "A";
    }
    text += kNoWrap;
    for (size_t i = 0; i < shown; ++i) {
        text += CutToColumns(lines[i], window.columns) + kToLineEnd + "\n";
    }
    drawn_ = shown;
    if (shown < lines.size() && room > 0) {
        text += "... and " + programs::Count(lines.size() - shown, "line") + " more" + kToLineEnd +
                "\n";
        ++drawn_;
    }
    text += std::string(kToScreenEnd) + kWrap;
    fputs(text.c_str(), stdout);
    fflush(stdout);
}

void LiveBlock::Clear() {
    if (drawn_ > 0) {
        printf("\r\033[%zuA%s", drawn_, kToScreenEnd);
        fflush(stdout);
        drawn_ = 0;
    }
}

std::string CutToColumns(const std::string& text, size_t columns) {
    size_t used = 0;
    for (size_t i = 0; i < text.size(); ++i) {
        const bool begins_character = (static_cast<unsigned char>(text[i]) & 0xc0) != 0x80;
        if (begins_character && ++used > columns) {
            return text.substr(0, i);
        }
    }
    return text;
}

}  // namespace zelctl
