#pragma once

#include "Zembra/ZBDaemonClient.h"
#include "platform/linux/Root.h"
#include "platform/linux/Transport.h"
#include "platform/linux/WorkQueue.h"

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

namespace zbctl {

/// What scripts rely on. Verbs that run a command end with its status instead, whatever that is.
enum class ExitStatus {
    success = 0,
    failure = 1, // an error reply, a program that cannot be signed, a bundle with faults; for all, output that was lost
    usage = 2,
    noDaemon = 3, // not reached, or gone before it answered
};

/// One connection to the daemon of this root.
class Session {
public:
    explicit Session(const std::optional<std::string>& service);
    ~Session();
    Session(const Session&) = delete;
    Session& operator=(const Session&) = delete;

    /// Passes the client and a callback to `request`, which is to start exactly one request with them, and waits for
    /// the answer. The transport bounds no time: a busy daemon answers late.
    platform::ReplyOrError
    ask(const std::function<void(zembra::ZBDaemonClient&, zembra::ZBDaemonClient::Callback)>& request);

    /// What "matches" of a reply holds; absent without it, and for an error in place of a reply.
    platform::Value matches(const platform::ReplyOrError& answer) const;

    /// Calls `handler` once, on a thread of its own, when the daemon goes away or is not there.
    void whenGone(std::function<void()> handler);

private:
    const std::string _service;
    platform::linux_::WorkQueues _queues;
    platform::linux_::Transport _transport;
    std::shared_ptr<zembra::ZBDaemonClient> _client;
    std::shared_ptr<platform::Connection> _watch; // asks nothing; its end tells of the daemon's
};

/// Says on standard error what an answer failed with, if it did; `subject` says what it was about.
ExitStatus report(const platform::ReplyOrError& answer, std::string_view subject = {});

} // namespace zbctl
