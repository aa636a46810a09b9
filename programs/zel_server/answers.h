// Answers to commands: files that the rsync daemon hands to the client on the same connection.
#pragma once

#include <string>

namespace zel_server {

struct Answer {
    int status = 0;
    std::string body;  ///< bytes for the command's outfile
};

/// Makes the folder of the account's answers, and removes what dead connections left in it.
bool PrepareAnswers(const std::string& account);

/// Writes `answer` for `session`, to be removed by RemoveAnswer with the same `connection` (the
/// daemon's number for it). False, with errno set, on failure.
bool WriteAnswer(const std::string& account, const std::string& session,
                 const std::string& connection, const Answer& answer);

/// Removes the answer of an ended connection. One that has none is fine.
void RemoveAnswer(const std::string& account, const std::string& connection);

}  // namespace zel_server
