#pragma once

#include <string>
#include <vector>

#include "tests/support/temp_root.h"

namespace test {

/// Collects what the library logs while it lives. One at a time.
class LogCapture {
public:
    /// `level`: the highest level that is collected; everything unless said otherwise.
    explicit LogCapture(int level = 7);
    ~LogCapture();
    LogCapture(const LogCapture&) = delete;
    LogCapture& operator=(const LogCapture&) = delete;

    /// All that was logged, with each line's time taken off and each source line number written as
    /// (N):
    /// "[ERROR] ZEL/zel(N): Fail to get share 'x'\n".
    std::string Text() const;
    /// The same, a line each, without the newline.
    std::vector<std::string> Lines() const;

private:
    TempFolder folder_;
};

}  // namespace test
