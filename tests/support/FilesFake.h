#pragma once

#include "platform/Files.h"

#include <map>
#include <optional>
#include <set>

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
    std::optional<platform::Error> setAsideFailure;

    void addDirectory(const std::string& path) { _directories.insert(path); }
    /// From now on peers of that user reach everything here; others reach nothing.
    void allowPeers(std::uint32_t user) { _users.insert(user); }

    std::string locate(const std::string& wellKnownPath) override { return wellKnownPath; }

    platform::Result<std::string> read(const std::string& path, std::size_t limit) override {
        if (readFailure) return *readFailure;
        const std::string target = follow(path);
        const auto file = files.find(target);
        if (file == files.end()) return error(platform::fileReadNoSuchFileCode, "No such file or directory");
        if (file->second.size() > limit) return error(platform::fileReadTooLargeCode, "too large");
        return file->second;
    }

    platform::Failure writeAtomically(const std::string& path, std::string_view bytes) override {
        if (writeFailure) return writeFailure;
        const std::string target = follow(path);
        if (!_directories.contains(target.substr(0, target.rfind('/'))))
            return error(platform::fileWriteUnknownCode, "nothing to hold it");
        files[target] = bytes;
        return std::nullopt;
    }

    platform::Failure setAside(const std::string& path, std::string_view suffix) override {
        if (setAsideFailure) return setAsideFailure;
        const std::string target = follow(path);
        auto file = files.extract(target);
        if (!file) return error(platform::fileReadNoSuchFileCode, "No such file or directory");
        files[target + std::string(suffix)] = std::move(file.mapped());
        return std::nullopt;
    }

    platform::Result<std::string> realPath(const std::string& path, std::size_t limit) override {
        std::string target = follow(path);
        if (!files.contains(target) && !_directories.contains(target))
            return error(platform::fileReadNoSuchFileCode, "No such file or directory");
        if (target.size() >= limit) return error(platform::fileReadUnknownCode, "File name too long");
        return target;
    }
    platform::Result<std::string> realPath(const std::string& path, std::size_t limit,
                                           const platform::AuditToken& peer) override {
        if (!_users.contains(peer.uid)) return error(platform::fileReadNoPermissionCode, "Permission denied");
        return realPath(path, limit);
    }

private:
    static platform::Error error(int code, const char* text) { return {platform::fileErrorDomain, code, text}; }

    std::string follow(std::string path) const {
        for (int hops = 0; hops < 40 && links.contains(path); ++hops) path = links.at(path);
        return path;
    }

    std::set<std::string> _directories;
    std::set<std::uint32_t> _users;
};

} // namespace support
