#pragma once

#include <string>
#include <string_view>

namespace TARQ {
namespace Backup {

/// No answer is larger, its status line included. Nothing that the server's programs send comes
/// near.
constexpr size_t kMaxAnswerBytes = 16 * 1024 * 1024;

/// A server's answer: the line status="N", then bytes for the command's outfile.
struct Answer {
    int status = -1;
    std::string_view content;  ///< within the text that was parsed
};

/// Parses an answer. False when `text` is none: the first line must hold a decimal of one to nine
/// digits without leading zeros, in quotes, and nothing else, and end in a newline.
bool ParseAnswer(std::string_view text, Answer* answer);

/// The whole file, which must be a regular one of at most kMaxAnswerBytes. False with errno set
/// when it is not.
bool ReadAnswerFile(const std::string& path, std::string* text);

/// Makes `content` the content of the file `path`, which keeps its owner and mode when it is there
/// already. A symbolic link is not followed. False with errno set when not all of it could be
/// written.
bool WriteOutfile(const std::string& path, const std::string& content);

}  // namespace Backup
}  // namespace TARQ
