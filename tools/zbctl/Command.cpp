#include "tools/zbctl/Command.h"

#include "tools/zbctl/Output.h"

#include <cerrno>
#include <csignal>
#include <cstring>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

namespace zbctl {

namespace {

constexpr int cannotRun = 127;
constexpr int endedBySignal = 128;

volatile pid_t running = 0; // for the handler, which can reach nothing else

void passOn(int signal) {
    const int error = errno;
    if (running > 0) ::kill(running, signal);
    errno = error;
}

/// A terminal sends the first two to the program as well.
constexpr int ignored[] = {SIGINT, SIGQUIT};
constexpr int passedOn[] = {SIGTERM, SIGHUP};

} // namespace

int runCommand(const std::vector<std::string>& words) {
    std::vector<char*> arguments;
    arguments.reserve(words.size() + 1);
    for (const auto& word : words) arguments.push_back(const_cast<char*>(word.c_str()));
    arguments.push_back(nullptr);

    // What is ignored here would stay ignored there.
    sigset_t defaults;
    sigemptyset(&defaults);
    for (const int signal : {SIGINT, SIGQUIT, SIGPIPE}) sigaddset(&defaults, signal);
    posix_spawnattr_t attributes;
    posix_spawnattr_init(&attributes);
    posix_spawnattr_setsigdefault(&attributes, &defaults);
    posix_spawnattr_setflags(&attributes, POSIX_SPAWN_SETSIGDEF);
    for (const int signal : ignored) static_cast<void>(std::signal(signal, SIG_IGN));
    pid_t pid = 0;
    const int error = ::posix_spawnp(&pid, arguments.front(), nullptr, &attributes, arguments.data(), environ);
    posix_spawnattr_destroy(&attributes);
    if (error != 0) {
        complain(words.front() + ": " + std::strerror(error));
        return cannotRun;
    }
    running = pid;
    for (const int signal : passedOn) static_cast<void>(std::signal(signal, passOn));

    int status = 0;
    while (::waitpid(pid, &status, 0) < 0 && errno == EINTR) {
    }
    running = 0;
    return WIFEXITED(status) ? WEXITSTATUS(status) : endedBySignal + WTERMSIG(status);
}

} // namespace zbctl
