#include "programs/common/terminal.h"

#include <termios.h>
#include <unistd.h>

#include <cstdio>
#include <fstream>
#include <iostream>

#include "programs/common/failure.h"

namespace programs {

namespace {

constexpr size_t kMaxPassword = 255;

// Switches off the terminal's echo during its lifetime.
class NoEcho {
public:
    explicit NoEcho(int fd) : fd_(fd) {
        if (tcgetattr(fd_, &saved_) == 0) {
            struct termios silent = saved_;
            silent.c_lflag &= ~static_cast<tcflag_t>(ECHO);
            restore_ = tcsetattr(fd_, TCSAFLUSH, &silent) == 0;
        }
    }
    ~NoEcho() {
        if (restore_) {
            tcsetattr(fd_, TCSAFLUSH, &saved_);
        }
    }
    NoEcho(const NoEcho&) = delete;
    NoEcho& operator=(const NoEcho&) = delete;

private:
    int fd_;
    struct termios saved_ = {};
    bool restore_ = false;
};

bool ReadLine(std::istream& stream, std::string& line) {
    if (!std::getline(stream, line)) {
        return false;
    }
    if (!line.empty() && line.back() == '\r') {
        line.pop_back();
    }
    return true;
}

bool TypeAtTerminal(const std::string& prompt, std::string& line) {
    std::fputs(prompt.c_str(), stderr);
    const NoEcho silent(STDIN_FILENO);
    const bool read = ReadLine(std::cin, line);
    std::fputc('\n', stderr);
    return read;
}

Failure NoPassword(const char* reason) {
    return {FailureKind::kUsage, reason};
}

}  // namespace

std::string ReadPassword(const std::string& file, const std::string& prompt) {
    std::string line;
    if (file.empty()) {
        if (isatty(STDIN_FILENO) == 0) {
            throw NoPassword(
                "no password: give --password-file FILE, or '-' to read it from standard input");
        }
        if (!TypeAtTerminal(prompt, line)) {
            throw NoPassword("no password was typed");
        }
    } else if (file == "-") {
        if (!ReadLine(std::cin, line)) {
            throw NoPassword("no password on standard input");
        }
    } else {
        std::ifstream stream(file);
        if (!stream || !ReadLine(stream, line)) {
            throw SystemFailure("cannot read a password from '" + file + "'", FailureKind::kUsage);
        }
    }
    if (line.empty() || line.size() > kMaxPassword) {
        throw NoPassword("a password has 1 to 255 characters");
    }
    return line;
}

std::string ReadNewPassword(const std::string& file, const std::string& prompt) {
    for (;;) {
        std::string password = ReadPassword(file, prompt);
        if (!file.empty()) {
            return password;
        }
        std::string again;
        if (!TypeAtTerminal("Once more: ", again)) {
            throw NoPassword("the password was not typed a second time");
        }
        if (again == password) {
            return password;
        }
        std::fputs("The two are not the same; again.\n", stderr);
    }
}

std::string Ask(const std::string& question) {
    std::fprintf(stderr, "%s ", question.c_str());
    std::string answer;
    return ReadLine(std::cin, answer) ? answer : "";
}

bool Confirm(const std::string& question) {
    const std::string answer = Ask(question + " [y/N]");
    return answer == "y" || answer == "Y" || answer == "yes";
}

}  // namespace programs
