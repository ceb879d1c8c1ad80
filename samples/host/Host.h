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
#include <vector>

/// A program that can be extended, and shows what it learns about its plug-ins.
namespace host {

using Words = std::vector<std::string>;

/// The host's connection to the daemon, with operations that wait for the answer.
class Daemon {
public:
    using Request = std::function<void(zembra::ZBDaemonClient&, zembra::ZBDaemonClient::Callback)>;

    Daemon();
    /// The reply; none when it was an error, which is told on standard error then.
    std::optional<platform::Dictionary> ask(const Request& request);
    /// What "matches" of a reply holds.
    platform::Value matches(const platform::Dictionary& reply) const;
    /// The form of one plug-in, by its UUID or the path of its bundle; none as above.
    std::optional<platform::Dictionary> find(const std::string& location);

    const platform::linux_::Root& root() const { return _root; }

private:
    const platform::linux_::Root _root = platform::linux_::Root::ofProcess();
    platform::linux_::WorkQueues _queues;
    platform::linux_::Transport _transport{_root};
    std::shared_ptr<zembra::ZBDaemonClient> _client;
};

/// The text, or "(none)".
std::string textOf(std::optional<std::string_view> text);
void complain(const std::string& text);

// Each answers the exit status of the program.

/// UUID|PATH [FILE-IN-BUNDLE]: one plug-in, and a file of it read through the token that came with it.
int show(Daemon& daemon, const Words& words);
/// The same for a host that cannot open the file itself any more.
int showConfined(Daemon& daemon, const Words& words);
/// POINT: the plug-ins for one of the host's extension points, without those that the user has put aside.
int discover(Daemon& daemon, const Words& words);
/// UUID|PATH [NAME=VALUE...] [-- ARGUMENT...]: makes a plug-in ready and launches it.
int run(Daemon& daemon, const Words& words);

} // namespace host
