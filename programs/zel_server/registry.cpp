#include "programs/zel_server/registry.h"

#include <chrono>
#include <ctime>

#include "ZEL/is_syncedshare.h"
#include "ZEL/log.h"
#include "programs/zel_server/server_config.h"
#include "programs/zel_server/share_record.h"
#include "tarq/owners.h"
#include "tarq/root_path.h"

namespace zel_server {

namespace {

constexpr int kHashCapacity = 64;
constexpr std::chrono::seconds kLongestWait(30);

// The keys of a share's section, and what they hold.
struct ShareKey {
    const char* key;
    std::string ShareState::*member;
};
constexpr ShareKey kShareKeys[] = {
    {"RunningID", &ShareState::running_id},
    {"CompleteID", &ShareState::complete_id},
    {"Account", &ShareState::account},
    {"Module", &ShareState::module},
    {"Path", &ShareState::path},
    {"LastResult", &ShareState::last_result},
    {"LastTime", &ShareState::last_time},
};

// Whether the key is there with an intact value. No value contains a quote: one that does has lost
// the end of its line.
bool IsWhole(const Section& section, const char* key) {
    const auto found = section.find(key);
    return found != section.end() && found->second.find('"') == std::string::npos;
}

// The semaphore that all writers of the library take, those in other programs included. It is taken
// here for the one kind of change for which the library has no function.
class WriterLock {
public:
    WriterLock()
        : id_(KAPICSemOpen(TARQ::RootSemaphoreKey(kWriterKey))),
          held_(id_ >= 0 && KAPICSemLock(id_) >= 0) {}
    ~WriterLock() {
        if (held_) {
            KAPICSemUnlock(id_);
        }
        if (id_ >= 0) {
            KAPICSemClose(id_);
        }
    }
    WriterLock(const WriterLock&) = delete;
    WriterLock& operator=(const WriterLock&) = delete;
    bool Held() const { return held_; }

private:
    static constexpr int kWriterKey = 0x2980298;  // see docs/registry.md

    int id_;
    bool held_;
};

}  // namespace

RegistryLock::RegistryLock() : lock_(LockFile(), kLongestWait) {
    if (!lock_) {
        ZEL::Logger::LogMsg(ZEL::Logger::LEVEL_ERROR, "[ERROR] registry(%d): %s\n", __LINE__,
                            lock_.Problem().c_str());
    }
}

ReadResult ReadSection(const std::string& name, Section& section) {
    section.clear();
    const TARQ::HashOwner hash(KAPICSzHashAlloc(kHashCapacity));
    const int read = hash ? ZELGetServerInfo(name.c_str(), hash.get()) : -1;
    if (read <= 0) {
        return read == 0 ? ReadResult::kMissing : ReadResult::kFailed;
    }
    section = TARQ::Entries(hash);
    return ReadResult::kRead;
}

bool WriteSection(const std::string& name, const Section& section) {
    const TARQ::HashOwner hash = TARQ::MakeHash(section);
    return hash && ZELUpdateServerInfo(name.c_str(), hash.get()) == 0;
}

bool RemoveSection(const std::string& name) {
    const WriterLock lock;
    return lock.Held() && KAPICFileRemoveSection(RegistryFile().c_str(), name.c_str()) >= 0;
}

std::optional<std::vector<std::string>> SectionNames() {
    const TARQ::ListOwner list(KAPICSzListAlloc(kHashCapacity));
    if (!list || ZELCheckServerInfo() != 0 ||
        KAPICFileEnumSection(RegistryFile().c_str(), list.get()) < 0) {
        return std::nullopt;
    }
    return TARQ::Entries(list);
}

ReadResult ReadShare(const std::string& share, ShareState& state) {
    Section section;
    const ReadResult result = ReadSection("SHARE_" + share, section);
    state = ShareState();
    if (result == ReadResult::kFailed) {
        return result;
    }
    if (result == ReadResult::kMissing) {
        return HasShareRecord(share) ? ReadResult::kDamaged : result;
    }
    for (const ShareKey& entry : kShareKeys) {
        if (!IsWhole(section, entry.key)) {
            state = ShareState();
            return ReadResult::kDamaged;
        }
        state.*entry.member = section[entry.key];
    }
    return result;
}

bool WriteShare(const std::string& share, const ShareState& state) {
    // Every key is written, even an empty RunningID: a missing key counts as damage.
    Section section;
    for (const ShareKey& entry : kShareKeys) {
        section[entry.key] = state.*entry.member;
    }
    return WriteSection("SHARE_" + share, section);
}

bool EndPush(const std::string& share, ShareState state, bool completed) {
    if (completed) {
        state.complete_id = state.running_id;
        state.last_result = "0";
    } else if (state.last_result.empty()) {
        state.last_result = kEndedByClient;
    }
    state.last_time = std::to_string(time(nullptr));
    state.running_id.clear();
    return WriteShare(share, state);
}

std::string ShareOfModule(const std::string& module) {
    const bool encrypted = module.size() > 2 && module.front() == '@' && module.back() == '@';
    return encrypted ? module.substr(1, module.size() - 2) : module;
}

Switch ReadSwitch() {
    Section pairing;
    const bool known = ReadSection("PairedClientInfo", pairing) == ReadResult::kRead;
    const std::string enabled = known ? pairing["zelEnabled"] : "";
    return enabled == "yes" ? Switch::kOn : enabled == "no" ? Switch::kOff : Switch::kUnknown;
}

}  // namespace zel_server
