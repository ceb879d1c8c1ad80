#pragma once

#include <cerrno>
#include <csignal>
#include <fcntl.h>
#include <functional>
#include <grp.h>
#include <string>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

namespace support {

inline constexpr uid_t ordinaryUser = 65534;

/// For this process, which may be root, to go on as a user without privileges.
inline bool becomeOrdinaryUser() {
    if (geteuid() != 0) return true;
    return setgroups(0, nullptr) == 0 && setresgid(ordinaryUser, ordinaryUser, ordinaryUser) == 0 &&
           setresuid(ordinaryUser, ordinaryUser, ordinaryUser) == 0;
}

/// What `body` gives (0 to 99) in a child process; 100 when the child died of a signal.
inline int resultInChild(const std::function<int()>& body) {
    pid_t child = fork();
    if (child == 0) {
        alarm(30); // to fail instead of hanging
        _exit(body());
    }
    int status = 0;
    while (waitpid(child, &status, 0) < 0 && errno == EINTR) {
    }
    return WIFEXITED(status) ? WEXITSTATUS(status) : 100;
}

/// A child that prepares itself and then runs the program at `path`, which waits on its standard input (like `cat`),
/// until this object goes.
class WaitingProgram {
public:
    explicit WaitingProgram(const std::string& path, const std::function<bool()>& prepare = [] { return true; }) {
        int input[2];
        int running[2]; // closed by a successful exec
        if (pipe2(input, O_CLOEXEC) != 0 || pipe2(running, O_CLOEXEC) != 0) return;
        _pid = fork();
        if (_pid == 0) {
            prctl(PR_SET_PDEATHSIG, SIGKILL);
            dup2(input[0], STDIN_FILENO);
            if (prepare()) execl(path.c_str(), path.c_str(), nullptr);
            (void)!write(running[1], "x", 1);
            _exit(1);
        }
        close(input[0]);
        close(running[1]);
        _input = input[1];
        char failed = 0;
        _runs = read(running[0], &failed, 1) == 0;
        close(running[0]);
    }
    ~WaitingProgram() { end(); }
    WaitingProgram(const WaitingProgram&) = delete;
    WaitingProgram& operator=(const WaitingProgram&) = delete;

    /// False when the preparation or the exec failed.
    bool runs() const { return _runs; }
    pid_t pid() const { return _pid; }
    /// Ends the program and waits until its pid is free.
    void end() {
        if (_pid < 0) return;
        kill(_pid, SIGKILL);
        waitpid(_pid, nullptr, 0);
        close(_input);
        _pid = -1;
    }

private:
    pid_t _pid = -1;
    int _input = -1;
    bool _runs = false;
};

} // namespace support
