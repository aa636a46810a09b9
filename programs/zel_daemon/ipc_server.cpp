#include "programs/zel_daemon/ipc_server.h"

#include <fcntl.h>
#include <grp.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <future>
#include <optional>
#include <stdexcept>
#include <system_error>
#include <utility>
#include <vector>

#include "ZEL/channel.h"
#include "ZEL/log.h"
#include "ZEL/stream.h"
#include "base/unix_socket.h"
#include "programs/common/wire_text.h"
#include "programs/zel_daemon/shortage.h"

namespace zel_daemon {

namespace {

using std::chrono::milliseconds;
using std::chrono::steady_clock;
using ZEL::Logger;
using ZEL::PObject;

constexpr unsigned int kChannelBytes = 81920;      // as an IPCSender's
constexpr unsigned int kIdleSeconds = 60;          // a connection that asks nothing is closed
constexpr unsigned int kRefusedSeconds = 5;        // one that may not ask has less time to
constexpr size_t kMaxRequestBytes = 1 << 20;       // a task with thousands of patterns has less
constexpr milliseconds kWatchEvery(200);           // a watcher hears no more often than this ...
constexpr std::chrono::seconds kWatchAtLeast(30);  // ... and no less
constexpr std::chrono::seconds kPeerCheck(1);      // how soon a watcher that has gone is noticed

constexpr std::chrono::minutes kTellEvery(1);  // of a shortage
constexpr size_t kRefusedKept = 16;
constexpr unsigned int kRefusalBytes = 4096;

bool IsShortage(int error) {
    return error == EMFILE || error == ENFILE || error == ENOMEM || error == ENOBUFS;
}

base::UniqueFd SpareDescriptor() {
    return base::UniqueFd(open("/dev/null", O_RDONLY | O_CLOEXEC));
}

// The socket file is never open to others, not even before its mode is set.
class Umask {
public:
    explicit Umask(mode_t mask) : before_(umask(mask)) {}
    ~Umask() { umask(before_); }
    Umask(const Umask&) = delete;
    Umask& operator=(const Umask&) = delete;

private:
    mode_t before_;
};

// Whether the other side asks something more; false when it goes, or is silent for so long.
bool IsAsking(int fd, unsigned int seconds, const std::function<bool()>& stopped) {
    for (unsigned int i = 0; i < seconds && !stopped(); ++i) {
        pollfd watched = {fd, POLLIN, 0};
        if (poll(&watched, 1, 1000) > 0) {
            char byte = 0;
            return recv(fd, &byte, 1, MSG_PEEK | MSG_DONTWAIT) == 1;
        }
    }
    return false;
}

// Whether the other side still listens.
bool IsPeerThere(int fd) {
    pollfd watched = {fd, POLLRDHUP, 0};
    return poll(&watched, 1, 0) == 0;
}

// Takes what has come and nobody reads: closing over it would tell the other side of a broken
// connection.
void Drain(int fd) {
    char bytes[4096];
    for (int i = 0; i < 64 && recv(fd, bytes, sizeof bytes, MSG_DONTWAIT) > 0; ++i) {
    }
}

/// Gives up in the middle of a request that is too large.
class RequestChannel : public ZEL::Channel {
public:
    using Channel::Channel;

    void Begin() { left_ = kMaxRequestBytes; }

    int ReadByte(unsigned char* value) override {
        return Take(sizeof *value) ? Channel::ReadByte(value) : int{ZEL::RESULT_PROTOCOL};
    }
    int ReadInt16(unsigned short* value) override {
        return Take(sizeof *value) ? Channel::ReadInt16(value) : int{ZEL::RESULT_PROTOCOL};
    }
    using Channel::Read;
    int Read(char* buffer, unsigned int want) override {
        return Take(want) ? Channel::Read(buffer, want) : int{ZEL::RESULT_PROTOCOL};
    }
    bool TooLarge() const { return left_ == 0; }

private:
    bool Take(size_t bytes) {
        left_ -= std::min(bytes, left_);
        return left_ > 0;
    }

    size_t left_ = kMaxRequestBytes;
};

bool HasGroup(int fd, const ucred& peer, gid_t group) {
    if (peer.gid == group) {
        return true;
    }
    std::vector<gid_t> groups(64);
    for (;;) {
        auto size = static_cast<socklen_t>(groups.size() * sizeof(gid_t));
        if (getsockopt(fd, SOL_SOCKET, SO_PEERGROUPS, groups.data(), &size) == 0) {
            groups.resize(size / sizeof(gid_t));
            return std::find(groups.begin(), groups.end(), group) != groups.end();
        }
        if (errno != ERANGE) {
            return false;
        }
        groups.resize(size / sizeof(gid_t) + 1);
    }
}

PObject ErrorReply(int code, const std::string& error) {
    PObject reply;
    reply["result"] = code;
    reply["error"] = error;
    return reply;
}

}  // namespace

/// A connection for which there is no place: it is told, without a thread, and kept open for a
/// while, because closing over a request that nobody reads would take away what it is told.
class IpcServer::Refusal {
public:
    Refusal(int fd, const std::string& why) : channel_(kRefusalBytes) {
        if (channel_.Open(fd, true) != ZEL::RESULT_SUCCESS) {
            close(fd);
            return;
        }
        // What is new has room for so little: this does not wait.
        ZEL::PStream().Send(channel_, ErrorReply(ZEL::RESULT_QUOTA, why));
    }
    ~Refusal() { channel_.Close(); }
    Refusal(const Refusal&) = delete;
    Refusal& operator=(const Refusal&) = delete;

private:
    ZEL::Channel channel_;
};

/// One connection, on a thread of its own.
class IpcServer::Session {
public:
    Session(IpcServer& server, int fd, bool allowed, const Peer& peer)
        : server_(server), fd_(fd), peer_(peer), channel_(kChannelBytes) {
        channel_.SetFlag(&stop_);
        channel_.SetTimeout(kIdleSeconds);
        thread_ = std::thread([this, allowed] {
            Serve(allowed);
            channel_.Close();
            ended_ = true;
        });
    }
    ~Session() {
        Stop();
        thread_.join();
    }

    /// Lets the thread end soon.
    void Stop() { __atomic_store_n(&stop_, 1, __ATOMIC_RELAXED); }
    bool Stopped() const { return __atomic_load_n(&stop_, __ATOMIC_RELAXED) != 0; }
    bool Ended() const { return ended_; }
    bool HasPeer() const { return !Stopped() && IsPeerThere(fd_); }
    const Peer& Who() const { return peer_; }

    /// Whether it has a place among those that stay; the loop's thread alone.
    bool stays = false;

    /// Since when the other side is to send a request; nothing while it is answered.
    std::optional<steady_clock::time_point> WaitingSince() {
        const std::lock_guard<std::mutex> lock(mutex_);
        return waiting_since_;
    }
    /// Lets the thread end at once if it waits for a request.
    void StopWaiting() {
        const std::lock_guard<std::mutex> lock(mutex_);
        if (waiting_since_) {
            Stop();
            shutdown(fd_, SHUT_RDWR);
        }
    }

private:
    void SetWaiting(bool waiting) {
        const std::lock_guard<std::mutex> lock(mutex_);
        waiting_since_ = waiting ? std::optional(steady_clock::now()) : std::nullopt;
    }

    void Serve(bool allowed) {
        if (channel_.Open(fd_, true) != ZEL::RESULT_SUCCESS) {
            close(fd_);
            return;
        }
        while (ServeOne(allowed)) {
        }
    }

    // False: the connection has had its last reply.
    bool ServeOne(bool allowed) {
        PObject request;
        SetWaiting(true);
        const bool asks =
            IsAsking(fd_, allowed ? kIdleSeconds : kRefusedSeconds, [this] { return Stopped(); });
        channel_.Begin();
        const int received =
            asks && allowed ? ZEL::PStream().Recv(channel_, request) : int{ZEL::RESULT_SUCCESS};
        SetWaiting(false);
        if (!asks || Stopped()) {
            return false;
        }
        if (!allowed) {
            return SendLast(ZEL::RESULT_NO_PERMISSION,
                            "only root, the daemon's own user and the members of its group "
                            "(zel_daemon.conf) may ask it");
        }
        if (channel_.TooLarge()) {
            return SendLast(ZEL::RESULT_PROTOCOL,
                            "a request has at most " + std::to_string(kMaxRequestBytes) + " bytes");
        }
        if (received == ZEL::RESULT_PROTOCOL) {
            return SendLast(ZEL::RESULT_PROTOCOL, "what was sent is no value");
        }
        return received == ZEL::RESULT_SUCCESS && Reply(request);
    }

    bool SendLast(int code, const std::string& error) {
        PObject refusal = ErrorReply(code, error);
        Send(refusal);
        Drain(fd_);
        return false;
    }

    bool Send(PObject& reply) {
        programs::CutTooLong(reply);
        return ZEL::PStream().Send(channel_, reply) == ZEL::RESULT_SUCCESS;
    }

    bool Reply(const PObject& request) {
        uint64_t seen = 0;
        {
            const std::lock_guard<std::mutex> lock(server_.mutex_);
            seen = server_.version_;
        }
        zel_daemon::Answer answer = Ask(request);
        PObject& reply = answer.reply;
        if (!Send(reply)) {
            return answer.rest ? Leave(*answer.rest) : false;
        }
        if (answer.rest) {
            return Forward(*answer.rest);
        }
        if (!Requests::IsWatch(request)) {
            return true;
        }
        std::string shown = reply.toString();
        while (reply["result"].asInt32() == ZEL::RESULT_SUCCESS) {
            const bool changed = server_.WaitForChange(*this, seen);
            if (!HasPeer()) {
                return false;
            }
            reply = Ask(request).reply;
            std::string now = reply.toString();
            if (!changed || now != shown) {
                shown = std::move(now);
                if (!Send(reply)) {
                    return false;
                }
            }
        }
        return true;
    }

    // The replies that come as they are found, until the last, or until nobody listens any more.
    bool Forward(PreviewFeed& feed) {
        for (bool last = false; !last;) {
            PObject reply = feed.Next(&last);
            if (!HasPeer() || !Send(reply)) {
                return Leave(feed);
            }
        }
        return true;
    }
    static bool Leave(PreviewFeed& feed) {
        feed.Leave();
        return false;
    }

    // Has the loop's thread answer.
    zel_daemon::Answer Ask(const PObject& request) {
        auto answer = std::make_shared<std::promise<zel_daemon::Answer>>();
        std::future<zel_daemon::Answer> future = answer->get_future();
        server_.loop_.Post([this, answer, &request] {
            if (!Stopped()) {
                answer->set_value(server_.AnswerOf(*this, request));
            }
        });
        // The loop may end before it comes to this.
        while (future.wait_for(milliseconds(100)) == std::future_status::timeout) {
            if (Stopped()) {
                return ErrorReply(ZEL::RESULT_INTERRUPTED, "the daemon is being stopped");
            }
        }
        return future.get();
    }

    IpcServer& server_;
    int fd_;
    Peer peer_;
    int stop_ = 0;  // accessed atomically; an int because it is the channel's abort flag
    std::atomic<bool> ended_{false};
    std::mutex mutex_;
    std::optional<steady_clock::time_point> waiting_since_ = steady_clock::now();  // by the mutex
    RequestChannel channel_;
    std::thread thread_;
};

IpcServer::IpcServer(EventLoop& loop, const std::string& path, const std::string& group,
                     Handler handler)
    : loop_(loop), handler_(std::move(handler)), own_user_(geteuid()), spare_(SpareDescriptor()) {
    {
        const Umask closed(0117);
        if (listener_.prepare(path) != 0) {
            throw std::runtime_error("cannot listen at " + path + ": " + ReasonOf(errno));
        }
    }
    if (!group.empty()) {
        const struct group* entry = getgrnam(group.c_str());
        if (entry == nullptr) {
            throw std::runtime_error("there is no group '" + group + "' any more");
        }
        group_ = entry->gr_gid;
        if (chown(path.c_str(), static_cast<uid_t>(-1), group_) != 0) {
            throw std::runtime_error("cannot give " + path + " to group '" + group +
                                     "': " + strerror(errno));
        }
    }
    loop_.OnReadable(listener_.getFD(), [this] { Accept(); });
}

IpcServer::~IpcServer() {
    for (const auto& session : sessions_) {
        session->Stop();
    }
    Changed();
}

void IpcServer::Changed() {
    {
        const std::lock_guard<std::mutex> lock(mutex_);
        ++version_;
    }
    changed_.notify_all();
}

bool IpcServer::MayAsk(int fd, Peer& peer) const {
    const std::optional<ucred> who = base::PeerOf(fd);
    if (!who) {
        return false;
    }
    peer.user = who->uid;
    peer.trusted = who->uid == 0 || who->uid == own_user_;
    return peer.trusted || (group_ != static_cast<gid_t>(-1) && HasGroup(fd, *who, group_));
}

void IpcServer::TellShortage(int error) {
    const auto now = steady_clock::now();
    if (!shortage_told_ || now - *shortage_told_ > kTellEvery) {
        shortage_told_ = now;
        Logger::LogMsg(Logger::LEVEL_WARNING,
                       "[WARNING] zel_daemon(%d): a connection cannot be served: %s\n", __LINE__,
                       ReasonOf(error).c_str());
    }
}

int IpcServer::AcceptOne() {
    int fd = listener_.accept();
    if (fd >= 0 || !IsShortage(errno)) {
        return fd;
    }
    TellShortage(errno);
    refused_.clear();
    EndLongestWaiting([](const Session&) { return true; });
    fd = listener_.accept();
    if (fd < 0 && IsShortage(errno)) {
        // One that waited on would have the loop called again at once, for ever.
        spare_.Reset();
        base::UniqueFd(listener_.accept()).Reset();
        spare_ = SpareDescriptor();
    }
    return fd;
}

void IpcServer::Accept() {
    SweepEnded();
    const int fd = AcceptOne();
    if (fd < 0) {
        return;
    }
    Peer peer;
    const bool allowed = MayAsk(fd, peer);
    if (!MakePlace(peer)) {
        if (refused_.size() >= kRefusedKept) {
            refused_.pop_front();
        }
        refused_.emplace_back(fd, "the daemon has no place for another connection of user " +
                                      std::to_string(peer.user) + " now: try again soon");
        return;
    }
    try {
        sessions_.push_back(std::make_unique<Session>(*this, fd, allowed, peer));
    } catch (const std::system_error& error) {
        TellShortage(error.code().value());
        close(fd);
    }
}

void IpcServer::SweepEnded() {
    sessions_.remove_if([](const std::unique_ptr<Session>& session) { return session->Ended(); });
}

// Connections that ask nothing keep nobody out. False when there is none of these.
bool IpcServer::EndLongestWaiting(const std::function<bool(const Session&)>& may) {
    Session* longest = nullptr;
    std::optional<steady_clock::time_point> since;
    for (const auto& session : sessions_) {
        const auto waiting = may(*session) ? session->WaitingSince() : std::nullopt;
        if (waiting && (!since || *waiting < *since)) {
            since = waiting;
            longest = session.get();
        }
    }
    const size_t before = sessions_.size();
    if (longest != nullptr) {
        longest->StopWaiting();
        sessions_.remove_if([&](const std::unique_ptr<Session>& session) {
            return session.get() == longest && session->Stopped();
        });
    }
    return sessions_.size() < before;
}

// Whether one more connection of this peer has a place, after one that asks nothing was closed
// where that helps.
bool IpcServer::MakePlace(const Peer& peer) {
    const auto same_user = [&](const Session& other) {
        return other.Who().trusted == peer.trusted && other.Who().user == peer.user;
    };
    const auto same_people = [&](const Session& other) {
        return other.Who().trusted == peer.trusted;
    };
    const auto count = [&](const auto& test) {
        return static_cast<size_t>(
            std::count_if(sessions_.begin(), sessions_.end(),
                          [&](const std::unique_ptr<Session>& session) { return test(*session); }));
    };
    const Places& places = PlacesOf(peer);
    return (count(same_user) < places.of_user || EndLongestWaiting(same_user)) &&
           (count(same_people) < places.all || EndLongestWaiting(same_people));
}

// Why one more of the peer's connections cannot stay; empty when it can.
std::string IpcServer::WhyNotStay(const Peer& peer) const {
    size_t all = 0;
    size_t of_user = 0;
    for (const auto& session : sessions_) {
        const bool counts =
            session->stays && !session->WaitingSince() && session->Who().trusted == peer.trusted;
        all += counts ? 1 : 0;
        of_user += counts && session->Who().user == peer.user ? 1 : 0;
    }
    const Places& places = PlacesOf(peer);
    if (of_user < places.staying_of_user && all < places.staying) {
        return "";
    }
    return (of_user < places.staying_of_user
                ? "the members of the daemon's group have "
                : "you (user " + std::to_string(peer.user) + ") have ") +
           std::to_string(of_user < places.staying_of_user ? all : of_user) +
           " connections that watch, wait for runs or preview, and there may be no more: end one";
}

// On the loop's thread.
Answer IpcServer::AnswerOf(Session& session, const PObject& request) {
    const bool stays = Requests::Stays(request);
    if (stays && !session.stays) {
        const std::string why = WhyNotStay(session.Who());
        if (!why.empty()) {
            return ErrorReply(ZEL::RESULT_QUOTA, why);
        }
    }
    session.stays = stays;
    return handler_(session.Who(), request);
}

// Waits until what watchers see has changed since `seen`, or it is time to show that the daemon is
// there. False in the second case.
bool IpcServer::WaitForChange(const Session& session, uint64_t& seen) {
    std::this_thread::sleep_for(kWatchEvery);
    const auto until = steady_clock::now() + kWatchAtLeast;
    std::unique_lock<std::mutex> lock(mutex_);
    while (version_ == seen) {
        changed_.wait_for(lock, kPeerCheck);
        if (version_ == seen && steady_clock::now() >= until) {
            return false;
        }
        lock.unlock();
        const bool there = session.HasPeer();
        lock.lock();
        if (!there) {
            break;
        }
    }
    seen = version_;
    return true;
}

}  // namespace zel_daemon
