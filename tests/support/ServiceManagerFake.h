#pragma once

#include "platform/ServiceManager.h"

#include <atomic>
#include <cerrno>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

namespace support {

/// A service manager whose services are entries in a table. Refuses everything with EPERM until told to allow. Callable
/// from any thread.
class FakeServiceManager final : public platform::ServiceManager {
public:
    using Service = std::pair<std::string, std::string>; // bundle identifier and version

    struct ExternalService {
        pid_t host;
        std::string executablePath;
        platform::Dictionary overlay;
    };

    /// From now on services are added, and removals are done: they end the instances of `addInstance`.
    void allow() {
        _additionFailure = 0;
        _usualResult = platform::serviceHasNoInstances;
    }
    /// Answers additions with `number`, and nothing is added; 0 ends it.
    void failAdditions(int number) { _additionFailure = number; }
    /// From now on answers wait for `answer`.
    void holdAnswers() { _isHolding = true; }
    void addInstance(const std::string& bundleIdentifier, const std::string& version) {
        fail(bundleIdentifier, version, platform::serviceInstancesTerminated);
    }
    /// Answers the next removal of this service with `result`.
    void fail(const std::string& bundleIdentifier, const std::string& version, int result) {
        const std::lock_guard lock(_mutex);
        _results[{bundleIdentifier, version}] = result;
    }
    /// Every service that was added, in order.
    std::vector<ExternalService> additions() const {
        const std::lock_guard lock(_mutex);
        return _additions;
    }
    /// Every removal asked for.
    std::vector<Service> removals() const {
        const std::lock_guard lock(_mutex);
        return _removals;
    }
    /// Gives the oldest answer that waits. False when none does.
    bool answer() {
        const std::lock_guard lock(_mutex);
        if (_held.empty()) return false;
        const auto oldest = _held.front();
        _held.erase(_held.begin());
        oldest();
        return true;
    }

    int addExternalServiceForHost(const platform::AuditToken& host, const std::string& executablePath,
                                  const platform::Dictionary& overlay) override {
        const std::lock_guard lock(_mutex);
        if (_additionFailure != 0) return _additionFailure;
        _additions.push_back({host.pid, executablePath, overlay});
        return 0;
    }
    void removeExternalService(const std::string& bundleIdentifier, const std::string& version,
                               std::shared_ptr<platform::WorkQueue> queue,
                               std::function<void(int)> completion) override {
        const std::lock_guard lock(_mutex);
        const Service service{bundleIdentifier, version};
        _removals.push_back(service);
        const auto told = _results.extract(service);
        const int result = told ? told.mapped() : _usualResult.load();
        const auto answer = [=] { queue->async([=] { completion(result); }); };
        _isHolding ? _held.push_back(answer) : answer();
    }

private:
    mutable std::recursive_mutex _mutex; // a queue may run answers in place, and they may ask again
    std::atomic<bool> _isHolding = false;
    std::atomic<int> _additionFailure = EPERM;
    std::atomic<int> _usualResult = EPERM;
    std::vector<ExternalService> _additions;
    std::map<Service, int> _results; // of the next removal
    std::vector<Service> _removals;
    std::vector<std::function<void()>> _held;
};

} // namespace support
