#pragma once

#include <fcntl.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <stdexcept>
#include <string>
#include <vector>

extern char** environ;

namespace test {

/// A program with its standard input and output (errors included) in our hands; ended and waited
/// for at the end.
class Child {
public:
    explicit Child(const std::vector<std::string>& arguments) {
        int in[2], out[2];
        if (pipe2(in, O_CLOEXEC) != 0 || pipe2(out, O_CLOEXEC) != 0) {
            throw std::runtime_error("no pipe");
        }
        posix_spawn_file_actions_t actions;
        posix_spawn_file_actions_init(&actions);
        posix_spawn_file_actions_adddup2(&actions, in[0], 0);
        posix_spawn_file_actions_adddup2(&actions, out[1], 1);
        posix_spawn_file_actions_adddup2(&actions, out[1], 2);
        std::vector<char*> argv;
        for (const std::string& argument : arguments) {
            argv.push_back(const_cast<char*>(argument.c_str()));
        }
        argv.push_back(nullptr);
        const int error = posix_spawnp(&pid_, argv[0], &actions, nullptr, argv.data(), environ);
        posix_spawn_file_actions_destroy(&actions);
        close(in[0]);
        close(out[1]);
        in_ = in[1];
        out_ = out[0];
        if (error != 0) {
            throw std::runtime_error("cannot start " + arguments[0]);
        }
    }
    ~Child() {
        if (pid_ > 0) {
            kill(pid_, SIGKILL);
            Wait();
        }
        CloseInput();
        close(out_);
    }
    Child(const Child&) = delete;
    Child& operator=(const Child&) = delete;

    void Write(const std::string& text) const {
        if (write(in_, text.data(), text.size()) != static_cast<ssize_t>(text.size())) {
            throw std::runtime_error("the program does not read");
        }
    }
    void CloseInput() {
        if (in_ >= 0) {
            close(in_);
        }
        in_ = -1;
    }
    /// One line of its output, or what there is before the end.
    std::string ReadLine() const {
        std::string line;
        char c;
        while (read(out_, &c, 1) == 1 && c != '\n') {
            line += c;
        }
        return line;
    }
    /// The output to its end, which is the program's, and its exit status.
    int Finish(std::string& output) {
        char buffer[4096];
        for (ssize_t n; (n = read(out_, buffer, sizeof buffer)) > 0;) {
            output.append(buffer, static_cast<size_t>(n));
        }
        return Wait();
    }

private:
    int Wait() {
        int status = 0;
        waitpid(pid_, &status, 0);
        pid_ = -1;
        return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    }

    pid_t pid_ = -1;
    int in_ = -1, out_ = -1;
};

/// Runs a program to its end; throws, with its output, when it fails.
inline std::string Run(const std::vector<std::string>& arguments) {
    Child child(arguments);
    child.CloseInput();
    std::string output;
    if (child.Finish(output) != 0) {
        throw std::runtime_error(arguments[0] + " failed: " + output);
    }
    return output;
}

}  // namespace test
