#pragma once

#include "platform/Format.h"

#include <array>
#include <atomic>
#include <cstdint>
#include <span>
#include <string>
#include <string_view>
#include <type_traits>
#include <utility>

namespace platform {

/// In rising order. `standard` is the level that the log calls "default".
enum class LogLevel : std::uint8_t { debug, info, standard, error };

/// One line of the log. The views are good during the call only.
struct LogRecord {
    std::string_view subsystem;
    std::string_view category;
    LogLevel level;
    std::string_view message; // with what the log may show of the arguments
    std::string_view format;  // the text as it stands in the source
};

/// Where finished lines go. Any thread; never fails, never blocks for long.
class LogSink {
public:
    virtual ~LogSink() = default;
    virtual void write(const LogRecord& record) noexcept = 0;
};

/// One category of the log. Any thread. A line of a disabled level costs an atomic load and a branch; its arguments
/// are then not looked at (but what the caller computes to pass them, it computes).
class LogHandle {
public:
    LogHandle(LogSink& sink, std::string subsystem, std::string category)
        : _sink(sink), _subsystem(std::move(subsystem)), _category(std::move(category)) {}
    LogHandle(const LogHandle&) = delete;
    LogHandle& operator=(const LogHandle&) = delete;

    const std::string& subsystem() const { return _subsystem; }
    const std::string& category() const { return _category; }

    bool isEnabled(LogLevel level) const { return level >= _minimumLevel.load(std::memory_order_relaxed); }

    /// Lines below `level` are dropped from now on. Default and error lines are never dropped.
    void setMinimumLevel(LogLevel level) {
        _minimumLevel.store(level < LogLevel::standard ? level : LogLevel::standard, std::memory_order_relaxed);
    }
    void setPrivateArguments(PrivateArguments privacy) { _privacy.store(privacy, std::memory_order_relaxed); }

    template <class... Args> void debug(FormatString<std::type_identity_t<Args>...> text, const Args&... args) {
        if (isEnabled(LogLevel::debug)) [[unlikely]]
            write(LogLevel::debug, text.text(), Arguments<Args...>{FormatArgument(args)...});
    }
    template <class... Args> void info(FormatString<std::type_identity_t<Args>...> text, const Args&... args) {
        if (isEnabled(LogLevel::info)) write(LogLevel::info, text.text(), Arguments<Args...>{FormatArgument(args)...});
    }
    /// The default level.
    template <class... Args> void notice(FormatString<std::type_identity_t<Args>...> text, const Args&... args) {
        write(LogLevel::standard, text.text(), Arguments<Args...>{FormatArgument(args)...});
    }
    template <class... Args> void error(FormatString<std::type_identity_t<Args>...> text, const Args&... args) {
        write(LogLevel::error, text.text(), Arguments<Args...>{FormatArgument(args)...});
    }

private:
    template <class... Args> using Arguments = std::array<FormatArgument, sizeof...(Args)>;

    void write(LogLevel level, std::string_view format, std::span<const FormatArgument> arguments) noexcept;

    LogSink& _sink;
    std::string _subsystem;
    std::string _category;
    std::atomic<LogLevel> _minimumLevel = LogLevel::info;
    std::atomic<PrivateArguments> _privacy = PrivateArguments::hidden;
};

/// The log of the system. It owns the handles that it makes. Any thread.
class SystemLog {
public:
    virtual ~SystemLog() = default;
    /// The handle of a category, made when first asked for. Null when the log cannot make it.
    virtual LogHandle* createHandle(const std::string& subsystem, const std::string& category) = 0;
    /// For lines of no category.
    virtual LogHandle& defaultHandle() = 0;
    /// The lowest level that is kept, for one category, made or still to be made; an empty name means all of them.
    virtual void setLevel(const std::string& category, LogLevel minimum) = 0;
};

/// The log of this process. Until one is set, lines go nowhere.
SystemLog& systemLog();

/// Set it before anything logs: handles taken earlier stay silent. `log` must live as long as the process, since
/// whoever took a handle keeps it.
void setSystemLog(SystemLog& log);

} // namespace platform
