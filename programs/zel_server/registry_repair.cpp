#include "programs/zel_server/registry_repair.h"

#include <set>

#include "ZEL/is_syncedshare.h"
#include "base/replace_file.h"
#include "base/whole_file.h"
#include "programs/common/text.h"
#include "programs/zel_server/registry.h"
#include "programs/zel_server/share_record.h"

namespace zel_server {

namespace {

constexpr size_t kMaxRegistry = size_t{8} * 1024 * 1024;  // as section files have it

bool KeepDamagedCopy() {
    const auto text = base::ReadFile(RegistryFile(), kMaxRegistry);
    return text && base::ReplaceFile(DamagedCopy(), *text, 0600);
}

bool PutBack(const std::string& share) {
    const auto record = ReadShareRecord(share);
    if (!record || !record->names_owner) {
        return false;
    }
    ShareState state;
    // The owner is the client of the last known push, complete or not.
    state.complete_id = record->client;
    state.account = record->account;
    state.module = record->module;
    state.path = record->path;
    state.last_result = kMended;
    return WriteShare(share, state);
}

}  // namespace

std::optional<std::vector<std::string>> KnownShares() {
    const auto sections = SectionNames();
    const auto recorded = RecordedShares();
    if (!sections || !recorded) {
        return std::nullopt;
    }
    std::vector<std::string> shares;
    std::set<std::string> seen;
    const std::string prefix = "SHARE_";
    for (const std::string& section : *sections) {
        if (section.compare(0, prefix.size(), prefix) == 0 &&
            seen.insert(section.substr(prefix.size())).second) {
            shares.push_back(section.substr(prefix.size()));
        }
    }
    for (const std::string& share : *recorded) {
        if (seen.insert(share).second) {
            shares.push_back(share);
        }
    }
    return shares;
}

std::optional<RegistryDamage> FindDamage() {
    const auto shares = KnownShares();
    if (!shares) {
        return std::nullopt;
    }
    RegistryDamage damage;
    damage.switch_lost = ReadSwitch() == Switch::kUnknown;
    for (const std::string& share : *shares) {
        ShareState state;
        switch (ReadShare(share, state)) {
            case ReadResult::kFailed:
                return std::nullopt;
            case ReadResult::kDamaged: {
                const auto record = ReadShareRecord(share);
                (record && record->names_owner ? damage.shares : damage.ownerless).push_back(share);
                break;
            }
            default:
                break;
        }
    }
    return damage;
}

bool MendRegistry(const RegistryDamage& damage, const ServerConfig& config) {
    if (!KeepDamagedCopy()) {
        return false;
    }
    for (const std::string& share : damage.shares) {
        if (!PutBack(share)) {
            return false;
        }
    }
    return !damage.switch_lost || TARQUISetZEL(config.switched_off ? 0 : 1, nullptr, nullptr) == 0;
}

std::string DamagedCopy() {
    return RegistryFile() + ".damaged";
}

}  // namespace zel_server
