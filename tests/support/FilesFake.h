#pragma once

#include "platform/Files.h"

#include <map>
#include <optional>
#include <string>

namespace support {

/// Files in memory. Nothing exists, and nothing can be written, but in directories that were made with
/// `addDirectory`. Well-known paths are themselves.
class FakeFiles final : public platform::Files {
public:
    /// Files by path. Tests read and change them freely.
    std::map<std::string, std::string> files;
    /// Symbolic links: a whole path to a whole path.
    std::map<std::string, std::string> links;
    /// Set: every call of the operation fails with it.
    std::optional<platform::Error> readFailure;
    std::optional<platform::Error> writeFailure;
    std::optional<platform::Error> realPathFailure;
    int writes = 0; // attempts, failed ones too

    void addDirectory(const std::string& path) { _directories[path] = true; }

    std::string locate(const std::string& wellKnownPath) override { return wellKnownPath; }

    platform::Result<std::string> read(const std::string& path, std::size_t limit) override {
        if (readFailure) return *readFailure;
        std::string target = follow(path);
        if (_directories.contains(target)) return error(platform::fileReadUnknownCode, "Is a directory");
        auto file = files.find(target);
        if (file == files.end()) return error(platform::fileReadNoSuchFileCode, "No such file or directory");
        if (file->second.size() > limit) return error(platform::fileReadTooLargeCode, "too large");
        return file->second;
    }

    platform::Failure writeAtomically(const std::string& path, std::string_view bytes) override {
        ++writes;
        if (writeFailure) return writeFailure;
        std::string target = follow(path);
        if (_directories.contains(target)) return error(platform::fileWriteUnknownCode, "Is a directory");
        if (!_directories.contains(target.substr(0, target.rfind('/'))))
            return error(platform::fileWriteUnknownCode, "No such file or directory");
        files[target] = bytes;
        return std::nullopt;
    }

    platform::Result<std::string> realPath(const std::string& path, std::size_t limit) override {
        if (realPathFailure) return *realPathFailure;
        std::string target = follow(path);
        if (!files.contains(target) && !_directories.contains(target))
            return error(platform::fileReadNoSuchFileCode, "No such file or directory");
        if (target.size() >= limit) return error(platform::fileReadUnknownCode, "File name too long");
        return target;
    }

private:
    static platform::Error error(int code, const char* text) { return {platform::fileErrorDomain, code, text}; }

    std::string follow(std::string path) const {
        for (int hops = 0; hops < 40 && links.contains(path); ++hops) path = links.at(path);
        return path;
    }

    std::map<std::string, bool> _directories;
};

} // namespace support
