#pragma once

#include "platform/SystemLog.h"

#include <atomic>
#include <cstddef>
#include <deque>
#include <map>
#include <mutex>
#include <string>
#include <string_view>

namespace platform::linux_ {

/// The environment variable that chooses what is logged: words separated by commas. "debug", "info" and "default" set
/// the lowest level that is kept, "cx=debug" that of one category; "private" shows private arguments; "stderr" sends
/// lines to standard error even when the journal is there.
inline constexpr const char* logEnvironmentVariable = "NORDANE_LOG";

/// Longer messages are cut. A pipe takes PIPE_BUF bytes in one piece, so lines of several processes never mix.
inline constexpr std::size_t maximumLineLength = 4096;

/// `message` on one line of printable text: line ends, other control characters and bytes that are no UTF-8 are
/// written as escapes, so that no peer forges a line or steers a terminal. Cut to `limit` bytes.
std::string printableLine(std::string_view message, std::size_t limit);

/// The log on Linux: the journal, or lines on a descriptor. A subclass may send the lines elsewhere.
class SystemLog : public platform::SystemLog, private LogSink {
public:
    enum class Destination {
        automatic, // the journal when it is there and the descriptor is no terminal
        descriptor,
    };

    /// `identifier` names the program in the journal. `settings` is as the environment variable; a word that is not
    /// understood is reported in the log. `descriptor` stays the caller's.
    SystemLog(std::string identifier, std::string_view settings, int descriptor,
              Destination destination = Destination::automatic);

    /// The log of this process: named as the program, settings from the environment, lines to standard error. Made
    /// when first asked for and never destroyed, so that threads may log while the process exits.
    static SystemLog& ofProcess();

    LogHandle* createHandle(const std::string& subsystem, const std::string& category) override;
    LogHandle& defaultHandle() override { return _default; }
    void setLevel(const std::string& category, LogLevel minimum) override;

private:
    void apply(std::string_view settings);
    LogLevel levelOf(const std::string& category) const;
    void write(const LogRecord& record) noexcept override;
    void writeToJournal(const LogRecord& record);
    void writeToDescriptor(const LogRecord& record);

    const std::string _identifier;
    const int _descriptor;
    const bool _hasReader;
    bool _usesJournal = false;                            // fixed once constructed
    PrivateArguments _privacy = PrivateArguments::hidden; // fixed once constructed
    std::atomic<bool> _isStalled = false;

    std::mutex _lock; // guards what follows
    LogLevel _level = LogLevel::info;
    std::map<std::string, LogLevel> _levels;
    std::deque<LogHandle> _handles; // never moved: callers keep references

    LogHandle _default;
};

} // namespace platform::linux_
