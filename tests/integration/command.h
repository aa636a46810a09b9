#pragma once

#include <sys/wait.h>

#include <cstdio>
#include <stdexcept>
#include <string>

namespace test {

/// A shell command whose output, errors included, is read; waited for at the end.
class Command {
public:
    explicit Command(const std::string& text) : stream_(popen((text + " 2>&1").c_str(), "re")) {
        if (stream_ == nullptr) {
            throw std::runtime_error("cannot run " + text);
        }
    }
    ~Command() { Status(); }
    Command(const Command&) = delete;
    Command& operator=(const Command&) = delete;

    /// The next line, or what there is before the end.
    std::string ReadLine() {
        std::string line;
        for (int c; (c = fgetc(stream_)) != EOF && c != '\n';) {
            line += static_cast<char>(c);
        }
        return line;
    }
    /// The output to its end; `status`: the command's exit status.
    std::string Finish(int& status) {
        std::string output;
        for (int c; (c = fgetc(stream_)) != EOF;) {
            output += static_cast<char>(c);
        }
        status = Status();
        return output;
    }

private:
    int Status() {
        const int status = stream_ == nullptr ? 0 : pclose(stream_);
        stream_ = nullptr;
        return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    }

    FILE* stream_;
};

/// Runs a command to its end and gives its output; throws when it fails.
inline std::string Run(const std::string& text) {
    int status = 0;
    const std::string output = Command(text).Finish(status);
    if (status != 0) {
        throw std::runtime_error(text + " failed: " + output);
    }
    return output;
}

}  // namespace test
