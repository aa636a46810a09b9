#include "programs/common/deposits.h"

#include <algorithm>
#include <sstream>

#include "ZEL/zel.h"
#include "base/percent.h"
#include "base/random_digits.h"
#include "base/text.h"
#include "programs/common/server_session.h"
#include "programs/common/server_status.h"
#include "programs/common/task_fields.h"

namespace programs {

namespace {

// A command has room for 5 KiB, of which names and numbers take their part.
constexpr size_t kMaxPiece = 4000;
constexpr size_t kMaxListBytes = size_t{1} << 20;
// What a value of a command may hold as it is: not a quote, and no control character.
constexpr char kPlain[] = " !#$&'()*+,-./:;<=>?@[\\]^_`{|}~";

std::string Line(const char* key, const std::string& value) {
    return std::string(key) + "=\"" + value + "\"";
}

// The name of a machine or a server, as far as a server takes it.
std::string NameLine(const char* key, const std::string& name) {
    constexpr size_t kMaxName = 64;
    return Line(key, name.empty() || name.size() > kMaxName || name.find('"') != std::string::npos
                         ? "-"
                         : name);
}

// "CLIENT TIME BYTES SERVER NAME", without blanks in a word.
bool ReadDeposit(const std::string& line, Deposit& deposit) {
    std::istringstream words(line);
    std::string server;
    std::string name;
    if (!(words >> deposit.client >> deposit.time >> deposit.bytes >> server >> name)) {
        return false;
    }
    deposit.server = base::PercentDecoded(server).value_or("");
    deposit.name = base::PercentDecoded(name).value_or("");
    return true;
}

}  // namespace

struct DepositSession::Impl : ServerSession {
    Impl(const ZEL::SyncInfo& sync_info, const std::atomic<bool>& cancel_flag)
        : ServerSession(sync_info, cancel_flag) {
        goes_on = "the same command goes on";
    }

    void Leave(const std::string& text) {
        const std::list<std::string> head = {Line("command", "ZEL_DepositConfig"),
                                             Line("clientID", ZEL::GetClientID()),
                                             NameLine("clientName", ZEL::GetHostName(0)),
                                             NameLine("serverName", ServerOf(info)),
                                             Line("upload", base::RandomDigits()),
                                             Line("bytes", std::to_string(text.size()))};
        for (size_t offset = 0; offset < text.size();) {
            std::list<std::string> lines = head;
            lines.push_back(Line("offset", std::to_string(offset)));
            std::string piece;
            while (offset < text.size() && piece.size() < kMaxPiece) {
                piece += base::PercentEncoded(text[offset++], kPlain);
            }
            lines.push_back(Line("text", piece));
            std::string ignored;
            Require(Send(lines, ignored), "this machine's configuration cannot be left there");
        }
    }

    std::vector<Deposit> List() {
        std::string answer;
        Require(Send({Line("command", "ZEL_ListDeposits"), Line("clientID", ZEL::GetClientID())},
                     answer, {kMaxListBytes}),
                "what clients have left there cannot be listed");
        std::vector<Deposit> deposits;
        std::istringstream lines(answer);
        for (std::string line; std::getline(lines, line);) {
            Deposit deposit;
            if (ReadDeposit(line, deposit)) {
                deposits.push_back(deposit);
            }
        }
        return deposits;
    }

    std::string Fetch(const Deposit& deposit) {
        std::string text;
        Require(
            Send({Line("command", "ZEL_FetchDeposit"), Line("clientID", ZEL::GetClientID()),
                  Line("depositor", deposit.client), Line("time", std::to_string(deposit.time))},
                 text, {kMaxDepositBytes}),
            "the configuration cannot be fetched");
        return text;
    }

    void Require(int status, const std::string& what) const {
        if (status == kUnknownCommand) {
            throw RunFailure(FailureKind::kRefused, status,
                             "server " + ServerOf(info) +
                                 " is of an earlier version, which keeps no configurations of "
                                 "clients");
        }
        if (status != kDone) {
            throw Failed(what, status);
        }
    }
};

DepositSession::DepositSession(const ZEL::SyncInfo& info, const std::atomic<bool>& cancel)
    : impl_(std::make_unique<Impl>(info, cancel)) {}

DepositSession::~DepositSession() = default;

void DepositSession::Connect() {
    impl_->Find();
}

void DepositSession::Leave(const std::string& text) {
    impl_->Leave(text);
}

std::vector<Deposit> DepositSession::List() {
    return impl_->List();
}

std::string DepositSession::Fetch(const Deposit& deposit) {
    return impl_->Fetch(deposit);
}

}  // namespace programs
