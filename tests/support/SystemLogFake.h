#pragma once

#include "platform/SystemLog.h"

#include <atomic>
#include <cstdio>
#include <deque>
#include <map>
#include <mutex>
#include <set>
#include <string>
#include <string_view>
#include <vector>

namespace support {

/// A log that keeps its lines for the test to look at. It keeps every level, unless told otherwise, and shows private
/// arguments. Any thread.
class FakeSystemLog final : public platform::SystemLog, private platform::LogSink {
public:
    struct Line {
        std::string category; // empty for the default handle
        platform::LogLevel level;
        std::string message;
    };

    FakeSystemLog() : _default(*this, "", "") {
        _default.setMinimumLevel(_level);
        _default.setPrivateArguments(platform::PrivateArguments::shown);
    }

    /// The log of every test program that includes this header, installed before `main`: handles are taken once per
    /// process, so all tests share it. It is never destroyed.
    static FakeSystemLog& ofProcess() {
        static FakeSystemLog& log = *new FakeSystemLog;
        return log;
    }

    platform::LogHandle* createHandle(const std::string& subsystem, const std::string& category) override {
        const std::lock_guard guard(_lock);
        if (_refused.contains(category)) return nullptr;
        for (platform::LogHandle& handle : _handles)
            if (handle.subsystem() == subsystem && handle.category() == category) return &handle;
        platform::LogSink& sink = *this;
        platform::LogHandle& handle = _handles.emplace_back(sink, subsystem, category);
        handle.setMinimumLevel(levelOf(category));
        handle.setPrivateArguments(platform::PrivateArguments::shown);
        return &handle;
    }
    platform::LogHandle& defaultHandle() override { return _default; }
    void setLevel(const std::string& category, platform::LogLevel minimum) override {
        const std::lock_guard guard(_lock);
        if (category.empty()) {
            _level = minimum;
            _levels.clear();
            _default.setMinimumLevel(minimum);
        } else {
            _levels[category] = minimum;
        }
        for (platform::LogHandle& handle : _handles) handle.setMinimumLevel(levelOf(handle.category()));
    }

    /// From now on no handle of this category can be made.
    void refuse(const std::string& category) {
        const std::lock_guard guard(_lock);
        _refused.insert(category);
    }

    /// All lines since the last `clear`, oldest first.
    std::vector<Line> lines() const {
        const std::lock_guard guard(_lock);
        return _lines;
    }
    /// The messages of one category.
    std::vector<std::string> messages(std::string_view category) const {
        const std::lock_guard guard(_lock);
        std::vector<std::string> found;
        for (const Line& line : _lines)
            if (line.category == category) found.push_back(line.message);
        return found;
    }
    /// True when some line reads so.
    bool contains(platform::LogLevel level, std::string_view category, std::string_view message) const {
        const std::lock_guard guard(_lock);
        for (const Line& line : _lines)
            if (line.level == level && line.category == category && line.message == message) return true;
        return false;
    }
    /// From now on lines go to standard error too, where a death test can match them.
    void print() { _isPrinting = true; }
    void clear() {
        const std::lock_guard guard(_lock);
        _lines.clear();
    }

private:
    platform::LogLevel levelOf(const std::string& category) const {
        const auto found = _levels.find(category);
        return found == _levels.end() ? _level : found->second;
    }
    void write(const platform::LogRecord& record) noexcept override {
        if (_isPrinting) std::fprintf(stderr, "%s\n", std::string(record.message).c_str());
        const std::lock_guard guard(_lock);
        _lines.push_back({std::string(record.category), record.level, std::string(record.message)});
    }

    std::atomic<bool> _isPrinting = false;
    mutable std::mutex _lock; // guards what follows, the default handle aside
    std::deque<platform::LogHandle> _handles;
    std::set<std::string> _refused;
    platform::LogLevel _level = platform::LogLevel::debug;
    std::map<std::string, platform::LogLevel> _levels;
    std::vector<Line> _lines;
    platform::LogHandle _default;
};

/// Installs the log when the program starts.
inline FakeSystemLog& processLog = []() -> FakeSystemLog& {
    platform::setSystemLog(FakeSystemLog::ofProcess());
    return FakeSystemLog::ofProcess();
}();

/// True when a line of the process's log begins with `start`.
inline bool logged(platform::LogLevel level, std::string_view start, std::string_view category = "ops") {
    for (const auto& line : processLog.lines())
        if (line.level == level && line.category == category && line.message.starts_with(start)) return true;
    return false;
}

} // namespace support
