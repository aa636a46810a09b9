#include "programs/zel_server/version_space.h"

#include <syslog.h>

#include <algorithm>
#include <string>
#include <vector>

#include "programs/zel_server/registry.h"
#include "programs/zel_server/registry_repair.h"
#include "programs/zel_server/space_debts.h"
#include "programs/zel_server/storage.h"
#include "programs/zel_server/version_report.h"

namespace zel_server {

namespace {

// What an account could give up of the versions in a storage folder.
struct Payments {
    struct Item {
        VersionFolder version;
        std::string versions;  // VersionsOf()
    };
    std::vector<Item> items;      // those that are old enough, the oldest first
    bool has_neighbours = false;  // other accounts have copies there
};

Payments PaymentsOf(const SpaceDebt& debt, const KeepSettings& settings) {
    Payments payments;
    for (const std::string& share : KnownShares().value_or(std::vector<std::string>())) {
        ShareState state;
        if (ReadShare(share, state) != ReadResult::kRead ||
            FolderAbove(state.path) != debt.storage) {
            continue;
        }
        if (state.account != debt.account) {
            payments.has_neighbours = true;
            continue;
        }
        const std::string folder = VersionsOf(share, state.path);
        const auto versions = ListVersions(folder).value_or(std::vector<VersionFolder>());
        const int64_t youngest = AgesFrom(versions, VersionTime::Now()) -
                                 static_cast<int64_t>(settings.at_least) * kDaySeconds;
        for (const VersionFolder& version : versions) {
            if (version.time.seconds < youngest) {
                payments.items.push_back({version, folder});
            }
        }
    }
    std::sort(payments.items.begin(), payments.items.end(),
              [](const auto& one, const auto& other) { return one.version < other.version; });
    return payments;
}

void Pay(const SpaceDebt& debt, const KeepSettings& settings) {
    if (debt.missed == 0 && !IsSpaceShort(debt.storage, settings.reserve)) {
        return;
    }
    uint64_t paid = 0;
    size_t count = 0;
    const Payments payments = PaymentsOf(debt, settings);
    for (const Payments::Item& item : payments.items) {
        const uint64_t bytes = SizeOf(item.version).bytes;
        // Not a younger one in the place of one that does not fit: the oldest go first.
        if ((payments.has_neighbours && paid + bytes > debt.bytes) ||
            (paid >= debt.missed && !IsSpaceShort(debt.storage, settings.reserve))) {
            break;
        }
        if (GiveUpVersion(item.versions, item.version)) {
            paid += bytes;
            ++count;
        }
    }
    if (count == 0) {
        return;
    }
    syslog(LOG_NOTICE,
           "zel_server: %s is nearly full: of account %s, which fills it, the %zu oldest versions "
           "were given up",
           debt.storage.c_str(), debt.account.c_str(), count);
    const RegistryLock lock;
    if (lock.Held()) {
        PaySpaceDebt(debt, paid);
    }
}

}  // namespace

void PayForSpace(const KeepSettings& settings) {
    for (const SpaceDebt& debt : SpaceDebts()) {
        Pay(debt, settings);
    }
}

}  // namespace zel_server
