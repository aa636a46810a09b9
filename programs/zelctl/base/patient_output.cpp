#include "programs/zelctl/base/patient_output.h"

#include <limits.h>
#include <poll.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>

namespace zelctl {

namespace {

// A pipe that poll() reports as writable accepts at least this many bytes.
constexpr size_t kPiece = PIPE_BUF;

bool HasRoom() {
    pollfd output = {STDOUT_FILENO, POLLOUT, 0};
    return poll(&output, 1, 0) > 0;
}

// The number of bytes written; 0 when there is no reader any more.
size_t WriteOut(const char* bytes, size_t size) {
    ssize_t written = 0;
    while ((written = write(STDOUT_FILENO, bytes, size)) < 0 && errno == EINTR) {
    }
    return written < 0 ? 0 : static_cast<size_t>(written);
}

}  // namespace

void PatientOutput::Write(const std::string& text) {
    fflush(stdout);
    Pump(false);
    size_t done = 0;
    for (size_t count = 1; done < text.size() && count > 0; done += count) {
        if (begin_ == end_ && HasRoom()) {
            count = WriteOut(text.data() + done, std::min(kPiece, text.size() - done));
            continue;
        }
        if (!file_) {
            file_.reset(tmpfile());
        }
        const ssize_t kept =
            !file_ ? -1 : pwrite(fileno(file_.get()), text.data() + done, text.size() - done, end_);
        if (kept > 0) {
            end_ += kept;
            count = static_cast<size_t>(kept);
        } else {
            Pump(true);
            count = WriteOut(text.data() + done, text.size() - done);
        }
    }
}

void PatientOutput::Finish() {
    Pump(true);
}

void PatientOutput::Pump(bool may_wait) {
    char bytes[kPiece];
    while (begin_ < end_ && (may_wait || HasRoom())) {
        const auto wanted = static_cast<size_t>(std::min<off_t>(end_ - begin_, sizeof bytes));
        const ssize_t count = pread(fileno(file_.get()), bytes, wanted, begin_);
        const size_t written = count <= 0 ? 0 : WriteOut(bytes, static_cast<size_t>(count));
        if (written == 0) {
            begin_ = end_;
            return;
        }
        begin_ += static_cast<off_t>(written);
    }
}

}  // namespace zelctl
