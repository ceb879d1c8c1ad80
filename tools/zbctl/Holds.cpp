#include "Zembra/ZBProtocol.h"
#include "platform/linux/Descriptor.h"
#include "tools/zbctl/Command.h"
#include "tools/zbctl/Input.h"
#include "tools/zbctl/Output.h"
#include "tools/zbctl/Verbs.h"

#include <array>
#include <atomic>
#include <cerrno>
#include <csignal>
#include <iostream>
#include <sys/eventfd.h>

namespace zbctl {

namespace key = zembra::key;
using platform::Array;
using platform::Dictionary;
using platform::ReplyOrError;
using platform::UUID;
using platform::linux_::Descriptor;
using zembra::ZBDaemonClient;

namespace {

struct Hold {
    std::vector<std::string> paths;
    std::uint64_t flags = 0;
};

struct Flag {
    const char* name;
    zembra::LockFlags bit;
    const char* description;
};
constexpr std::array flags{
    Flag{"--plug-in", zembra::ZBLockPlugInPaths, "The paths are plug-in bundles, not applications"},
    Flag{"--refuse-when-busy", zembra::ZBLockRefuseWhenBusy, "No hold while any of the plug-ins is busy"},
    Flag{"--terminate", zembra::ZBLockTerminate, "End the running instances first"},
};

/// The end of a hold that nothing but its holder keeps: a signal, or the daemon's end. One of a process.
class HoldEnd {
public:
    HoldEnd() : _event(::eventfd(0, EFD_CLOEXEC)) { _wakeUp = _event.get(); }

    /// Any thread.
    void noteDaemonGone() {
        _isDaemonGone = true;
        wake(0);
    }
    bool isDaemonGone() const { return _isDaemonGone; }

    /// From now on signals end the hold instead of the process.
    static void catchSignals() {
        for (const int signal : {SIGINT, SIGTERM, SIGHUP}) static_cast<void>(std::signal(signal, wake));
    }
    void wait() const {
        eventfd_t count = 0;
        while (::eventfd_read(_event.get(), &count) != 0 && errno == EINTR) {
        }
    }

private:
    static void wake(int) {
        const int error = errno;
        static_cast<void>(::eventfd_write(_wakeUp, 1));
        errno = error;
    }
    static inline int _wakeUp = -1; // a signal handler reaches nothing else

    const Descriptor _event;
    std::atomic<bool> _isDaemonGone = false;
};

ReplyOrError askForRelease(Session& session, const std::vector<UUID>& tokens) {
    return session.ask([&](ZBDaemonClient& client, ZBDaemonClient::Callback callback) {
        auto message = client.request(zembra::requestType::lock);
        ZBDaemonClient::set(message, tokens);
        client.send(message, std::move(callback));
    });
}

void complainOfConflicts(const Dictionary& reply) {
    for (const auto& conflict : reply.array(key::conflicts).value_or(Array())) {
        for (const auto& property : conflict.dictionary().value_or(Dictionary())) {
            complain("busy: " + std::string(property.value.string().value_or("")));
        }
    }
}

ExitStatus keep(Session& session, HoldEnd& end, const UUID& token, const std::vector<std::string>& command) {
    ExitStatus status = ExitStatus::success;
    if (command.empty()) {
        HoldEnd::catchSignals();
        std::cerr << "holding until interrupted\n" << std::flush;
        end.wait();
        if (end.isDaemonGone()) status = ExitStatus::noDaemon;
    } else {
        status = static_cast<ExitStatus>(runCommand(command));
    }
    if (end.isDaemonGone()) {
        complain("the daemon went away, and the hold with it");
        return status;
    }
    // Others may rely on the plug-ins being free once this process has ended.
    const ExitStatus released = report(askForRelease(session, {token}));
    return status == ExitStatus::success ? released : status;
}

ExitStatus hold(const Invocation& invocation, const Hold& hold) {
    const auto paths = absolutePaths(hold.paths);
    if (!paths) return ExitStatus::usage;
    const auto end = std::make_shared<HoldEnd>();
    Session session(invocation.service);
    session.whenGone([end] { end->noteDaemonGone(); });
    const auto answer = session.ask([&](ZBDaemonClient& client, ZBDaemonClient::Callback callback) {
        client.holdPlugins(*paths, hold.flags, std::move(callback));
    });
    const ExitStatus status = report(answer);
    if (status == ExitStatus::noDaemon) return status;
    const auto& reply = std::get<Dictionary>(answer);
    const auto token = reply.uuid(key::uuids);
    // With a command, standard output is its own.
    if (invocation.command.empty()) {
        if (invocation.json)
            printJson(std::cout, reply);
        else if (token)
            std::cout << token->text() << '\n';
        if (!flushOutput()) return ExitStatus::failure;
    }
    if (status != ExitStatus::success) {
        complainOfConflicts(reply);
        return status;
    }
    if (!token) {
        complain("the reply holds no token");
        return ExitStatus::failure;
    }
    return keep(session, *end, *token, invocation.command);
}

ExitStatus release(const Invocation& invocation, const std::vector<std::string>& texts) {
    std::vector<UUID> tokens;
    for (const auto& text : texts) {
        const auto token = uuidOf(text);
        if (!token) return ExitStatus::usage;
        tokens.push_back(*token);
    }
    Session session(invocation.service);
    return finish(invocation.json, askForRelease(session, tokens));
}

} // namespace

void addHolds(CLI::App& app, Invocation& invocation) {
    auto* holdVerb = app.add_subcommand("hold", "Keep plug-ins from hosts for a while");
    const auto options = std::make_shared<Hold>();
    holdVerb->add_option("PATH", options->paths, "Applications, whose plug-ins are all meant")->required();
    for (const Flag& flag : flags) {
        holdVerb->add_flag_callback(flag.name, [options, bit = flag.bit] { options->flags |= bit; }, flag.description);
    }
    holdVerb->footer(
        "A hold lasts as long as this command. It prints the token and stays until it is interrupted; or, as\n"
        "  zbctl hold PATH... -- COMMAND ARGUMENT...\n"
        "it runs the command meanwhile, prints nothing itself, and ends with the command's exit status.");
    holdVerb->callback([=, &invocation] { invocation.status = hold(invocation, *options); });

    auto* releaseVerb = app.add_subcommand("release", "End holds before their holders do");
    const auto tokens = std::make_shared<std::vector<std::string>>();
    releaseVerb->add_option("TOKEN", *tokens, "As \"hold\" printed them")->required();
    releaseVerb->callback([=, &invocation] { invocation.status = release(invocation, *tokens); });
}

} // namespace zbctl
