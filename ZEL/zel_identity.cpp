// Client identity and name resolution: the second part of zel.h.
#include <stdio.h>
#include <string.h>
#include <strings.h>

#include <algorithm>
#include <memory>

#include "ZEL/log.h"
#include "ZEL/zel.h"
#include "tarq/core.h"
#include "tarq/hacore.h"
#include "tarq/netsdk.h"
#include "tarq/root_path.h"
#include "tarq/sdk.h"

namespace ZEL {

namespace {

constexpr char kNmblookup[] = "/usr/local/bin/nmblookup";

constexpr int kIdentitySize = 1024;
// This size limits the identity by which servers already know devices: it must not change.
constexpr int kSingleSerialSize = 36;
constexpr size_t kHostNameSize = 64;
constexpr int kMaxAddresses = 20;
constexpr size_t kNmblookupLineSize = 128;
constexpr size_t kNetbiosNameSize = 64;

// The text of a field that may lack its terminator.
template <size_t size>
std::string FieldText(const char (&field)[size]) {
    return {field, strnlen(field, size)};
}

bool EqualIgnoringCase(const std::string& a, const std::string& b) {
    return strcasecmp(a.c_str(), b.c_str()) == 0;
}

struct CloseProgram {
    void operator()(FILE* stream) const { KAPICPclose(stream); }
};

// The name that the machine at `address` answers a NetBIOS status query with; empty when it does
// not.
std::string QueryNetbiosName(const std::string& address) {
    // The program would take it for an option. No machine has such an address.
    if (address.front() == '-') {
        return "";
    }
    const std::unique_ptr<FILE, CloseProgram> output(KAPICPopen(TARQ::RootPath(kNmblookup).c_str(),
                                                                "r", "-A", address.c_str(),
                                                                static_cast<char*>(nullptr)));
    if (!output) {
        Logger::LogMsg(Logger::LEVEL_ERROR, "[ERROR] ZEL/zel(%d): nmblookup_r: popen error\n",
                       __LINE__);
        return "";
    }
    // The names stand in lines of their own behind a tab, the machine's own name first: "\tNAS <00>
    // - M <ACTIVE>".
    char line[kNmblookupLineSize] = "";
    char name[kNetbiosNameSize] = "";
    bool at_line_start = true;
    while (fgets(line, sizeof line, output.get()) != nullptr) {
        const bool is_name_line = at_line_start && line[0] == '\t';
        at_line_start = strchr(line, '\n') != nullptr;
        if (is_name_line && sscanf(line + 1, "%16s#", name) == 1) {
            return name;
        }
    }
    return "";
}

// Looks `name` up and appends what is found. Returns what the platform's look-up returns.
int LookUp(const std::string& name, std::vector<std::string>& addresses) {
    TARQNetAddress records[kMaxAddresses] = {};
    const int count = TARQNetLookupIP(name.c_str(), records, kMaxAddresses, 0);
    for (int i = 0; i < std::min(count, kMaxAddresses); ++i) {
        addresses.push_back(FieldText(records[i].address));
    }
    return count;
}

}  // namespace

std::string GetClientID() {
    char identity[kIdentitySize] = "";
    // Only the text shows whether there is an identity: a device without a serial number is not a
    // failure.
    if (TARQHAIsRunning() != 0) {
        KAPIGetSerialNumber(identity, kIdentitySize);
        if (identity[0] == '\0') {
            TARQHAGetMac(0, identity, kIdentitySize);
        }
        if (identity[0] == '\0') {
            Logger::LogMsg(Logger::LEVEL_ERROR, "[ERROR] ZEL/zel(%d): Fail to get ha sn and mac\n",
                           __LINE__);
        }
        return FieldText(identity);
    }
    KAPIGetSerialNumber(identity, kSingleSerialSize);
    if (identity[0] != '\0') {
        return FieldText(identity);
    }
    KAPINetInterface card = {};
    if (KAPINetGetInterfaceInfo(&card, 1, 1) < 1) {
        return "";
    }
    snprintf(identity, sizeof identity, "%02x:%02x:%02x:%02x:%02x:%02x", card.mac[0], card.mac[1],
             card.mac[2], card.mac[3], card.mac[4], card.mac[5]);
    return identity;
}

std::string GetHostName(unsigned int skip) {
    char buffer[kHostNameSize] = "";
    if (TARQLnxGetHostname(buffer) < 0) {
        Logger::LogMsg(Logger::LEVEL_ERROR,
                       "[ERROR] ZEL/zel(%d): Fail to call TARQLnxGetHostname\n", __LINE__);
        return "";
    }
    const std::string name = FieldText(buffer);
    return name.size() > skip ? name.substr(skip) : name;
}

int GetUsableIP(const std::string& server_name, const std::string& server_address,
                std::vector<std::string>& out) {
    if (server_name.empty()) {
        out.push_back(server_address);
        return 0;
    }
    std::vector<std::string> found;
    if (server_address.empty()) {
        if (LookUp(server_name, found) < 1) {
            return -1;
        }
    } else if (EqualIgnoringCase(server_name, QueryNetbiosName(server_address))) {
        found = {server_address};
    } else {
        const int count = LookUp(server_name, found);
        if (count < 0) {
            return -1;
        }
        // Of the addresses that the name resolves to, prefer the one that answered last time.
        const bool still_there = std::any_of(
            found.begin(), found.end(),
            [&](const std::string& address) { return EqualIgnoringCase(address, server_address); });
        if (count == 0 || still_there) {
            found = {server_address};
        }
    }
    out.insert(out.end(), found.begin(), found.end());
    return 0;
}

}  // namespace ZEL
