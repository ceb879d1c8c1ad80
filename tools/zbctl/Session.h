#pragma once

#include "Zembra/ZBDaemonClient.h"
#include "platform/linux/Root.h"
#include "platform/linux/Transport.h"
#include "platform/linux/WorkQueue.h"

#include <functional>
#include <memory>
#include <optional>
#include <string>

namespace zbctl {

/// What scripts rely on.
enum class ExitStatus {
    success = 0,
    failure = 1, // an error reply; for "sign", a program that cannot be signed; for all, output that was lost
    usage = 2,
    noDaemon = 3, // not reached, or gone before it answered
};

/// One connection to the daemon of this root.
class Session {
public:
    explicit Session(const std::optional<std::string>& service);

    /// Passes the client and a callback to `request`, which is to start exactly one request with them, and waits for
    /// the answer. The transport bounds no time: a busy daemon answers late.
    platform::ReplyOrError
    ask(const std::function<void(zembra::ZBDaemonClient&, zembra::ZBDaemonClient::Callback)>& request);

    const zembra::ZBDaemonClient& client() const { return *_client; }

private:
    platform::linux_::WorkQueues _queues;
    platform::linux_::Transport _transport;
    std::shared_ptr<zembra::ZBDaemonClient> _client;
};

/// Says on standard error what an answer failed with, if it did.
ExitStatus report(const platform::ReplyOrError& answer);

} // namespace zbctl
