#pragma once

#include <array>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <initializer_list>
#include <string>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

namespace bench {

[[noreturn]] inline void fail(const std::string& what) {
    std::fprintf(stderr, "bench: %s\n", what.c_str());
    std::exit(1);
}

[[noreturn]] inline void failSystem(const std::string& what) { fail(what + ": " + std::strerror(errno)); }

/// A descriptor that a process is started with, as by a service manager (sd_listen_fds(3)).
struct Passed {
    std::string name;
    int descriptor = -1; // negative: none
};

/// A child process that ends with this object, and with this process however that ends.
class Process {
public:
    /// Output of the program goes to `log`. Entries of `environment` are "NAME=value".
    Process(const std::vector<std::string>& command, const std::vector<std::string>& environment,
            const std::string& log = "/dev/null", const Passed& passed = {}) {
        std::vector<char*> arguments;
        for (const auto& argument : command) arguments.push_back(const_cast<char*>(argument.c_str()));
        arguments.push_back(nullptr);
        _pid = fork();
        if (_pid < 0) failSystem("fork");
        if (_pid > 0) return;
        prctl(PR_SET_PDEATHSIG, SIGKILL);
        for (const auto& variable : environment) putenv(const_cast<char*>(variable.c_str()));
        const int output = open(log.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600);
        dup2(output, STDOUT_FILENO);
        dup2(output, STDERR_FILENO);
        if (passed.descriptor >= 0) {
            constexpr int first = 3;
            dup2(passed.descriptor, first);
            fcntl(first, F_SETFD, 0);
            setenv("LISTEN_PID", std::to_string(getpid()).c_str(), 1);
            setenv("LISTEN_FDS", "1", 1);
            setenv("LISTEN_FDNAMES", passed.name.c_str(), 1);
        }
        execvp(arguments.front(), arguments.data());
        _exit(127);
    }
    ~Process() { stop(); }
    Process(const Process&) = delete;
    Process& operator=(const Process&) = delete;

    pid_t pid() const { return _pid; }
    bool isRunning() {
        if (_pid > 0 && waitpid(_pid, &_status, WNOHANG) == _pid) _pid = -1;
        return _pid > 0;
    }

    /// SIGTERM; the exit status as waitpid(2) gives it.
    int stop() {
        if (_pid > 0) {
            kill(_pid, SIGTERM);
            while (waitpid(_pid, &_status, 0) < 0 && errno == EINTR) {
            }
            _pid = -1;
        }
        return _status;
    }

private:
    pid_t _pid = -1;
    int _status = 0;
};

} // namespace bench
