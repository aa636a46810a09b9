// Turns requests into what the service does, and its answers into replies; docs/daemon-protocol.md
// is the contract.
#pragma once

#include <functional>
#include <string>

#include "ZEL/pobject.h"
#include "programs/zel_daemon/service.h"
#include "programs/zel_daemon/task_map.h"

namespace zel_daemon {

/// Who asks.
struct Peer {
    /// Root or the daemon's own user: may see passwords.
    bool trusted = false;
};

/// Threads: the loop's.
class Requests {
public:
    /// `reload` reads the configuration again and gives an error text or nothing.
    Requests(Service& service, std::function<std::string()> reload, std::string store_path);

    /// The reply to a request, whatever it holds. Never throws.
    ZEL::PObject Answer(const Peer& peer, const ZEL::PObject& request);

    /// Whether a request asks for replies without end: Answer() gives one, and is asked again.
    static bool IsWatch(const ZEL::PObject& request);

private:
    struct Command;

    ZEL::PObject Dispatch(const Peer& peer, const ZEL::PObject& request);

    ZEL::PObject TaskAdd(const Peer&, const ZEL::PObject& request);
    ZEL::PObject TaskEdit(const Peer&, const ZEL::PObject& request);
    ZEL::PObject TaskList(const Peer& peer, const ZEL::PObject& request);
    ZEL::PObject TaskShow(const Peer& peer, const ZEL::PObject& request);
    ZEL::PObject TaskRemove(const Peer&, const ZEL::PObject& request);
    ZEL::PObject TaskRun(const Peer&, const ZEL::PObject& request);
    ZEL::PObject TaskCancel(const Peer&, const ZEL::PObject& request);
    ZEL::PObject TaskPause(const Peer&, const ZEL::PObject& request);
    ZEL::PObject TaskResume(const Peer&, const ZEL::PObject& request);
    ZEL::PObject TaskLog(const Peer&, const ZEL::PObject& request);
    ZEL::PObject ShareCheck(const Peer& peer, const ZEL::PObject& request);
    ZEL::PObject Watch(const Peer&, const ZEL::PObject& request);
    ZEL::PObject DaemonStatus(const Peer&, const ZEL::PObject& request);
    ZEL::PObject Reload(const Peer&, const ZEL::PObject& request);

    ZEL::PObject ShownTask(const TaskRecord& record, TaskDetail detail) const;
    void AddState(const TaskRecord& record, ZEL::PObject& map) const;

    Service& service_;
    std::function<std::string()> reload_;
    std::string store_path_;
    int64_t started_;
};

}  // namespace zel_daemon
