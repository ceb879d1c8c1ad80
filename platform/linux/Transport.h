#pragma once

#include "platform/Transport.h"
#include "platform/linux/Root.h"
#include "platform/linux/TransportLimits.h"

#include <atomic>
#include <cstddef>
#include <memory>
#include <string>

namespace platform::linux_ {

namespace qmx {
class Loop;
} // namespace qmx

/// The transport over Unix stream sockets below the runtime directory, or passed in by the service manager.
/// `docs/wire-protocol.md` defines what travels on them.
///
/// One thread, "qmx-io", waits for all sockets. It calls the handlers of accepted connections itself; what a handler
/// does there delays every other peer. Replies are written by the thread that sends them.
class Transport final : public platform::Transport {
public:
    /// Raises the process's limit of open files as far as allowed and starts the thread.
    explicit Transport(const Root& root, const qmx::Limits& limits = {});
    /// Closes everything and joins the thread; must not run on it. Handlers that run meanwhile on other queues may
    /// finish, none is called afterwards. Finalizers still run.
    ~Transport() override;

    std::shared_ptr<platform::Listener> createListener(const std::string& serviceName,
                                                       std::shared_ptr<WorkQueue> queue) override;
    std::shared_ptr<platform::Connection> connect(const std::string& serviceName,
                                                  std::shared_ptr<WorkQueue> queue) override;
    std::unique_ptr<KeepAliveActivity> beginActivity(const std::string& name) override;

    /// How many keep-alive activities exist now.
    std::size_t activityCount() const;

private:
    const qmx::Limits _limits;
    const std::string _directory;
    std::shared_ptr<qmx::Loop> _loop;
    std::shared_ptr<const qmx::Budgets> _budgets;
    std::shared_ptr<std::atomic<std::size_t>> _activities;
};

} // namespace platform::linux_
