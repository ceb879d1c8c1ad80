#include "platform/linux/Transport.h"

#include "platform/linux/TransportConnection.h"
#include "platform/linux/TransportListener.h"
#include "platform/linux/TransportLoop.h"

#include <sys/resource.h>
#include <utility>

namespace platform::linux_ {

namespace {

class Activity final : public KeepAliveActivity {
public:
    explicit Activity(std::shared_ptr<std::atomic<std::size_t>> count) : _count(std::move(count)) { ++*_count; }
    ~Activity() override { --*_count; }
    Activity(const Activity&) = delete;
    Activity& operator=(const Activity&) = delete;

private:
    const std::shared_ptr<std::atomic<std::size_t>> _count;
};

/// Each peer costs two descriptors, and the usual limit is there for programs that use select(2).
void raiseDescriptorLimit() {
    rlimit limit{};
    if (::getrlimit(RLIMIT_NOFILE, &limit) != 0 || limit.rlim_cur == limit.rlim_max) return;
    limit.rlim_cur = limit.rlim_max;
    ::setrlimit(RLIMIT_NOFILE, &limit); // a refusal leaves what there is
}

} // namespace

Transport::Transport(const Root& root, const qmx::Limits& limits)
    : _limits(limits),
      _directory(root.runtime()),
      _loop(std::make_shared<qmx::Loop>()),
      _budgets(std::make_shared<const qmx::Budgets>(limits)),
      _activities(std::make_shared<std::atomic<std::size_t>>(0)) {
    raiseDescriptorLimit();
}

Transport::~Transport() { _loop->stop(); }

std::shared_ptr<platform::Listener> Transport::createListener(const std::string& serviceName,
                                                              std::shared_ptr<WorkQueue> queue) {
    auto listener = std::make_shared<qmx::StreamListener>(_loop, _budgets, _limits.handshake, std::move(queue));
    listener->open(_directory, serviceName);
    return listener;
}

std::shared_ptr<platform::Connection> Transport::connect(const std::string& serviceName,
                                                         std::shared_ptr<WorkQueue> queue) {
    return std::make_shared<qmx::StreamConnection>(_loop, _directory, serviceName, std::move(queue));
}

std::unique_ptr<KeepAliveActivity> Transport::beginActivity(const std::string&) {
    return std::make_unique<Activity>(_activities);
}

std::size_t Transport::activityCount() const { return *_activities; }

} // namespace platform::linux_
