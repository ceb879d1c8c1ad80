#pragma once

#include "platform/Error.h"
#include "platform/linux/Descriptor.h"
#include "platform/linux/RequestSocket.h"
#include "platform/linux/Root.h"
#include "platform/linux/SandboxToken.h"

#include <memory>
#include <string>
#include <string_view>

namespace platform::linux_ {

/// The socket at which the daemon exchanges tokens for descriptors. A request is the token's text, for a file below the
/// token's directory followed by NUL and the relative path. The answer of a file token has a descriptor.
class SandboxBroker {
public:
    /// Starts listening. `signer` must outlive the broker.
    static Result<std::unique_ptr<SandboxBroker>> start(const Root& root, TokenSigner& signer);

    /// Removes the socket, for a process that ends without destroying this object.
    void removeName() const { _socket->removeName(); }

    /// A connection to the broker of `root`. Waiting on it is bounded.
    static Result<Descriptor> connect(const Root& root);

private:
    explicit SandboxBroker(TokenSigner& signer) : _signer(signer) {}
    /// False while the peer has not sent its request.
    bool serve(int connection);
    /// Zero, or an errno value. `below` is empty for what the token itself names.
    static int open(const SandboxGrant& grant, const std::string& below, int connection, Descriptor& opened);

    TokenSigner& _signer;
    std::unique_ptr<RequestSocket> _socket; // last, for its thread uses the others
};

} // namespace platform::linux_
