#pragma once

#include "platform/ServiceManager.h"

#include <atomic>
#include <cerrno>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <set>
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
    void allow() { _isAllowed = true; }
    /// Answers additions with `number`, and nothing is added; 0 ends it.
    void failAdditions(int number) { _additionFailure = number; }
    /// From now on answers wait for `answer`.
    void holdAnswers() { _isHolding = true; }
    void addInstance(const std::string& bundleIdentifier, const std::string& version) {
        const std::lock_guard lock(_mutex);
        _instances.insert({bundleIdentifier, version});
    }
    /// Answers removals of this service with `result`, and nothing is ended.
    void fail(const std::string& bundleIdentifier, const std::string& version, int result) {
        const std::lock_guard lock(_mutex);
        _failures[{bundleIdentifier, version}] = result;
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
        const auto oldest = std::move(_held.front());
        _held.pop_front();
        oldest();
        return true;
    }

    int addExternalServiceForHost(const platform::AuditToken& host, const std::string& executablePath,
                                  const platform::Dictionary& overlay) override {
        const std::lock_guard lock(_mutex);
        if (_additionFailure != 0) return _additionFailure;
        if (!_isAllowed) return EPERM;
        _additions.push_back({host.pid, executablePath, overlay});
        return 0;
    }
    void removeExternalService(const std::string& bundleIdentifier, const std::string& version,
                               std::shared_ptr<platform::WorkQueue> queue,
                               std::function<void(int)> completion) override {
        const std::lock_guard lock(_mutex);
        const Service service{bundleIdentifier, version};
        _removals.push_back(service);
        const auto answer = [queue = std::move(queue), call = std::move(completion), result = resultFor(service)] {
            queue->async([call, result] { call(result); });
        };
        if (_isHolding)
            _held.push_back(answer);
        else
            answer();
    }

private:
    int resultFor(const Service& service) {
        if (const auto failure = _failures.find(service); failure != _failures.end()) return failure->second;
        if (!_isAllowed) return EPERM;
        return _instances.erase(service) > 0 ? platform::serviceInstancesTerminated : platform::serviceHasNoInstances;
    }

    mutable std::recursive_mutex _mutex; // a queue may run answers in place, and they may ask again
    std::atomic<bool> _isAllowed = false;
    std::atomic<bool> _isHolding = false;
    std::atomic<int> _additionFailure = 0;
    std::vector<ExternalService> _additions;
    std::set<Service> _instances;
    std::map<Service, int> _failures;
    std::vector<Service> _removals;
    std::deque<std::function<void()>> _held;
};

} // namespace support
