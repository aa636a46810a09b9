#include "platform/tarqsystemd/manager_bus.h"

#include <systemd/sd-bus.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <utility>
#include <vector>

namespace tarq_systemd {
namespace {

using std::chrono::duration_cast;
using std::chrono::microseconds;
using std::chrono::steady_clock;

constexpr char kService[] = "org.freedesktop.systemd1";
constexpr char kObject[] = "/org/freedesktop/systemd1";
constexpr char kManager[] = "org.freedesktop.systemd1.Manager";
constexpr char kUnit[] = "org.freedesktop.systemd1.Unit";

struct BusClose {
    void operator()(sd_bus* bus) const { sd_bus_flush_close_unref(bus); }
};
struct SlotUnref {
    void operator()(sd_bus_slot* slot) const { sd_bus_slot_unref(slot); }
};
struct MessageUnref {
    void operator()(sd_bus_message* message) const { sd_bus_message_unref(message); }
};
struct Free {
    void operator()(char* text) const { free(text); }
};
using Bus = std::unique_ptr<sd_bus, BusClose>;
using Slot = std::unique_ptr<sd_bus_slot, SlotUnref>;
using Message = std::unique_ptr<sd_bus_message, MessageUnref>;
using Text = std::unique_ptr<char, Free>;

class BusError {
public:
    BusError() = default;
    BusError(const BusError&) = delete;
    BusError& operator=(const BusError&) = delete;
    ~BusError() { sd_bus_error_free(&error_); }
    sd_bus_error* Get() { return &error_; }

private:
    sd_bus_error error_ = SD_BUS_ERROR_NULL;
};

/// A queued job to wait for. Its end may be announced before the reply that names the job is
/// processed, so announced ends are collected, and compared once the name is known.
struct JobEnds {
    std::string job;
    std::string result;
    std::vector<std::pair<std::string, std::string>> ends;

    bool Find() {
        for (auto& [path, end] : ends) {
            if (path == job) {
                result = std::move(end);
                return true;
            }
        }
        ends.clear();
        return false;
    }
};

int OnJobRemoved(sd_bus_message* message, void* userdata, sd_bus_error*) {
    uint32_t id = 0;
    const char* job = nullptr;
    const char* unit = nullptr;
    const char* result = nullptr;
    if (sd_bus_message_read(message, "uoss", &id, &job, &unit, &result) >= 0) {
        static_cast<JobEnds*>(userdata)->ends.emplace_back(job, result);
    }
    return 0;
}

class SystemManagerBus : public ManagerBus {
public:
    explicit SystemManagerBus(Bus bus) : bus_(std::move(bus)) {}

    int GetState(const std::string& unit, UnitState* state) override {
        BusError error;
        sd_bus_message* raw_reply = nullptr;
        const int result = sd_bus_call_method(bus_.get(), kService, kObject, kManager, "LoadUnit",
                                              error.Get(), &raw_reply, "s", unit.c_str());
        const Message reply(raw_reply);
        if (result < 0) {
            return result;
        }
        const char* path = nullptr;
        const int read = sd_bus_message_read(reply.get(), "o", &path);
        if (read < 0) {
            return read;
        }
        const int active = GetProperty(path, "ActiveState", &state->active);
        return active < 0 ? active : GetProperty(path, "SubState", &state->sub);
    }

    int RunJob(const char* method, const std::string& unit, std::chrono::seconds limit,
               std::string* result) override {
        JobEnds ends;
        sd_bus_slot* raw_slot = nullptr;
        const int matched = sd_bus_match_signal(bus_.get(), &raw_slot, kService, kObject, kManager,
                                                "JobRemoved", OnJobRemoved, &ends);
        const Slot slot(raw_slot);
        if (matched < 0) {
            return matched;
        }
        // Without a subscriber the manager sends no signals at all.
        BusError error;
        const int subscribed = sd_bus_call_method(bus_.get(), kService, kObject, kManager,
                                                  "Subscribe", error.Get(), nullptr, "");
        if (subscribed < 0) {
            return subscribed;
        }
        const int queued = QueueJob(method, unit, &ends.job);
        return queued < 0 ? queued : WaitForEnd(&ends, limit, result);
    }

private:
    int GetProperty(const char* path, const char* name, std::string* value) {
        BusError error;
        char* text = nullptr;
        const int result =
            sd_bus_get_property_string(bus_.get(), kService, path, kUnit, name, error.Get(), &text);
        const Text owned(text);
        if (result < 0) {
            return result;
        }
        *value = owned.get();
        return 0;
    }

    int QueueJob(const char* method, const std::string& unit, std::string* job) {
        BusError error;
        sd_bus_message* raw_reply = nullptr;
        const int result =
            sd_bus_call_method(bus_.get(), kService, kObject, kManager, method, error.Get(),
                               &raw_reply, "ss", unit.c_str(), "replace");
        const Message reply(raw_reply);
        if (result < 0) {
            return result;
        }
        const char* path = nullptr;
        const int read = sd_bus_message_read(reply.get(), "o", &path);
        if (read >= 0) {
            *job = path;
        }
        return read < 0 ? read : 0;
    }

    int WaitForEnd(JobEnds* ends, std::chrono::seconds limit, std::string* result) {
        const auto deadline = steady_clock::now() + limit;
        while (!ends->Find()) {
            const int processed = sd_bus_process(bus_.get(), nullptr);
            if (processed < 0) {
                return processed;
            }
            if (processed > 0) {
                continue;
            }
            const auto left = duration_cast<microseconds>(deadline - steady_clock::now());
            if (left.count() <= 0) {
                return -ETIMEDOUT;
            }
            const int waited = sd_bus_wait(bus_.get(), static_cast<uint64_t>(left.count()));
            if (waited < 0 && waited != -EINTR) {
                return waited;
            }
        }
        *result = std::move(ends->result);
        return 0;
    }

    const Bus bus_;
};

}  // namespace

std::unique_ptr<ManagerBus> ConnectManagerBus() {
    sd_bus* bus = nullptr;
    const int result = sd_bus_open_system(&bus);
    if (result < 0) {
        errno = -result;
        return nullptr;
    }
    return std::make_unique<SystemManagerBus>(Bus(bus));
}

}  // namespace tarq_systemd
