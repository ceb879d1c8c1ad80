#pragma once

#include "platform/Transport.h"
#include "platform/linux/Descriptor.h"
#include "platform/linux/TransportConnection.h"
#include "platform/linux/TransportLimits.h"
#include "platform/linux/TransportLoop.h"

#include <chrono>
#include <memory>
#include <mutex>
#include <string>
#include <sys/types.h>

namespace platform::linux_::qmx {

/// The listening end of a named service: its socket, and the handshake with those who connect.
class StreamListener final : public platform::Listener,
                             public Pollable,
                             public std::enable_shared_from_this<StreamListener> {
public:
    /// Peers have `handshake` long to show who they are.
    StreamListener(std::shared_ptr<Loop> loop, std::shared_ptr<const Budgets> budgets,
                   std::chrono::milliseconds handshake, std::shared_ptr<WorkQueue> queue);
    ~StreamListener() override;

    /// Takes the name: the socket that the service manager passed in, else a new one in `directory`. Before `resume`,
    /// once. A failure is kept for the handler.
    void open(const std::string& directory, const std::string& serviceName);

    std::optional<std::string> refusal() const override;
    void setEventHandler(EventHandler handler) override;
    void resume() override;
    void cancel() override;

    void onEvents(std::uint32_t events) override;
    void shutDown() override;

    /// A peer has shown who it is. On the loop's thread.
    void accepted(Descriptor socket, AuditToken peer, Budget::Share place);

private:
    bool adopt(const std::string& path, const std::string& serviceName);
    std::string bind(const std::string& directory, const std::string& serviceName);
    void acceptOne();
    void shed();
    void rest();
    void deliver(Event event);
    void removeName() const;
    void close();

    const std::shared_ptr<Loop> _loop;
    const std::shared_ptr<const Budgets> _budgets;
    const std::chrono::milliseconds _handshake;
    const std::shared_ptr<WorkQueue> _queue;

    // Set by `open`, then belonging to whoever closes: the loop's thread once resumed, else the last owner.
    std::string _problem; // why the name could not be had
    Descriptor _socket;
    Descriptor _lock;      // held as long as the name is ours; absent for a socket that was passed in
    Descriptor _directory; // where the socket's file is
    std::string _fileName;
    dev_t _device = 0; // of the socket's file, so that nobody else's is removed
    ino_t _inode = 0;
    Descriptor _spare; // given up for a moment to turn peers away when descriptors run out

    std::mutex _mutex;
    std::shared_ptr<EventHandler> _handler; // guarded by _mutex
    bool _resumed = false;                  // guarded by _mutex
    bool _cancelled = false;                // guarded by _mutex
};

/// True for names that may stand as one component of a path.
bool isServiceName(const std::string& name);

} // namespace platform::linux_::qmx
