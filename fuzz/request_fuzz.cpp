// A request to the daemon, as any bytes that a peer sends: refused with a reason, or a task that is
// sound and comes back as it was taken.
#include <sys/socket.h>
#include <unistd.h>

#include <cstdint>

#include "ZEL/log.h"
#include "ZEL/stream.h"
#include "fuzz/require.h"
#include "programs/common/failure.h"
#include "programs/zel_daemon/task_map.h"

namespace {

constexpr size_t kMaxInput = 32768;  // what a socket pair holds without a reader

bool Receive(const uint8_t* data, size_t size, ZEL::PObject& value) {
    int fds[2];
    Require(socketpair(AF_UNIX, SOCK_STREAM, 0, fds) == 0);
    ZEL::Channel channel(256);
    Require(channel.Open(fds[0], true) == 0);
    Require(write(fds[1], data, size) == static_cast<ssize_t>(size));
    close(fds[1]);
    return ZEL::PStream().Recv(channel, value) == 0;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    static const int silent = ZEL::Logger::Initialize(ZEL::Logger::STDERR, -1, "", 0);
    ZEL::PObject request;
    if (silent != 0 || size > kMaxInput || !Receive(data, size, request)) {
        return -1;
    }
    // Shares are looked up on this host, which has none.
    request.asMap().erase("share_list");
    zel_daemon::TaskRecord task;
    task.task.GetInfo().SetShareList({"share"});
    const std::string before = task.ToMap().toString();
    try {
        zel_daemon::ApplyRequest(request, task);
    } catch (const programs::Failure& failure) {
        Require(failure.what()[0] != '\0' && failure.Status() < 0);
        Require(task.ToMap().toString() == before);
        return 0;
    }
    Require(!task.Name().empty() && task.Info().GetSyncInfo().Validate() &&
            task.Info().GetSchedule().Validate());
    const ZEL::PObject taken = task.ToMap();
    zel_daemon::TaskRecord again;
    again.task.GetInfo().SetShareList({"share"});
    ZEL::PObject settings = taken;
    settings.asMap().erase("share_list");
    zel_daemon::ApplyRequest(settings, again);
    Require(again.ToMap().toString() == taken.toString());
    return 0;
}
