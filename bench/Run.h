#pragma once

#include "bench/Process.h"

#include <cstdio>
#include <filesystem>
#include <sched.h>
#include <string>
#include <sys/utsname.h>
#include <vector>

/// What every benchmark program begins with.
namespace bench {

struct Settings {
    std::string self;   // this program, which starts itself in other roles
    std::string daemon; // the program
    int rounds = 7;
    double seconds = 0.3; // per figure and round
};

/// From PROGRAM DAEMON [ROUNDS [SECONDS]].
inline Settings settingsFrom(const std::vector<std::string>& arguments) {
    if (arguments.size() < 2 || arguments.size() > 4) {
        std::fprintf(stderr, "usage: %s DAEMON [ROUNDS [SECONDS]]\n", arguments.front().c_str());
        std::exit(2);
    }
    Settings settings{std::filesystem::read_symlink("/proc/self/exe"), arguments[1]};
    if (arguments.size() > 2) settings.rounds = std::stoi(arguments[2]);
    if (arguments.size() > 3) settings.seconds = std::stod(arguments[3]);
    if (settings.rounds < 1 || !(settings.seconds > 0)) fail("at least one round of some length");
    return settings;
}

/// A directory below the one for temporary files, removed at the end.
class ScratchDirectory {
public:
    ScratchDirectory()
        : _path(std::filesystem::canonical(std::filesystem::temp_directory_path()).string() + "/zbd-bench-XXXXXX") {
        if (mkdtemp(_path.data()) == nullptr) failSystem(_path);
    }
    ~ScratchDirectory() { std::filesystem::remove_all(_path); }
    ScratchDirectory(const ScratchDirectory&) = delete;
    ScratchDirectory& operator=(const ScratchDirectory&) = delete;

    const std::string& path() const { return _path; }

private:
    std::string _path;
};

/// The CPUs that this process, and what it starts, may use.
inline cpu_set_t allowedCPUs() {
    cpu_set_t allowed;
    if (sched_getaffinity(0, sizeof allowed, &allowed) != 0) failSystem("sched_getaffinity");
    return allowed;
}
inline void runOn(const cpu_set_t& cpus) {
    if (sched_setaffinity(0, sizeof cpus, &cpus) != 0) failSystem("sched_setaffinity");
}
inline void runOnOneCPU() {
    const cpu_set_t allowed = allowedCPUs();
    int last = 0; // interrupts tend to be served by the first
    for (int cpu = 0; cpu < CPU_SETSIZE; ++cpu) {
        if (CPU_ISSET(cpu, &allowed)) last = cpu;
    }
    cpu_set_t one;
    CPU_ZERO(&one);
    CPU_SET(last, &one);
    runOn(one);
}

inline void printMachine(const Settings& settings) {
    const cpu_set_t allowed = allowedCPUs();
    utsname system{};
    uname(&system);
    std::printf("%s %s, %d CPUs, compiled by %s, %d rounds of %.2f s\n", system.sysname, system.release,
                CPU_COUNT(&allowed), __VERSION__, settings.rounds, settings.seconds);
}

} // namespace bench
