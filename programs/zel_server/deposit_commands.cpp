#include "programs/zel_server/deposit_commands.h"

#include "base/percent.h"
#include "base/random_digits.h"
#include "base/text.h"
#include "base/utf8.h"
#include "programs/common/server_status.h"
#include "programs/zel_server/deposits.h"
#include "programs/zel_server/names.h"

namespace zel_server {

namespace {

using namespace programs;

// A name that people are shown.
std::optional<std::string> NameOf(const Command& command, const char* key) {
    const std::string* const name = command.Find(key);
    return name != nullptr && IsServerName(*name) && base::IsUtf8(*name)
               ? std::optional<std::string>(*name)
               : std::nullopt;
}

std::optional<uint64_t> NumberOf(const Command& command, const char* key, uint64_t max) {
    const std::string* const number = command.Find(key);
    return number == nullptr ? std::nullopt : base::ParseNumber(*number, max);
}

std::optional<DepositPiece> ParsePiece(const Request& request) {
    const auto server = NameOf(request.command, "serverName");
    const auto name = NameOf(request.command, "clientName");
    const auto bytes = NumberOf(request.command, "bytes", kMaxDepositBytes);
    const auto offset = NumberOf(request.command, "offset", kMaxDepositBytes);
    const std::string* const upload = request.command.Find("upload");
    const std::string* const encoded = request.command.Find("text");
    const auto text = encoded == nullptr ? std::nullopt : base::PercentDecoded(*encoded);
    if (!server || !name || !bytes || !offset || !text || text->empty() || upload == nullptr ||
        !base::AreRandomDigits(*upload) || *offset + text->size() > *bytes) {
        return std::nullopt;
    }
    DepositPiece piece;
    piece.deposit = {request.Client(), 0, *bytes, *server, *name};
    piece.upload = *upload;
    piece.offset = *offset;
    piece.text = *text;
    return piece;
}

// A word of an answer: without blanks.
std::string Word(const std::string& name) {
    return base::PercentEncoded(name, ".-_");
}

}  // namespace

Answer DepositConfig(const Request& request) {
    const auto piece = ParsePiece(request);
    return {piece ? TakeDepositPiece(request.account, *piece) : kBadArgument, ""};
}

Answer ListDeposits(const Request& request) {
    if (request.command.Find("outfile") == nullptr) {
        return {kBadArgument, ""};
    }
    std::string text;
    for (const Deposit& deposit : Deposits(request.account)) {
        text += deposit.client + " " + std::to_string(deposit.time) + " " +
                std::to_string(deposit.bytes) + " " + Word(deposit.server) + " " +
                Word(deposit.name) + "\n";
    }
    return {kDone, text};
}

Answer FetchDeposit(const Request& request) {
    const std::string* const client = request.command.Find("depositor");
    const auto time = NumberOf(request.command, "time", INT64_MAX);
    if (client == nullptr || !IsClientId(*client) || !time ||
        request.command.Find("outfile") == nullptr) {
        return {kBadArgument, ""};
    }
    auto text = ReadDeposit(request.account, *client, static_cast<int64_t>(*time));
    return text ? Answer{kDone, *std::move(text)} : Answer{kNoSuchDeposit, ""};
}

}  // namespace zel_server
