#include "platform/linux/ProcessIdentity.h"

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <fcntl.h>
#include <poll.h>
#include <sstream>
#include <sys/syscall.h>
#include <unistd.h>

namespace platform::linux_ {

namespace {

constexpr std::size_t maximumFileSize = 8192; // of what is read here below /proc/<pid>
// Fields of "stat", see proc(5).
constexpr int parentField = 4;
constexpr int startTimeField = 22;

std::optional<std::string> readFileOf(pid_t pid, const char* name) {
    const Descriptor file(::open(("/proc/" + std::to_string(pid) + '/' + name).c_str(), O_RDONLY | O_CLOEXEC));
    if (!file) return std::nullopt;
    std::string text(maximumFileSize, '\0');
    ssize_t size = 0;
    do size = ::read(file.get(), text.data(), text.size());
    while (size < 0 && errno == EINTR);
    if (size <= 0) return std::nullopt;
    text.resize(static_cast<std::size_t>(size));
    return text;
}

std::optional<std::string> fieldOf(const std::string& stat, int wanted) {
    // The second field is the program's name in parentheses, which may hold anything, blanks and parentheses too.
    std::size_t at = stat.rfind(')');
    for (int field = 2; field < wanted && at != std::string::npos; ++field) at = stat.find(' ', at + 1);
    if (at == std::string::npos) return std::nullopt;
    return stat.substr(at + 1, stat.find(' ', at + 1) - at - 1);
}

std::optional<pid_t> pidOf(std::string_view text) {
    pid_t pid = 0;
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), pid);
    if (error != std::errc() || end != text.data() + text.size() || pid <= 0) return std::nullopt;
    return pid;
}

} // namespace

std::optional<ProcessIdentity> ProcessIdentity::of(pid_t pid) {
    const auto stat = readFileOf(pid, "stat");
    auto time = stat ? fieldOf(*stat, startTimeField) : std::nullopt;
    if (!time) return std::nullopt;
    return ProcessIdentity{pid, *std::move(time)};
}

std::optional<ProcessIdentity> ProcessIdentity::named(std::string_view name) {
    const auto separator = name.find('-');
    if (separator == std::string_view::npos) return std::nullopt;
    const auto pid = pidOf(name.substr(0, separator));
    const auto time = name.substr(separator + 1);
    const bool isNumber =
        !time.empty() && std::ranges::all_of(time, [](char digit) { return digit >= '0' && digit <= '9'; });
    if (!pid || !isNumber) return std::nullopt;
    return ProcessIdentity{*pid, std::string(time)};
}

std::optional<ProcessIdentity> parentOf(const ProcessIdentity& process) {
    const auto parentNow = [&process]() -> std::optional<pid_t> {
        const auto stat = readFileOf(process.pid, "stat");
        if (!stat || fieldOf(*stat, startTimeField) != process.startTime) return std::nullopt;
        const auto text = fieldOf(*stat, parentField);
        return text ? pidOf(*text) : std::nullopt;
    };
    const auto pid = parentNow();
    auto parent = pid ? ProcessIdentity::of(*pid) : std::nullopt;
    // A process whose parent ends gets another one at once. So if it is the same now, that pid was the parent's when
    // the start time was read.
    return parentNow() == pid ? parent : std::nullopt;
}

std::optional<uid_t> ownerOf(pid_t pid) {
    const auto status = readFileOf(pid, "status");
    // The program's name comes before, and cannot hold the line break that would let it pass for this line.
    const std::size_t line = status ? status->find("\nUid:") : std::string::npos;
    if (line == std::string::npos) return std::nullopt;
    std::istringstream fields(status->substr(line + std::string_view("\nUid:").size()));
    uid_t real = 0;
    uid_t effective = 0;
    uid_t saved = 0;
    if (!(fields >> real >> effective >> saved) || real != effective || real != saved) return std::nullopt;
    return real;
}

Descriptor openProcess(pid_t pid) { return Descriptor(static_cast<int>(::syscall(SYS_pidfd_open, pid, 0))); }

Descriptor openProcess(const ProcessIdentity& process) {
    Descriptor opened = openProcess(process.pid);
    // The start time is read after the process was opened: if it is the same now, the pid has been that process's all
    // the time, and it is the one that is open.
    if (opened && (ProcessIdentity::of(process.pid) != process || hasEnded(opened))) {
        opened.reset();
        errno = ESRCH;
    }
    return opened;
}

bool hasEnded(const Descriptor& process) {
    pollfd descriptor{process.get(), POLLIN, 0};
    return ::poll(&descriptor, 1, 0) > 0;
}

} // namespace platform::linux_
