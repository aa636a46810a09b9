// The configuration that clients leave with the server, for the day on which they are lost.
//
// A small file for each deposit, in the server's own folder, by account and client. What it says is
// the client's matter: to the server it is a text.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace zel_server {

/// Of how many clients an account may have deposits, and how large one may be.
inline constexpr size_t kMaxDepositClients = 16;
inline constexpr size_t kMaxDepositBytes = size_t{1} << 20;

struct Deposit {
    std::string client;  ///< its identity
    int64_t time = 0;    ///< when it came, in seconds since the epoch; no two of a client are alike
    uint64_t bytes = 0;
    std::string server;  ///< the client's name for this server
    std::string name;    ///< the client's own name
};

/// The account's, those of a client together and its youngest first. One that cannot be read is
/// left out.
std::vector<Deposit> Deposits(const std::string& account);

/// The text of one; nothing when there is none, or it cannot be read.
std::optional<std::string> ReadDeposit(const std::string& account, const std::string& client,
                                       int64_t time);

/// A command holds little: a text comes in pieces, the first at offset 0.
struct DepositPiece {
    Deposit deposit;     ///< without a time; `bytes` of all pieces together
    std::string upload;  ///< what its pieces have in common, see base::RandomDigits()
    uint64_t offset = 0;
    std::string text;
};

/// Takes a piece; with the last one the deposit is there. Of a client's deposits the last three
/// that differ are kept, and of older ones the first of each of three days: neither an empty
/// configuration nor many of one day push a good one out. Returns a status. Called with the
/// registry's lock held.
int TakeDepositPiece(const std::string& account, const DepositPiece& piece);

/// Remove the deposits of an account, or of one of its clients. False, with errno set, when they
/// cannot be removed; what is not there is removed.
bool RemoveDeposits(const std::string& account);
bool RemoveDeposits(const std::string& account, const std::string& client);

}  // namespace zel_server
