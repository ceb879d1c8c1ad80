#pragma once

#include "platform/linux/SystemLog.h"

#include <algorithm>
#include <cstdio>
#include <vector>

namespace support {

/// The log, with its lines kept for the test to look at instead of written. It keeps every level, unless told
/// otherwise, and shows private arguments. Any thread.
class FakeSystemLog final : public platform::linux_::SystemLog {
public:
    struct Line {
        std::string category; // empty for the default handle
        platform::LogLevel level;
        std::string message;
        bool operator==(const Line&) const = default;
    };

    FakeSystemLog() : SystemLog("", "debug,private", -1, Destination::descriptor) {}

    /// All lines since the last `clear`, oldest first.
    std::vector<Line> lines() const {
        const std::lock_guard guard(_linesLock);
        return _lines;
    }
    /// The messages of one category.
    std::vector<std::string> messages(std::string_view category) const {
        std::vector<std::string> found;
        for (const Line& line : lines())
            if (line.category == category) found.push_back(line.message);
        return found;
    }
    /// True when some line reads so.
    bool contains(platform::LogLevel level, std::string_view category, std::string_view message) const {
        return std::ranges::count(lines(), Line{std::string(category), level, std::string(message)}) != 0;
    }
    /// From now on lines go to standard error too, where a death test can match them.
    void print() { _isPrinting = true; }
    void clear() {
        const std::lock_guard guard(_linesLock);
        _lines.clear();
    }

private:
    void write(const platform::LogRecord& record) noexcept override {
        if (_isPrinting) std::fprintf(stderr, "%s\n", std::string(record.message).c_str());
        const std::lock_guard guard(_linesLock);
        _lines.push_back({std::string(record.category), record.level, std::string(record.message)});
    }

    std::atomic<bool> _isPrinting = false;
    mutable std::mutex _linesLock; // guards what follows
    std::vector<Line> _lines;
};

/// The log of every test program that includes this header, installed before `main`: handles are taken once per
/// process, so all tests share it. It is never destroyed.
inline FakeSystemLog& processLog = []() -> FakeSystemLog& {
    auto& log = *new FakeSystemLog;
    platform::setSystemLog(log);
    return log;
}();

/// True when a line of the process's log begins with `start`.
inline bool logged(platform::LogLevel level, std::string_view start, std::string_view category = "ops") {
    return std::ranges::any_of(processLog.lines(), [&](const auto& line) {
        return line.level == level && line.category == category && line.message.starts_with(start);
    });
}

} // namespace support
