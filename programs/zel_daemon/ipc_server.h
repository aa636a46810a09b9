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
    using Handler = std::function<Answer(const Peer&, const ZEL::PObject&)>;

    /// Connections at the same time. Root and the daemon's own user have places of their own, so
    /// that nobody can keep them out, and of the others each user has some. A connection that stays
    /// (a watcher's, a preview's) may have all of them but some that are left for short requests.
    ///
    /// For one more, that of the same people is closed which has been asking nothing for the
    /// longest time; when there is none such, the new one, after it was told why. Likewise when
    /// descriptors run out.
    struct Places {
        size_t all;
        size_t of_user;
        size_t staying;
        size_t staying_of_user;
    };
    static constexpr Places kMembers = {64, 24, 48, 16};
    static constexpr Places kOwners = {32, 32, 24, 24};

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
    class Refusal;

    /// Those who share places.
    static const Places& PlacesOf(const Peer& peer) { return peer.trusted ? kOwners : kMembers; }

    int AcceptOne();
    void Accept();
    void TellShortage(int error);
    void SweepEnded();
    bool EndLongestWaiting(const std::function<bool(const Session&)>& may);
    bool MakePlace(const Peer& peer);
    std::string WhyNotStay(const Peer& peer) const;
    Answer AnswerOf(Session& session, const ZEL::PObject& request);
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
    std::list<Refusal> refused_;  // the last ones, which may still be reading why
};

}  // namespace zel_daemon
