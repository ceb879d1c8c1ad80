#pragma once

#include "platform/linux/Descriptor.h"

#include <cerrno>
#include <csignal>
#include <cstddef>
#include <fcntl.h>
#include <functional>
#include <grp.h>
#include <linux/filter.h>
#include <linux/seccomp.h>
#include <string>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>
#include <utility>
#include <vector>

namespace support {

inline constexpr uid_t ordinaryUser = 65534;

/// For this process, which may be root, to go on as a user without privileges.
inline bool becomeOrdinaryUser() {
    if (geteuid() != 0) return true;
    return setgroups(0, nullptr) == 0 && setresgid(ordinaryUser, ordinaryUser, ordinaryUser) == 0 &&
           setresuid(ordinaryUser, ordinaryUser, ordinaryUser) == 0;
}

/// For this process to go on with a kernel that does not know the system call.
inline bool loseSystemCall(unsigned number) {
    sock_filter code[] = {BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, nr)),
                          BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, number, 0, 1),
                          BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ERRNO | ENOSYS),
                          BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW)};
    const sock_fprog filter{std::size(code), code};
    return prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) == 0 && prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, &filter) == 0;
}

/// The exit status, or minus the signal, once the child has ended.
inline int waitFor(pid_t child) {
    int status = 0;
    waitpid(child, &status, 0);
    return WIFEXITED(status) ? WEXITSTATUS(status) : -WTERMSIG(status);
}

/// A child process that ends with what `body` gives (0 to 99). While this process has other threads, `body` must not
/// allocate: the child would wait for ever for a lock that another thread held at that moment.
inline pid_t startChild(const std::function<int()>& body) {
    const pid_t child = fork();
    if (child != 0) return child;
    alarm(30); // to fail instead of hanging
    _exit(body());
}
inline int resultInChild(const std::function<int()>& body) { return waitFor(startChild(body)); }

/// What a child does before it runs its program, without allocating. False when it cannot.
using Preparation = std::function<bool()>;
inline bool atOnce() { return true; }

/// A child that runs a program until this object goes. The program's standard input and output are pipes.
class ChildProgram {
public:
    using Words = std::vector<std::string>;

    /// Without an `environment` it has that of this process.
    explicit ChildProgram(const std::string& path, const Preparation& prepare = atOnce, Words arguments = {},
                          Words environment = {}) {
        int input[2];
        int output[2];
        int running[2]; // closed by a successful exec
        if (pipe2(input, O_CLOEXEC) != 0 || pipe2(output, O_CLOEXEC) != 0 || pipe2(running, O_CLOEXEC) != 0) return;
        arguments.insert(arguments.begin(), path);
        const auto words = pointersTo(arguments);
        const auto variables = pointersTo(environment);
        _pid = fork();
        if (_pid == 0) {
            prctl(PR_SET_PDEATHSIG, SIGKILL);
            dup2(input[0], STDIN_FILENO);
            dup2(output[1], STDOUT_FILENO);
            if (prepare()) execve(path.c_str(), words.data(), environment.empty() ? environ : variables.data());
            (void)!write(running[1], "x", 1);
            _exit(1);
        }
        for (const int end : {input[0], output[1], running[1]}) close(end);
        _input.reset(input[1]);
        _output.reset(output[0]);
        char failed = 0;
        _runs = read(running[0], &failed, 1) == 0;
        close(running[0]);
    }
    ~ChildProgram() { end(); }
    ChildProgram(const ChildProgram&) = delete;
    ChildProgram& operator=(const ChildProgram&) = delete;

    /// False when the preparation or the exec failed.
    bool runs() const { return _runs; }
    bool hasEnded() const {
        siginfo_t info{};
        return waitid(P_PID, static_cast<id_t>(_pid), &info, WEXITED | WNOHANG | WNOWAIT) != 0 || info.si_pid != 0;
    }
    pid_t pid() const { return _pid; }
    /// What it writes, up to the byte `last` or to the end.
    std::string readTo(char last = '\0') const {
        std::string text;
        for (char byte = 0; read(_output.get(), &byte, 1) == 1 && byte != last;) text += byte;
        return text;
    }
    /// Closes its input and waits for its end. The exit status, or minus the signal.
    int finish() {
        _input.reset();
        return waitFor(std::exchange(_pid, -1));
    }
    /// Ends the program and waits until its pid is free.
    void end() {
        if (_pid <= 0) return;
        kill(_pid, SIGKILL);
        finish();
    }

private:
    static std::vector<char*> pointersTo(Words& words) {
        std::vector<char*> pointers;
        for (auto& word : words) pointers.push_back(word.data());
        pointers.push_back(nullptr);
        return pointers;
    }

    pid_t _pid = -1;
    bool _runs = false;
    platform::linux_::Descriptor _input;
    platform::linux_::Descriptor _output;
};

/// One that waits on its standard input, like `cat`.
using WaitingProgram = ChildProgram;

} // namespace support
