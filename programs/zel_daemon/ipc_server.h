// The daemon's socket: who may ask, requests in, replies out.
#pragma once

#include <sys/types.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <functional>
#include <list>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>

#include "ZEL/ipc.h"
#include "ZEL/pobject.h"
#include "base/unique_fd.h"
#include "programs/zel_daemon/event_loop.h"
#include "programs/zel_daemon/requests.h"

namespace zel_daemon {

/// Accepts on the loop's thread. Each connection then has a thread of its own, which reads requests
/// and writes replies, so that a slow or hostile peer holds up nobody but itself; requests are
/// answered on the loop's thread.
///
/// Threads: the loop's, except that Changed() may be called by any.
class IpcServer {
public:
    /// Answers one request, on the loop's thread.
    using Handler = std::function<ZEL::PObject(const Peer&, const ZEL::PObject&)>;

    /// Connections at the same time. For one more, that is closed which has been asking nothing for
    /// the longest time; when there is none such, the new one. Likewise when descriptors run out.
    static constexpr size_t kMaxConnections = 64;

    /// Listens at `path`, mode 0660 and of the group when one is named. Throws std::runtime_error.
    IpcServer(EventLoop& loop, const std::string& path, const std::string& group, Handler handler);
    /// Ends all connections.
    ~IpcServer();
    IpcServer(const IpcServer&) = delete;
    IpcServer& operator=(const IpcServer&) = delete;

    /// What watchers see may have changed.
    void Changed();

private:
    class Session;

    int AcceptOne();
    void Accept();
    void TellShortage(int error);
    void SweepEnded();
    void EndLongestWaiting();
    bool MayAsk(int fd, Peer& peer) const;
    bool WaitForChange(const Session& session, uint64_t& seen);

    EventLoop& loop_;
    Handler handler_;
    ZEL::IPCListener listener_;
    uid_t own_user_;
    gid_t group_ = static_cast<gid_t>(-1);
    base::UniqueFd spare_;  // given up to turn a connection away when no descriptor is left
    std::optional<std::chrono::steady_clock::time_point> shortage_told_;
    std::mutex mutex_;
    std::condition_variable changed_;
    uint64_t version_ = 1;  // under the mutex: counts changes
    std::list<std::unique_ptr<Session>> sessions_;
};

}  // namespace zel_daemon
