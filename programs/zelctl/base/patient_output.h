#pragma once

#include <cstdio>
#include <memory>
#include <string>

namespace zelctl {

/// Buffered standard output, for text from a sender that must not be blocked by a slow reader such
/// as a pager. What the reader has not accepted yet is kept in an anonymous temporary file.
class PatientOutput {
public:
    PatientOutput() = default;
    PatientOutput(const PatientOutput&) = delete;
    PatientOutput& operator=(const PatientOutput&) = delete;

    /// Does not block, unless the file cannot be created.
    void Write(const std::string& text);
    /// Blocks until everything is written.
    void Finish();

private:
    void Pump(bool may_wait);

    struct Close {
        void operator()(FILE* file) const { fclose(file); }
    };
    std::unique_ptr<FILE, Close> file_;
    off_t begin_ = 0;  // of the unwritten part of the file
    off_t end_ = 0;
};

}  // namespace zelctl
