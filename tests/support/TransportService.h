#pragma once

#include "platform/Transport.h"
#include "tests/support/Mailbox.h"
#include "tests/support/ScratchDirectory.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <functional>
#include <string>

namespace support {

/// A service on the transport under test that collects its requests, or answers each at once.
class TransportService : public testing::Test {
protected:
    static constexpr const char* service = "com.example.service";

    struct Request {
        std::shared_ptr<platform::Connection> connection;
        platform::ReceivedMessage message;

        void answer(const platform::Dictionary& content = {}) const {
            if (!connection) return; // none came, and the test has failed
            platform::ReplyMessage reply = createReply(message);
            reply.content.merge(content);
            connection->send(reply);
        }
    };

    /// Listens and gives each new connection to `accept`.
    std::shared_ptr<platform::Listener>
    listen(std::function<void(const std::shared_ptr<platform::Connection>&)> accept) {
        auto made = transport->createListener(service, queues->makeSerial("qmx"));
        made->setEventHandler([this, accept = std::move(accept)](const platform::Listener::Event& event) {
            if (const auto* error = std::get_if<platform::TransportError>(&event)) return listenerErrors.put(*error);
            accept(std::get<std::shared_ptr<platform::Connection>>(event));
        });
        return made;
    }
    /// Listens and serves all connections.
    std::shared_ptr<platform::Listener> serve() {
        auto made = listen([this](const std::shared_ptr<platform::Connection>& connection) { serve(connection); });
        made->resume();
        return made;
    }
    void serve(const std::shared_ptr<platform::Connection>& connection) {
        ++accepted;
        connection->setEventHandler([this, weak = std::weak_ptr(connection)](const platform::ConnectionEvent& event) {
            put(weak.lock(), event);
        });
        connection->resume();
    }
    void put(const std::shared_ptr<platform::Connection>& connection, const platform::ConnectionEvent& event) {
        if (const auto* error = std::get_if<platform::TransportError>(&event)) return errors.put(*error);
        const Request request{connection, std::get<platform::ReceivedMessage>(event)};
        ++handled;
        if (answers) return request.answer(standardAnswer);
        requests.put(request);
    }

    /// Lets a transport without threads deliver what waits.
    virtual void settle() {}
    template <class T> std::optional<T> next(Mailbox<T>& mailbox) {
        settle();
        return mailbox.take();
    }
    /// The next request.
    Request take() {
        const auto request = next(requests);
        EXPECT_TRUE(request);
        return request.value_or(Request());
    }
    void take(const platform::Dictionary& expected) { EXPECT_EQ(take().message.content, platform::Value(expected)); }
    void expectInvalid(const std::string& part = "") { expectInvalid(next(errors), part); }
    void expectInvalid(const std::optional<platform::TransportError>& error, const std::string& part = "") {
        ASSERT_TRUE(error);
        EXPECT_EQ(error->kind, platform::TransportErrorKind::connectionInvalid);
        EXPECT_FALSE(error->description.empty());
        EXPECT_THAT(error->description, testing::HasSubstr(part));
    }

    ScratchDirectory scratch;
    Mailbox<Request> requests;
    Mailbox<platform::TransportError> errors; // at accepted connections
    Mailbox<platform::TransportError> listenerErrors;
    std::atomic<std::size_t> accepted = 0; // connections that were served
    std::atomic<std::size_t> handled = 0;  // requests and messages
    std::atomic<bool> answers = false;     // each request at once, with `standardAnswer`; else they are collected
    platform::Dictionary standardAnswer;   // set before serving
    std::unique_ptr<platform::WorkQueues> queues;
    std::unique_ptr<platform::Transport> transport; // goes first: nothing is delivered afterwards
};

} // namespace support
