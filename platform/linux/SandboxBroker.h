#pragma once

#include "platform/Error.h"
#include "platform/linux/Descriptor.h"
#include "platform/linux/FileStatus.h"
#include "platform/linux/Root.h"
#include "platform/linux/SandboxToken.h"

#include <deque>
#include <memory>
#include <thread>

namespace platform::linux_ {

/// Connections that have not yet sent their token. One more drops the oldest, so silent peers only hurt each other:
/// who sends at once, as every consumer does, is served when accepted.
inline constexpr std::size_t maximumSilentConnections = 64;

/// The socket at which the daemon exchanges tokens for descriptors. One packet each way per connection: the token's
/// text; then an errno value (32 bits, native order), zero on success and with the descriptor for a file token.
class SandboxBroker {
public:
    /// Starts listening. `signer` must outlive the broker.
    static Result<std::unique_ptr<SandboxBroker>> start(const Root& root, TokenSigner& signer);
    /// Stops the thread and removes the socket.
    ~SandboxBroker();
    SandboxBroker(const SandboxBroker&) = delete;
    SandboxBroker& operator=(const SandboxBroker&) = delete;

    /// A connection to the broker of `root`. Waiting on it is bounded.
    static Result<Descriptor> connect(const Root& root);

private:
    explicit SandboxBroker(TokenSigner& signer) : _signer(signer) {}
    Failure listen(const Root& root);
    void run();
    void acceptWaiting();
    /// False while the peer has not sent its token.
    bool serve(int connection);
    int open(const SandboxGrant& grant, int connection, Descriptor& opened) const;

    TokenSigner& _signer;
    Descriptor _directory;
    Descriptor _listener;
    Descriptor _stop;
    Descriptor _reserve; // given up to accept and close a connection when the process has no descriptor left
    FileIdentity _socket;
    std::deque<Descriptor> _silent; // oldest first; used on the thread only
    std::thread _thread;
};

} // namespace platform::linux_
