#include <netdb.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <tarq/core.h>
#include <tarq/netsdk.h>

#include <algorithm>
#include <array>
#include <cstring>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/internal/config.h"
#include "platform/internal/error.h"
#include "platform/tarqnetsdk/interfaces.h"

static_assert(sizeof(TARQNetAddress) == 52, "callers lay out arrays of 52-byte records");

namespace {

using tarq_internal::CopyOut;
using tarq_internal::Fail;
using tarq_internal::Guarded;

struct AddressListFree {
    void operator()(addrinfo* list) const { freeaddrinfo(list); }
};
using AddressList = std::unique_ptr<addrinfo, AddressListFree>;

bool IsUnknownName(int result) {
    return result == EAI_NONAME || result == EAI_NODATA || result == EAI_ADDRFAMILY;
}

/// The address as text; empty for a link-local one that nothing can be sent to.
std::string TextOf(const addrinfo& info) {
    if (info.ai_family == AF_INET6) {
        sockaddr_in6 address;
        memcpy(&address, info.ai_addr, sizeof address);
        if (IN6_IS_ADDR_LINKLOCAL(&address.sin6_addr) && address.sin6_scope_id == 0) {
            return {};
        }
    }
    std::array<char, NI_MAXHOST> text;
    return getnameinfo(info.ai_addr, info.ai_addrlen, text.data(), text.size(), nullptr, 0,
                       NI_NUMERICHOST) == 0
               ? text.data()
               : std::string();
}

}  // namespace

int KAPINetGetInterfaceInfo(KAPINetInterface* records, int count, int flags) {
    return Guarded(-1, [&] {
        if (records == nullptr || count < 0) {
            return Fail(TARQ_ERR_BAD_PARAMETER);
        }
        const std::optional<std::vector<tarq_net::Interface>> interfaces =
            tarq_net::ListInterfaces("/sys");
        if (!interfaces) {
            return Fail(TARQ_ERR_READ_FILE);
        }
        int filled = 0;
        for (const tarq_net::Interface& interface : *interfaces) {
            if (filled == count) {
                break;
            }
            if (!interface.up && (flags & TARQ_NET_INCLUDE_DOWN) == 0) {
                continue;
            }
            KAPINetInterface& record = records[filled++];
            record = {};
            CopyOut(interface.name, record.name, sizeof record.name);
            std::copy(interface.mac.begin(), interface.mac.end(), record.mac);
        }
        return filled;
    });
}

int TARQNetLookupIP(const char* name, TARQNetAddress* records, int count, int /*flags*/) {
    return Guarded(-1, [&] {
        if (name == nullptr || *name == '\0' || records == nullptr || count < 0) {
            return Fail(TARQ_ERR_BAD_PARAMETER);
        }
        addrinfo hints{};
        hints.ai_family = AF_UNSPEC;
        hints.ai_socktype = SOCK_STREAM;
        addrinfo* found = nullptr;
        const int result = getaddrinfo(name, nullptr, &hints, &found);
        if (result != 0) {
            return IsUnknownName(result) ? 0 : Fail(TARQ_ERR_LOOKUP);
        }
        const AddressList list(found);

        std::vector<std::string> addresses;
        for (const int family : {AF_INET, AF_INET6}) {
            for (const addrinfo* info = list.get(); info != nullptr; info = info->ai_next) {
                if (info->ai_family != family) {
                    continue;
                }
                std::string text = TextOf(*info);
                if (!text.empty() &&
                    std::find(addresses.begin(), addresses.end(), text) == addresses.end()) {
                    addresses.push_back(std::move(text));
                }
            }
        }
        int filled = 0;
        for (const std::string& address : addresses) {
            if (filled == count) {
                break;
            }
            TARQNetAddress record{};
            // A zone's long name can make the text too long for the record; such an address is
            // passed over.
            if (CopyOut(address, record.address, sizeof record.address)) {
                records[filled++] = record;
            }
        }
        return filled;
    });
}
