#include "programs/zel_server/registry.h"

#include "ZEL/is_syncedshare.h"
#include "programs/zel_server/server_config.h"
#include "programs/zel_server/share_module.h"
#include "tarq/owners.h"

namespace zel_server {

namespace {

constexpr int kHashCapacity = 64;

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

// Whether a value is as it was written. No value has a quote: one that begins with it has lost the
// end of its line.
bool IsWhole(const Section& section, const char* key) {
    const auto found = section.find(key);
    return found != section.end() && found->second.find('"') == std::string::npos;
}

}  // namespace

RegistryLock::RegistryLock()
    : lock_(ZEL::LockFactory(LockFile()).GetLock()), held_(lock_.ExLock() == 0) {}

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
        return HasShareModule(share) ? ReadResult::kDamaged : result;
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
    // Every key is written, an empty RunningID too: its absence would count as damage.
    Section section;
    for (const ShareKey& entry : kShareKeys) {
        section[entry.key] = state.*entry.member;
    }
    const TARQ::HashOwner hash = TARQ::MakeHash(section);
    return hash && ZELServerUpdateShare(share.c_str(), hash.get()) == 0;
}

std::string ShareOfModule(const std::string& module) {
    const bool encrypted = module.size() > 2 && module.front() == '@' && module.back() == '@';
    return encrypted ? module.substr(1, module.size() - 2) : module;
}

bool WriteTaskStatus(const std::string& task, const std::string& status) {
    const TARQ::HashOwner hash = TARQ::MakeHash({{"status", status}});
    return hash && ZELServerUpdateTask(task.c_str(), hash.get()) == 0;
}

Switch ReadSwitch() {
    Section pairing;
    const bool known = ReadSection("PairedClientInfo", pairing) == ReadResult::kRead;
    const std::string enabled = known ? pairing["zelEnabled"] : "";
    return enabled == "yes" ? Switch::kOn : enabled == "no" ? Switch::kOff : Switch::kUnknown;
}

Paired IsPaired(const std::string& client_id) {
    Section section;
    const ReadResult own = ReadSection("CLIENTID_" + client_id, section);
    if (own == ReadResult::kRead) {
        return Paired::kYes;
    }
    if (own == ReadResult::kFailed ||
        ReadSection("PairedClientInfo", section) == ReadResult::kFailed) {
        return Paired::kFailed;
    }
    return section["clientID"] == client_id ? Paired::kYes : Paired::kNo;
}

}  // namespace zel_server
