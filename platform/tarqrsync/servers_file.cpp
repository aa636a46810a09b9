#include "platform/tarqrsync/servers_file.h"

#include <algorithm>
#include <iterator>
#include <map>
#include <optional>

#include "base/rsync_config.h"
#include "base/section_view.h"
#include "base/text.h"
#include "platform/tarqrsync/settings.h"

namespace TARQ {
namespace Backup {

namespace {

constexpr const char* kWords[] = {"tls", "ssh", "plain"};

std::optional<ServerTransport> TransportOfWord(std::string_view word) {
    const auto* const found = std::find(std::begin(kWords), std::end(kWords), word);
    if (found == std::end(kWords)) {
        return {};
    }
    return static_cast<ServerTransport>(found - std::begin(kWords));
}

// The text as it can be quoted in a message: without control characters, and cut.
std::string Quoted(std::string_view text) {
    constexpr size_t kMost = 60;
    std::string shown = "'";
    for (const char c : text.substr(0, kMost)) {
        shown += c < ' ' || c > '~' ? '?' : c;
    }
    return shown + (text.size() > kMost ? "...'" : "'");
}

class Reader {
public:
    explicit Reader(const std::string& path) : path_(path) {}

    std::vector<ServerSection> Read(std::string_view text) {
        if (text.substr(0, base::kByteOrderMark.size()) == base::kByteOrderMark) {
            text.remove_prefix(base::kByteOrderMark.size());
        }
        for (std::string_view line; base::TakeLine(text, line);) {
            ++line_;
            TakeLine(line);
        }
        EndSection();
        return std::move(sections_);
    }

private:
    [[noreturn]] void Refuse(int line, const std::string& problem) const {
        throw ServersError(path_ + ", line " + std::to_string(line) + ": " + problem +
                           "; mend the file, or remove the server's section and trust it anew");
    }

    void TakeLine(std::string_view line) {
        const std::string_view text = base::Trimmed(line);
        if (text.empty() || text.front() == '#') {
            return;
        }
        if (text.front() == '[') {
            TakeHeader(text);
            return;
        }
        const std::optional<base::KeyLine> entry = base::ParseKeyLine(line);
        if (!entry) {
            Refuse(line_, Quoted(text) + " is neither a [server] nor a key=\"value\"");
        }
        if (header_line_ == 0) {
            Refuse(line_, Quoted(entry->key) + " stands before the first [server]");
        }
        if (!values_.emplace(entry->key, entry->value).second) {
            Refuse(line_, Quoted(entry->key) + " is there twice");
        }
        TakeValue(std::string(entry->key), std::string(entry->value));
    }

    void TakeHeader(std::string_view text) {
        EndSection();
        header_line_ = line_;
        values_.clear();
        ServerSection& section = sections_.emplace_back();
        if (text.back() != ']') {
            Refuse(line_, Quoted(text) + " is no [server]");
        }
        section.section = std::string(text.substr(1, text.size() - 2));
        section.server.host = ServerName(section.section);
        const auto same = [&](const ServerSection& other) {
            return &other != &section && other.server.host == section.server.host;
        };
        if (std::any_of(sections_.begin(), sections_.end(), same)) {
            Refuse(line_, "server " + Quoted(section.section) + " is there twice");
        }
    }

    void TakeValue(const std::string& key, const std::string& value) {
        RsyncServer& server = sections_.back().server;
        if (key == "transport") {
            const std::optional<ServerTransport> transport = TransportOfWord(value);
            if (!transport) {
                Refuse(line_, "transport is " + Quoted(value) + ", not tls, ssh or plain");
            }
            server.transport = *transport;
        } else if (key == "port") {
            const std::optional<uint64_t> port = base::ParseNumber(value, base::kMaxPort);
            if (!port || *port == 0) {
                Refuse(line_, "port is " + Quoted(value) + ", not a number from 1 to 65535");
            }
            server.port = static_cast<int>(*port);
        } else if (key == "fingerprint") {
            server.fingerprint = value;
        } else {
            Refuse(line_,
                   "key " + Quoted(key) + " is unknown, there are transport, port, fingerprint");
        }
    }

    // What a section must have is known when it ends.
    void EndSection() const {
        if (header_line_ == 0) {
            return;
        }
        const RsyncServer& server = sections_.back().server;
        if (values_.count("transport") == 0) {
            Refuse(header_line_, "server " + Quoted(server.host) + " has no transport");
        }
        const std::string fault = FaultOf(server);
        if (!fault.empty()) {
            Refuse(header_line_, fault);
        }
    }

    const std::string& path_;
    std::vector<ServerSection> sections_;
    std::map<std::string, std::string, std::less<>> values_;  // of the last section
    int line_ = 0;
    int header_line_ = 0;  // of the last section; 0: there is none yet
};

}  // namespace

std::vector<ServerSection> ParseServers(std::string_view text, const std::string& path) {
    return Reader(path).Read(text);
}

const char* TransportWord(ServerTransport transport) {
    return kWords[static_cast<int>(transport)];
}

bool IsFingerprint(const std::string& text) {
    constexpr std::string_view kHead = "SHA256:";
    constexpr size_t kLength = 43;  // 32 bytes in base64, without its padding
    return text.size() == kHead.size() + kLength && text.compare(0, kHead.size(), kHead) == 0 &&
           std::all_of(text.begin() + kHead.size(), text.end(),
                       [](char c) { return base::IsLetterOrDigit(c) || c == '+' || c == '/'; });
}

std::string FaultOf(const RsyncServer& server) {
    const std::string name = "server " + Quoted(server.host);
    if (!IsHost(server.host)) {
        return name + " is neither a host name nor an address";
    }
    if (server.port < 0 || server.port > base::kMaxPort) {
        return name + ": the port is not between 1 and 65535";
    }
    if (server.transport == ServerTransport::PLAIN) {
        return server.fingerprint.empty() ? "" : name + " has a fingerprint, but plain has no key";
    }
    return IsFingerprint(server.fingerprint)
               ? ""
               : name + ": the fingerprint " + Quoted(server.fingerprint) +
                     " is not SHA256: and 43 characters of base64";
}

}  // namespace Backup
}  // namespace TARQ
