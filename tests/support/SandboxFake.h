#pragma once

#include "platform/Sandbox.h"

#include <cerrno>
#include <map>
#include <set>
#include <string>

namespace support {

/// A sandbox service in memory. It refuses every path and service (EPERM) and takes every process for confined until
/// told otherwise.
class FakeSandbox final : public platform::Sandbox {
public:
    /// Paths to what they resolve to.
    std::map<std::string, std::string> files;
    std::set<std::string> services;
    std::set<std::int32_t> unconfined;
    /// Not zero: every call of the operation fails with it.
    int issueError = 0;
    int consumeError = 0;
    int releaseError = 0;
    int consumed = 0; // successes
    int released = 0;

    void allowFile(const std::string& path) { files[path] = path; }

    platform::Result<std::string> issueFile(const std::string& extensionClass, const std::string& path,
                                            platform::SandboxFlag flag, const std::string& within) override {
        auto file = files.find(path);
        if (issueError != 0 || file == files.end()) return refused(issueError != 0 ? issueError : EPERM);
        const std::string& resolved = file->second;
        if (!within.empty() && resolved != within && !resolved.starts_with(within + "/")) return refused(EPERM);
        return issue("file:" + extensionClass + ":" + (flag == platform::SandboxFlag::canonical ? resolved : path));
    }

    platform::Result<std::string> issueService(const std::string& extensionClass, const std::string& name) override {
        if (issueError != 0 || !services.contains(name)) return refused(issueError != 0 ? issueError : EPERM);
        return issue("service:" + extensionClass + ":" + name);
    }

    std::int64_t consume(const std::string& token, int& errorNumber) override {
        if (consumeError != 0 || !_issued.contains(token)) {
            errorNumber = consumeError != 0 ? consumeError : token.empty() ? EINVAL : EPERM;
            return -1;
        }
        ++consumed;
        _handles.insert(++_lastHandle);
        return _lastHandle;
    }

    int release(std::int64_t handle, int& errorNumber) override {
        if (releaseError != 0 || _handles.erase(handle) == 0) {
            errorNumber = releaseError != 0 ? releaseError : EINVAL;
            return -1;
        }
        ++released;
        return 0;
    }

    bool isSandboxed(std::int32_t pid) override { return !unconfined.contains(pid); }

private:
    static platform::Error refused(int number) { return {platform::posixErrorDomain, number, "refused"}; }
    std::string issue(std::string token) { return *_issued.insert(std::move(token)).first; }

    std::set<std::string> _issued;
    std::set<std::int64_t> _handles;
    std::int64_t _lastHandle = 0;
};

} // namespace support
