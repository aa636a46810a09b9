// Turns requests into what the service does, and its answers into replies; docs/daemon-protocol.md
// is the contract.
#pragma once

#include <sys/types.h>

#include <functional>
#include <memory>
#include <string>
#include <utility>

#include "ZEL/pobject.h"
#include "programs/zel_daemon/service.h"
#include "programs/zel_daemon/task_map.h"

namespace zel_daemon {

/// Who asks.
struct Peer {
    /// Root or the daemon's own user: may change what tasks do, and see passwords. The others are
    /// members of the daemon's group.
    bool trusted = false;
    uid_t user = static_cast<uid_t>(-1);
};

/// The reply to a request, and where the rest of it comes from when it is one of many.
struct Answer {
    Answer(ZEL::PObject&& value) : reply(std::move(value)) {}
    Answer(ZEL::PObject&& value, std::shared_ptr<PreviewFeed> more)
        : reply(std::move(value)), rest(std::move(more)) {}

    ZEL::PObject reply;
    std::shared_ptr<PreviewFeed> rest;
};

/// Threads: the loop's.
class Requests {
public:
    /// `reload` reads the configuration again and gives an error text or nothing.
    Requests(Service& service, std::function<std::string()> reload, std::string store_path);

    /// The reply to a request, whatever it holds. Never throws.
    Answer Reply(const Peer& peer, const ZEL::PObject& request);

    /// Whether a request asks for replies without end: Reply() gives one, and is asked again.
    static bool IsWatch(const ZEL::PObject& request);
    /// Whether it asks for more than one reply, so that its connection stays for a while.
    static bool Stays(const ZEL::PObject& request);
    /// Whether it may change the configuration.
    static bool Configures(const ZEL::PObject& request);

private:
    struct Command;

    Answer Dispatch(const Peer& peer, const ZEL::PObject& request);

    Answer TaskAdd(const Peer&, const ZEL::PObject& request);
    Answer TaskEdit(const Peer&, const ZEL::PObject& request);
    Answer TaskList(const Peer& peer, const ZEL::PObject& request);
    Answer TaskShow(const Peer& peer, const ZEL::PObject& request);
    Answer TaskRemove(const Peer&, const ZEL::PObject& request);
    Answer TaskRun(const Peer&, const ZEL::PObject& request);
    Answer TaskConfirm(const Peer&, const ZEL::PObject& request);
    Answer TaskCancel(const Peer&, const ZEL::PObject& request);
    Answer TaskPreview(const Peer&, const ZEL::PObject& request);
    Answer TaskVerify(const Peer&, const ZEL::PObject& request);
    Answer TaskPause(const Peer&, const ZEL::PObject& request);
    Answer TaskResume(const Peer&, const ZEL::PObject& request);
    Answer TaskLog(const Peer&, const ZEL::PObject& request);
    Answer ShareCheck(const Peer& peer, const ZEL::PObject& request);
    Answer Watch(const Peer&, const ZEL::PObject& request);
    Answer DaemonStatus(const Peer&, const ZEL::PObject& request);
    Answer Reload(const Peer&, const ZEL::PObject& request);

    ZEL::PObject ShownTask(const TaskRecord& record, TaskDetail detail) const;
    void AddState(const TaskRecord& record, ZEL::PObject& map) const;

    Service& service_;
    std::function<std::string()> reload_;
    std::string store_path_;
    int64_t started_;
};

}  // namespace zel_daemon
