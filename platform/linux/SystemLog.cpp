#include "platform/linux/SystemLog.h"

#include "platform/linux/Utf8.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <chrono>
#include <climits>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <optional>
#include <poll.h>
#include <pthread.h>
#include <sys/stat.h>
#include <sys/uio.h>
#include <unistd.h>

// The macro layer would send the place of the call in this file with every line.
#define SD_JOURNAL_SUPPRESS_LOCATION
#include <systemd/sd-journal.h>

namespace platform {

void LogHandle::write(LogLevel level, std::string_view format, std::span<const FormatArgument> arguments) noexcept {
    const std::string message = formatArguments(format, arguments, _privacy.load(std::memory_order_relaxed));
    _sink.write({_subsystem, _category, level, message, format});
}

namespace {

/// Stands in until the process has a log.
class NoLog final : public SystemLog, private LogSink {
public:
    NoLog() : _handle(*this, "", "") { _handle.setMinimumLevel(LogLevel::standard); }
    LogHandle* createHandle(const std::string&, const std::string&) override { return &_handle; }
    LogHandle& defaultHandle() override { return _handle; }
    void setLevel(const std::string&, LogLevel) override {}

private:
    void write(const LogRecord&) noexcept override {}
    LogHandle _handle;
};

std::atomic<SystemLog*> processLog = nullptr;

} // namespace

SystemLog& systemLog() {
    if (SystemLog* log = processLog.load(std::memory_order_acquire)) return *log;
    static NoLog& noLog = *new NoLog; // kept for ever: handles are
    return noLog;
}

void setSystemLog(SystemLog& log) { processLog.store(&log, std::memory_order_release); }

namespace linux_ {

namespace {

// A reader of standard error that stands still holds up the first line that long, and the later ones not at all.
constexpr int stallMilliseconds = 100;

constexpr const char* journalSocket = "/run/systemd/journal/socket";

static_assert(maximumLineLength <= PIPE_BUF);

struct LevelName {
    LogLevel level;
    std::string_view name;
    int priority; // as syslog(3) numbers them
};

constexpr std::array<LevelName, 4> levelNames{{
    {LogLevel::debug, "debug", 7},
    {LogLevel::info, "info", 6},
    {LogLevel::standard, "default", 5},
    {LogLevel::error, "error", 3},
}};

const LevelName& nameOf(LogLevel level) { return levelNames[static_cast<std::size_t>(level)]; }

std::optional<LogLevel> levelNamed(std::string_view name) {
    for (const LevelName& entry : levelNames)
        if (entry.name == name) return entry.level;
    return std::nullopt;
}

std::string timeStamp() {
    using namespace std::chrono;
    const auto now = system_clock::now().time_since_epoch();
    const std::time_t whole = duration_cast<seconds>(now).count();
    auto fraction = static_cast<unsigned>(duration_cast<microseconds>(now).count() % 1'000'000);
    // Lines come in thousands per second; only their fraction differs.
    thread_local std::time_t writtenSecond = -1;
    thread_local std::string text = "0000-00-00T00:00:00.000000Z";
    constexpr std::size_t secondLength = 19;
    if (whole != writtenSecond) {
        std::tm parts{};
        gmtime_r(&whole, &parts); // no local time: its rules are read from a file, under a lock
        std::array<char, 64> second;
        if (std::strftime(second.data(), second.size(), "%Y-%m-%dT%H:%M:%S", &parts) == secondLength)
            text.replace(0, secondLength, second.data(), secondLength);
        writtenSecond = whole;
    }
    for (std::size_t digit = secondLength + 6; digit > secondLength; --digit, fraction /= 10)
        text[digit] = static_cast<char>('0' + fraction % 10);
    return text;
}

/// Whether writing may wait for a reader, or find that there is none any more. Plain files and the null device have
/// none, so their lines cost one system call.
bool hasReader(int descriptor) {
    struct stat status{};
    if (::fstat(descriptor, &status) != 0) return true;
    return !S_ISREG(status.st_mode) && !(S_ISCHR(status.st_mode) && ::isatty(descriptor) == 0);
}

/// Keeps SIGPIPE of one write from stopping the process: the reader of the log may be gone.
class PipeSignalGuard {
public:
    PipeSignalGuard() {
        sigemptyset(&_pipe);
        sigaddset(&_pipe, SIGPIPE);
        pthread_sigmask(SIG_BLOCK, &_pipe, &_before);
    }
    ~PipeSignalGuard() {
        const timespec atOnce{};
        if (brokenPipe && !sigismember(&_before, SIGPIPE)) sigtimedwait(&_pipe, nullptr, &atOnce);
        pthread_sigmask(SIG_SETMASK, &_before, nullptr);
    }
    PipeSignalGuard(const PipeSignalGuard&) = delete;
    PipeSignalGuard& operator=(const PipeSignalGuard&) = delete;

    bool brokenPipe = false;

private:
    sigset_t _pipe;
    sigset_t _before;
};

bool isPrintable(std::string_view message, std::size_t limit) {
    return message.size() <= limit && plainLength(message) == message.size();
}

} // namespace

std::string printableLine(std::string_view message, std::size_t limit) {
    constexpr std::string_view ellipsis = "...";
    constexpr std::string_view hexadecimal = "0123456789abcdef";
    if (isPrintable(message, limit)) return std::string(message);
    std::string out;
    out.reserve(std::min(message.size(), limit));
    std::size_t cut = 0; // where whole pieces end with room for the ellipsis
    for (std::size_t at = 0; at < message.size();) {
        const auto byte = static_cast<unsigned char>(message[at]);
        std::size_t length = utf8Length(message, at);
        // U+0080 to U+009F are control characters too, in two bytes.
        const bool isControl = byte < 0x20 || byte == 0x7F ||
                               (byte == 0xC2 && length == 2 && static_cast<unsigned char>(message[at + 1]) < 0xA0);
        std::array<char, 8> escape{'\\', 'x'};
        std::string_view piece;
        if (byte == '\n') {
            piece = "\\n";
        } else if (byte == '\t') {
            piece = "\\t";
        } else if (isControl || length == 0) {
            length = length == 0 ? 1 : length;
            std::size_t end = 2;
            const auto code = length == 2 ? static_cast<unsigned char>(message[at + 1]) : byte;
            escape[end++] = hexadecimal[code >> 4U];
            escape[end++] = hexadecimal[code & 15U];
            piece = std::string_view(escape.data(), end);
        } else {
            piece = message.substr(at, length);
        }
        if (out.size() + piece.size() > limit) {
            out.resize(cut);
            out += ellipsis;
            break;
        }
        out += piece;
        if (out.size() + ellipsis.size() <= limit) cut = out.size();
        at += length;
    }
    return out;
}

SystemLog::SystemLog(std::string identifier, std::string_view settings, int descriptor, Destination destination)
    : _identifier(std::move(identifier)),
      _descriptor(descriptor),
      _hasReader(hasReader(descriptor)),
      _default(*this, "", "") {
    if (destination == Destination::automatic)
        _usesJournal = ::access(journalSocket, W_OK) == 0 && ::isatty(descriptor) == 0;
    apply(settings);
}

SystemLog& SystemLog::ofProcess() {
    static SystemLog& log = []() -> SystemLog& {
        const char* settings = secure_getenv(logEnvironmentVariable); // it can show private arguments
        return *new SystemLog(program_invocation_short_name, settings ? settings : "", STDERR_FILENO);
    }();
    return log;
}

void SystemLog::apply(std::string_view settings) {
    std::string unknown;
    while (!settings.empty()) {
        const std::size_t comma = settings.find(',');
        const std::string_view word = settings.substr(0, comma);
        settings = comma == std::string_view::npos ? std::string_view() : settings.substr(comma + 1);
        const std::size_t equals = word.find('=');
        const std::optional<LogLevel> level =
            levelNamed(equals == std::string_view::npos ? word : word.substr(equals + 1));
        if (level)
            setLevel(std::string(equals == std::string_view::npos ? std::string_view() : word.substr(0, equals)),
                     *level);
        else if (word == "private")
            _privacy = PrivateArguments::shown;
        else if (word == "stderr")
            _usesJournal = false;
        else if (!word.empty())
            unknown = word;
    }
    _default.setPrivateArguments(_privacy);
    // Not before the rest is known: it may say where lines go.
    if (!unknown.empty())
        _default.error("%{public}s: \"%{public}s\" is not understood", logEnvironmentVariable, unknown);
}

LogHandle* SystemLog::createHandle(const std::string& subsystem, const std::string& category) {
    const std::lock_guard guard(_lock);
    for (LogHandle& handle : _handles)
        if (handle.subsystem() == subsystem && handle.category() == category) return &handle;
    LogSink& sink = *this;
    LogHandle& handle = _handles.emplace_back(sink, subsystem, category);
    handle.setMinimumLevel(levelOf(category));
    handle.setPrivateArguments(_privacy);
    return &handle;
}

LogLevel SystemLog::levelOf(const std::string& category) const {
    const auto found = _levels.find(category);
    return found == _levels.end() ? _level : found->second;
}

void SystemLog::setLevel(const std::string& category, LogLevel minimum) {
    const std::lock_guard guard(_lock);
    if (category.empty()) {
        _level = minimum;
        _levels.clear();
        _default.setMinimumLevel(minimum);
    } else {
        _levels[category] = minimum;
    }
    for (LogHandle& handle : _handles) handle.setMinimumLevel(levelOf(handle.category()));
}

void SystemLog::write(const LogRecord& record) noexcept {
    if (_usesJournal)
        writeToJournal(record);
    else
        writeToDescriptor(record);
}

void SystemLog::writeToJournal(const LogRecord& record) {
    std::array<std::string, 5> fields{
        "MESSAGE=" + printableLine(record.message, maximumLineLength),
        "PRIORITY=" + std::to_string(nameOf(record.level).priority),
        "SYSLOG_IDENTIFIER=" + _identifier,
    };
    std::size_t count = 3;
    if (!record.subsystem.empty()) fields[count++] = "SUBSYSTEM=" + std::string(record.subsystem);
    if (!record.category.empty()) fields[count++] = "CATEGORY=" + std::string(record.category);
    std::array<iovec, fields.size()> parts{};
    for (std::size_t i = 0; i < count; ++i) parts[i] = {fields[i].data(), fields[i].size()};
    // A journal that is gone takes the line with it.
    (void)sd_journal_sendv(parts.data(), static_cast<int>(count));
}

void SystemLog::writeToDescriptor(const LogRecord& record) {
    std::string line = timeStamp();
    line += ' ';
    line += nameOf(record.level).name;
    if (!record.category.empty()) {
        line += " [";
        line += record.category;
        line += ']';
    }
    line += ' ';
    line.reserve(line.size() + record.message.size() + 1);
    const std::size_t limit = maximumLineLength - line.size() - 1;
    if (isPrintable(record.message, limit))
        line += record.message;
    else
        line += printableLine(record.message, limit);
    line += '\n';

    const auto write = [&] {
        // One write for one line, so that lines of several threads and processes stay whole.
        ssize_t written = -1;
        do written = ::write(_descriptor, line.data(), line.size());
        while (written < 0 && errno == EINTR);
        return written;
    };
    if (!_hasReader) {
        static_cast<void>(write());
        return;
    }
    pollfd ready{_descriptor, POLLOUT, 0};
    if (::poll(&ready, 1, _isStalled.load(std::memory_order_relaxed) ? 0 : stallMilliseconds) == 0) {
        _isStalled.store(true, std::memory_order_relaxed);
        return;
    }
    _isStalled.store(false, std::memory_order_relaxed);
    PipeSignalGuard guard;
    guard.brokenPipe = write() < 0 && errno == EPIPE;
}

} // namespace linux_

} // namespace platform
