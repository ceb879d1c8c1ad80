#pragma once

#include "platform/Transport.h"

#include <cstddef>
#include <memory>
#include <string>
#include <utility>

namespace support {

class FakeConnection;
class FakeListener;
struct FakeExchange;

/// A transport within the process. What is sent is copied as over a wire and waits in one line, in the order sent,
/// until it is delivered. On the test's thread alone; handlers of accepted connections run in `deliver`.
class FakeTransport final : public platform::Transport {
public:
    FakeTransport();
    ~FakeTransport() override;

    /// Nobody may listen for a service that was not allowed.
    void allowService(const std::string& name);
    /// Whom connections made from now on show to the other end.
    void setPeer(platform::AuditToken peer);
    /// As if nobody listened anywhere: connections that are resumed from now on are invalid.
    void refuseConnections();

    /// Delivers all that waits, and what is sent meanwhile. Answers how much.
    std::size_t deliver();

    /// The two ends of a new connection without a listener: the first behaves as one made with `connect` on `queue`,
    /// the second as an accepted one whose peer is `peer`. Both are suspended.
    std::pair<std::shared_ptr<platform::Connection>, std::shared_ptr<platform::Connection>>
    makePair(platform::AuditToken peer, std::shared_ptr<platform::WorkQueue> queue);

    // What only a test does to an end of a connection, or to a listener. Everything waits in the line as messages do.

    /// A message with any content, without reply.
    void sendValue(const std::shared_ptr<platform::Connection>& from, const platform::Value& content);
    /// The other end hears termination-imminent, and still replies.
    void shutDownSending(const std::shared_ptr<platform::Connection>& from);
    /// `to` hears `event`, whatever that is.
    void inject(const std::shared_ptr<platform::Listener>& to, platform::Listener::Event event);

    std::size_t activityCount() const;

    std::shared_ptr<platform::Listener> createListener(const std::string& serviceName,
                                                       std::shared_ptr<platform::WorkQueue> queue) override;
    std::shared_ptr<platform::Connection> connect(const std::string& serviceName,
                                                  std::shared_ptr<platform::WorkQueue> queue) override;
    std::unique_ptr<platform::KeepAliveActivity> beginActivity(const std::string& name) override;

private:
    const std::shared_ptr<FakeExchange> _exchange;
};

} // namespace support
