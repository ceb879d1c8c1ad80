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
    std::chrono::milliseconds interval{0};
    int issues = 0;   // how often a token was asked for
    int consumed = 0; // successes; the last one is the latest handle
    int released = 0;

    void allowFile(const std::string& path) { files[path] = path; }

    platform::Result<std::string> issueFile(const std::string& extensionClass, const std::string& path,
                                            platform::SandboxFlag flag, const std::string& within) override {
        const auto file = files.find(path);
        if (file == files.end()) return issue(false, path);
        const std::string& resolved = file->second;
        const bool isWithin = within.empty() || resolved == within || resolved.starts_with(within + "/");
        const std::string& named = flag == platform::SandboxFlag::canonical ? resolved : path;
        return issue(isWithin, "file:" + extensionClass + ":" + named);
    }
    platform::Result<std::string> issueService(const std::string& extensionClass, const std::string& name) override {
        return issue(services.contains(name), "service:" + extensionClass + ":" + name);
    }
    std::chrono::milliseconds repeatInterval() const override { return interval; }
    std::int64_t consume(const std::string& token, int& errorNumber) override {
        errorNumber = consumeError != 0 ? consumeError : EPERM;
        if (consumeError != 0 || !_issued.contains(token)) return -1;
        return ++consumed;
    }
    int release(std::int64_t handle, int& errorNumber) override {
        errorNumber = releaseError != 0 ? releaseError : EINVAL;
        if (releaseError != 0 || handle < 1 || handle > consumed) return -1;
        ++released;
        return 0;
    }
    bool isSandboxed(std::int32_t pid) override { return !unconfined.contains(pid); }

private:
    platform::Result<std::string> issue(bool isAllowed, const std::string& token) {
        ++issues;
        if (issueError != 0) return platform::Error{platform::posixErrorDomain, issueError, "failed"};
        if (!isAllowed) return platform::Error{platform::posixErrorDomain, EPERM, "refused"};
        return *_issued.insert(token).first;
    }

    std::set<std::string> _issued;
};

} // namespace support
