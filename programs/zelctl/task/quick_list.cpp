#include "programs/zelctl/task/quick_list.h"

#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>

#include <cstdio>
#include <cstring>
#include <string>
#include <string_view>
#include <vector>

#include "base/unique_fd.h"
#include "programs/common/table.h"
#include "programs/common/task_row.h"
#include "tarq/root_path.h"

namespace zelctl {

namespace {

constexpr char kSocket[] = "/var/run/zel_daemon.sock";
constexpr timeval kPatience = {10, 0};
constexpr size_t kReadAtOnce = size_t{256} * 1024;
constexpr size_t kMaxReply = size_t{256} << 20;

// docs/wire-format.md
constexpr unsigned char kInteger = 0x01;
constexpr unsigned char kString = 0x10;
constexpr unsigned char kEnd = 0x40;
constexpr unsigned char kArray = 0x41;
constexpr unsigned char kMap = 0x42;

// {"command": "task_list", "rows": 1}
constexpr char kRequest[] =
    "\x42\x10\0\x07"
    "command\x10\0\x09"
    "task_list\x10\0\x04"
    "rows\x01\x01\x01\x40";

base::UniqueFd ConnectToDaemon() {
    const std::string path = TARQ::RootPath(kSocket);
    sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    if (path.size() >= sizeof address.sun_path) {
        return {};
    }
    memcpy(address.sun_path, path.data(), path.size());
    base::UniqueFd fd(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    const bool connected =
        fd && setsockopt(fd.Get(), SOL_SOCKET, SO_SNDTIMEO, &kPatience, sizeof kPatience) == 0 &&
        setsockopt(fd.Get(), SOL_SOCKET, SO_RCVTIMEO, &kPatience, sizeof kPatience) == 0 &&
        connect(fd.Get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0;
    return connected ? std::move(fd) : base::UniqueFd();
}

/// Reads a reply as it comes. Once something is not as it should be, all that follows is empty.
class WireReader {
public:
    explicit WireReader(int fd) : fd_(fd) {}

    bool Good() const { return good_; }
    void Refuse() { good_ = false; }

    unsigned char Byte() {
        const std::string_view byte = Bytes(1);
        return byte.empty() ? 0 : static_cast<unsigned char>(byte[0]);
    }
    /// Valid until the next call.
    std::string_view Bytes(size_t count) {
        while (good_ && bytes_.size() - at_ < count) {
            Receive();
        }
        if (!good_) {
            return {};
        }
        at_ += count;
        return {bytes_.data() + at_ - count, count};
    }
    /// A string whose tag has been read.
    std::string_view String() {
        const size_t high = Byte();
        return Bytes(high << 8 | Byte());
    }
    uint64_t Integer() {
        uint64_t value = 0;
        for (size_t left = Byte(); left > 0 && good_; --left) {
            value = value << 8 | Byte();
        }
        return value;
    }

private:
    void Receive() {
        if (bytes_.size() > kMaxReply) {
            good_ = false;
            return;
        }
        const size_t held = bytes_.size();
        bytes_.resize(held + kReadAtOnce);
        const ssize_t got = recv(fd_, bytes_.data() + held, kReadAtOnce, 0);
        good_ = got > 0;
        bytes_.resize(held + (good_ ? static_cast<size_t>(got) : 0));
    }

    int fd_;
    bool good_ = true;
    std::string bytes_;
    size_t at_ = 0;
};

void ReadRows(WireReader& reader, std::vector<programs::TaskRow>& rows) {
    if (reader.Byte() != kArray) {
        reader.Refuse();
    }
    for (unsigned char tag = reader.Byte(); reader.Good() && tag != kEnd; tag = reader.Byte()) {
        programs::TaskRow row;
        if (tag != kString || !programs::UnpackTaskRow(reader.String(), row)) {
            reader.Refuse();
            return;
        }
        rows.push_back(std::move(row));
    }
}

// {"result": 0, "rows": [...]}, and nothing else.
bool ReadReply(WireReader& reader, std::vector<programs::TaskRow>& rows) {
    bool has_rows = false;
    if (reader.Byte() != kMap) {
        return false;
    }
    for (unsigned char tag = reader.Byte(); reader.Good() && tag != kEnd; tag = reader.Byte()) {
        const std::string key(tag == kString ? reader.String() : "");
        if (key == "rows") {
            ReadRows(reader, rows);
            has_rows = true;
        } else if (key != "result" || reader.Byte() != kInteger || reader.Integer() != 0) {
            return false;
        }
    }
    return reader.Good() && has_rows;
}

}  // namespace

bool PrintTaskListQuickly() {
    const base::UniqueFd fd = ConnectToDaemon();
    constexpr size_t kRequestBytes = sizeof kRequest - 1;
    if (!fd || send(fd.Get(), kRequest, kRequestBytes, MSG_NOSIGNAL) != kRequestBytes) {
        return false;
    }
    WireReader reader(fd.Get());
    std::vector<programs::TaskRow> rows;
    if (!ReadReply(reader, rows)) {
        return false;
    }
    std::string text;
    for (const std::string& line : programs::TaskLines(std::move(rows), programs::OutputWidth())) {
        (text += line) += '\n';
    }
    fwrite(text.data(), 1, text.size(), stdout);
    return true;
}

}  // namespace zelctl
