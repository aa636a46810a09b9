// Answers to commands: files that the rsync daemon sends to the client on the same connection.
#pragma once

#include <string>

namespace zel_server {

struct Answer {
    int status = 0;
    std::string body;  ///< content of the command's outfile
};

/// User and group, by number, as which the daemon delivers answers if it runs as root; they have no
/// rights anywhere.
inline constexpr unsigned int kAnswerUser = 65534;

/// Creates the folder of the account's answers, and removes answers that dead connections left
/// behind.
bool PrepareAnswers(const std::string& account);

/// Writes `answer` for `session`. RemoveAnswer removes it by the same `connection`, the daemon's
/// number for it. False, with errno set, on failure.
bool WriteAnswer(const std::string& account, const std::string& session,
                 const std::string& connection, const Answer& answer);

/// Removes the answer of an ended connection, if there is one.
void RemoveAnswer(const std::string& account, const std::string& connection);

}  // namespace zel_server
