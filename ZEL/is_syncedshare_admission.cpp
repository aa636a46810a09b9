// Who may pair which share, and who is paired.
#include <string.h>
#include <syslog.h>

#include "ZEL/internal/registry.h"
#include "ZEL/is_syncedshare.h"
#include "base/text.h"

using namespace ZEL::registry;

namespace {

constexpr const char* kSharePrefix = "SHARE_";
constexpr size_t kSharePrefixLength = 6;

constexpr int kIdentitySize = 36;           // of the buffers that identities are read into
constexpr size_t kIdentityCharacters = 36;  // how much of two identities is compared

enum class Verdict { kFree, kHeld, kFailed };

/// Whether `name` in lower case equals `lowered`, over the significant length of names.
bool IsSpelling(const char* name, const char (&lowered)[kNameCharacters + 1]) {
    for (int i = 0; i < kNameCharacters; ++i) {
        if (base::Lower(name[i]) != lowered[i]) {
            return false;
        }
        if (name[i] == '\0') {
            break;
        }
    }
    return true;
}

bool ReadIdentity(const char* share, const char* key, char (&identity)[kIdentitySize]) {
    return ZELServerGetShare(share, key, identity, kIdentitySize) >= 0;
}

Verdict FailStatus(const char* share, const char* key) {
    syslog(LOG_ERR, "Failed to get section [%s] %s value.", share, key);
    syslog(LOG_ERR, "getSharePairStatus error");
    return Verdict::kFailed;
}

/// Looks at the section of exactly this name.
Verdict CheckExactName(const char* share, const char* client) {
    char complete[kIdentitySize] = "";
    if (!ReadIdentity(share, kCompleteKey, complete)) {
        return KAPICErrGet() == TARQ_ERR_NO_SECTION ? Verdict::kFree
                                                    : FailStatus(share, kCompleteKey);
    }
    // A section has both keys or none: one without a RunningID is damaged, not free.
    char running[kIdentitySize] = "";
    if (!ReadIdentity(share, kRunningKey, running)) {
        return FailStatus(share, kRunningKey);
    }
    // The buffer's last byte is the terminator's; the check of all spellings compares the identity
    // whole.
    const bool held = running[0] != '\0' && strncmp(client, running, kIdentitySize - 1) != 0;
    return held ? Verdict::kHeld : Verdict::kFree;
}

/// Looks at the sections of all spellings of the name; the first that a client is syncing into
/// decides.
Verdict CheckAllSpellings(const char* share, const char* client) {
    const auto fail = [](const char* message) {
        syslog(LOG_ERR, "%s", message);
        return Verdict::kFailed;
    };
    char wanted[kNameCharacters + 1] = "";
    getLowerString(share, wanted);
    if (ZELCheckServerInfo() != 0) {
        return fail("Failed to check server info.\n");
    }
    const List sections = MakeList();
    const Hash values = MakeHash();
    if (sections == nullptr || values == nullptr) {
        return fail("Failed to allocate memory.\n");
    }
    if (KAPICFileEnumSection(RegistryPath().c_str(), sections.get()) < 0) {
        return fail("Failed to get section list.\n");
    }
    const int count = KAPICSzListCount(sections.get());
    for (int i = 0; i < count; ++i) {
        const char* section = KAPICSzListGet(sections.get(), i);
        if (strncmp(section, kSharePrefix, kSharePrefixLength) != 0 ||
            !IsSpelling(section + kSharePrefixLength, wanted)) {
            continue;
        }
        KAPICHashRemoveAll(values.get());
        if (ZELGetServerInfo(section, values.get()) < 0) {
            return fail("Failed to get section.\n");
        }
        const char* running = KAPICSzHashGetValue(values.get(), kRunningKey);
        if (!IsEmpty(running)) {
            const bool own = strncmp(client, running, kIdentityCharacters) == 0;
            return own ? Verdict::kFree : Verdict::kHeld;
        }
    }
    return Verdict::kFree;
}

Verdict Check(const char* share, const char* client) {
    if (IsEmpty(share)) {
        syslog(LOG_ERR, "Parameter error on getSharePairStatus.");
        return Verdict::kHeld;
    }
    const Verdict exact = CheckExactName(share, client);
    if (exact != Verdict::kFree) {
        return exact;
    }
    const Verdict any = CheckAllSpellings(share, client);
    if (any == Verdict::kFailed) {
        syslog(LOG_ERR, "Failed to get converted shared name.");
    }
    return any;
}

}  // namespace

int ZELCheckIfSharePaired(KAPICSzList shares, const char* clientID, KAPICSzList* refused) {
    const int count = KAPICSzListCount(shares);
    if (count <= 0 || IsEmpty(clientID) || refused == nullptr || *refused == nullptr) {
        syslog(LOG_ERR, "Input parameters are null or empty!");
        return ZEL_PAIR_BAD_ARGUMENT;
    }
    KAPICSzListRemoveAll(*refused);
    for (int i = 0; i < count; ++i) {
        const char* share = KAPICSzListGet(shares, i);
        const Verdict verdict = Check(share, clientID);
        if (verdict == Verdict::kFailed) {
            return ZEL_PAIR_READ_FAILED;
        }
        // A refusal that cannot be reported must not be taken for an admission.
        if (verdict == Verdict::kHeld &&
            KAPICSzListPush(*refused, share != nullptr ? share : "") < 0) {
            return ZEL_PAIR_READ_FAILED;
        }
    }
    return KAPICSzListCount(*refused) > 0 ? ZEL_PAIR_CONFLICT : ZEL_PAIR_OK;
}

int ZELServerIfOldClientPaired(void) {
    const Hash pairing = MakeHash();
    if (pairing == nullptr) {
        syslog(LOG_ERR, "Failed to allocate memory of hash.");
        return -1;
    }
    if (ZELGetServerInfo(kPairSection, pairing.get()) < 0) {
        syslog(LOG_ERR, "Get server paired-info error.");
        return -1;
    }
    const char* client = KAPICSzHashGetValue(pairing.get(), kClientKey);
    const char* server = KAPICSzHashGetValue(pairing.get(), kServerKey);
    if (IsEmpty(client) || IsEmpty(server)) {
        return 0;
    }
    const bool multi_source =
        strcmp(client, kMultiSource) == 0 && strcmp(server, kMultiSource) == 0;
    return multi_source ? 0 : 1;
}

int ZELServerSetPairValue(KAPICSzHash pair) {
    if (pair == nullptr) {
        return ZEL_PAIR_BAD_ARGUMENT;
    }
    const Hash pairing = MakeHash();
    if (pairing == nullptr) {
        return ZEL_PAIR_NO_MEMORY;
    }
    if (ZELGetServerInfo(kPairSection, pairing.get()) < 0) {
        return ZEL_PAIR_READ_FAILED;
    }
    const char* client = KAPICSzHashGetValue(pair, kClientKey);
    const char* server = KAPICSzHashGetValue(pair, kServerKey);
    if (client == nullptr || server == nullptr || !SetPair(pairing.get(), client, server)) {
        return ZEL_PAIR_BAD_VALUE;
    }
    return ZELUpdateServerInfo(kPairSection, pairing.get()) == 0 ? ZEL_PAIR_OK
                                                                 : ZEL_PAIR_WRITE_FAILED;
}

int ZELServerUpdatePairInfo(const char* clientID, const char* serverName) {
    if (IsEmpty(clientID) || IsEmpty(serverName)) {
        return ZEL_PAIR_BAD_ARGUMENT;
    }
    const Hash client = MakeHash();
    const Hash pair = MakeHash();
    if (client == nullptr || pair == nullptr) {
        return ZEL_PAIR_NO_MEMORY;
    }
    if (KAPICSzHashSetValue(client.get(), kOwnServerKey, serverName) < 0) {
        return ZEL_PAIR_BAD_VALUE;
    }
    const Text section = Format(kClientFormat, clientID);
    if (section == nullptr || ZELUpdateServerInfo(section.get(), client.get()) != 0) {
        return ZEL_PAIR_WRITE_FAILED;
    }
    if (!SetPair(pair.get(), kMultiSource, kMultiSource)) {
        return ZEL_PAIR_BAD_VALUE;
    }
    return ZELServerSetPairValue(pair.get()) == ZEL_PAIR_OK ? ZEL_PAIR_OK : ZEL_PAIR_WRITE_FAILED;
}
