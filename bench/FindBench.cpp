// Measures "find" against the real daemon beside servers that do nothing else than answer as many bytes.
//
//   FindBench DAEMON [ROUNDS [SECONDS]]
//
// Every figure is taken in rounds that alternate with its reference; see docs/benchmarks.md.

#include "Zembra/ZBDaemonClient.h"
#include "bench/Bundles.h"
#include "bench/Bus.h"
#include "bench/Daemon.h"
#include "bench/EchoServer.h"
#include "bench/Load.h"
#include "bench/Run.h"
#include "bench/Statistics.h"
#include "platform/Url.h"
#include "platform/linux/Root.h"
#include "platform/linux/Transport.h"
#include "platform/linux/WorkQueue.h"

#include <future>
#include <memory>

namespace {

using namespace bench;
using platform::UUID;

constexpr int applications = 8;
constexpr std::size_t waitingRequests = 16;

/// Applications with one plug-in each; answers the plug-ins' paths.
std::vector<std::string> layOut(const std::string& root) {
    std::vector<std::string> plugIns;
    for (int i = 0; i < applications; ++i) {
        const std::string name = "Bench" + std::to_string(i);
        plugIns.push_back(writePlugIn(writeApplication(root, name), name));
    }
    return plugIns;
}

std::vector<UUID> findByPath(Daemon& daemon, const std::vector<std::string>& plugIns) {
    std::vector<UUID> uuids;
    for (const auto& plugIn : plugIns) {
        const std::string url = platform::URL::file(plugIn).absoluteString();
        uuids.push_back(uuidOf(decodedMatches(daemon.ask(zembra::requestType::find, {{zembra::key::paths, url}}))));
    }
    return uuids;
}

std::vector<std::string> findRequests(const std::vector<UUID>& uuids) {
    std::vector<std::string> requests;
    for (const auto& uuid : uuids) {
        requests.push_back(requestFrame(zembra::requestType::find, {{zembra::key::uuids, uuid}}, requests.size() + 1));
    }
    return requests;
}

/// Mean microseconds of a find through the client library, form included.
double clientRoundTrip(const Daemon& daemon, const std::vector<UUID>& uuids, double seconds) {
    platform::linux_::WorkQueues queues;
    platform::linux_::Transport transport(platform::linux_::Root(daemon.root()));
    const auto client = zembra::ZBDaemonClient::initWithServiceName(transport, queues, std::nullopt);
    std::size_t count = 0;
    return meanMicroseconds(seconds, [&] {
        const auto answer = std::make_shared<std::promise<platform::ReplyOrError>>();
        client->findPlugInByUUID(uuids[count++ % uuids.size()],
                                 [answer](const platform::ReplyOrError& reply) { answer->set_value(reply); });
        const auto reply = answer->get_future().get();
        const auto* message = std::get_if<Dictionary>(&reply);
        if (message == nullptr || !client->convertFromQMX((*message)[zembra::key::matches])) fail("no form");
    });
}

/// One placement of the processes on the CPUs: everything is started anew, and inherits it.
struct Placement {
    std::string name;
    Goal decodedTrip;
    Goal loadedRate; // of eight clients that keep requests waiting
};

void measure(const Settings& settings, const Placement& placement, const std::string& directory) {
    const std::string root = directory + "/root";
    const auto plugIns = layOut(root);
    Daemon daemon(settings.daemon, root);
    const auto uuids = findByPath(daemon, plugIns);
    const Target find = daemon.targetFor(findRequests(uuids));
    EchoProcess echoServer(settings.self, directory + "/echo", find.replySize);
    const Target echo = echoServer.targetLike(find);
    BusReference bus(settings.self, directory, find.replySize);

    Series echoTrip;
    Series findTrip;
    Series decodedTrip;
    Series clientTrip;
    Series busTrip;
    for (int round = 0; round < settings.rounds; ++round) {
        echoTrip.add(roundTrip(echo, settings.seconds));
        findTrip.add(roundTrip(find, settings.seconds));
        decodedTrip.add(
            roundTrip(find, settings.seconds, [](std::string_view body) { decodedMatches(decodedReply(body)); }));
        clientTrip.add(clientRoundTrip(daemon, uuids, settings.seconds));
        if (bus.isAvailable()) busTrip.add(bus.roundTrip(settings.seconds));
    }
    std::printf("\n%s; request %zu bytes, reply %zu bytes\n", placement.name.c_str(), find.requests.front().size(),
                find.replySize);
    printHeader("Round trip, one client");
    printReference("echo, one hop", echoTrip, "us");
    printRow("find, bytes only", findTrip, "us", echoTrip);
    printRow("find, reply decoded into trees", decodedTrip, "us", echoTrip, placement.decodedTrip);
    printRow("find through the client library, form decoded", clientTrip, "us", echoTrip);
    if (bus.isAvailable())
        printRow("as many bytes through a message bus daemon", busTrip, "us", echoTrip);
    else
        std::printf("(no message bus daemon is installed)\n");

    printHeader("Requests per second");
    for (const std::size_t depth : {std::size_t{1}, waitingRequests}) {
        for (const std::size_t clients : {1, 8, 64}) {
            Series echoRate;
            Series findRate;
            for (int round = 0; round < settings.rounds; ++round) {
                echoRate.add(throughput(echo, clients, depth, settings.seconds));
                findRate.add(throughput(find, clients, depth, settings.seconds));
            }
            const std::string load = std::to_string(clients) + (clients == 1 ? " client, " : " clients, ") +
                                     std::to_string(depth) + " waiting each: ";
            printReference(load + "echo", echoRate, "1/s");
            printRow(load + "find", findRate, "1/s", echoRate,
                     clients == 8 && depth == waitingRequests ? placement.loadedRate : Goal());
        }
    }
    std::fflush(stdout);
}

} // namespace

int main(int argc, char** argv) {
    const std::vector<std::string> arguments(argv, argv + argc);
    if (arguments.size() == 4 && arguments[1] == "echo") EchoServer(arguments[2], std::stoul(arguments[3])).run();
    if (arguments.size() == 4 && arguments[1] == "bus") runBusService(arguments[2], std::stoul(arguments[3]));
    const Settings settings = settingsFrom(arguments);
    const ScratchDirectory scratch;
    const cpu_set_t allowed = allowedCPUs();
    printMachine(settings);
    runOnOneCPU();
    measure(settings, {"All processes on one CPU", atMost(1.5), atLeast(0.75)}, scratch.path() + "/one");
    runOn(allowed);
    measure(settings, {"Free placement", {}, {}}, scratch.path() + "/free");
    return 0;
}
