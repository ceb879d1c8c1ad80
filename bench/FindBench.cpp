// Measures "find" against the real daemon beside servers that do nothing else than answer as many bytes.
//
//   FindBench DAEMON [ROUNDS [SECONDS]]
//
// Every figure is taken in rounds that alternate with its reference; see docs/benchmarks.md.

#include "Zembra/ZBDaemonClient.h"
#include "Zembra/ZBManifest.h"
#include "Zembra/ZBProtocol.h"
#include "bench/Bus.h"
#include "bench/EchoServer.h"
#include "bench/Load.h"
#include "bench/Statistics.h"
#include "platform/Url.h"
#include "platform/linux/Root.h"
#include "platform/linux/Transport.h"
#include "platform/linux/WorkQueue.h"

#include <filesystem>
#include <fstream>
#include <future>
#include <memory>
#include <sched.h>
#include <sys/utsname.h>
#include <thread>

namespace {

using namespace bench;
using platform::Dictionary;
using platform::UUID;
using platform::Value;

constexpr int applications = 8;
constexpr std::size_t waitingRequests = 16;

struct Settings {
    std::string self;
    std::string daemon;
    int rounds = 7;
    double seconds = 0.3; // per figure and round
};

void writeManifest(const std::string& bundle, const Dictionary& manifest) {
    std::filesystem::create_directories(bundle);
    const auto text = platform::encodeXML(manifest);
    if (!text) fail(text.error().text());
    std::ofstream(bundle + "/Info.vlist") << *text;
}

/// Applications with one plug-in each; the attributes make its form about as long as real ones are.
std::vector<std::string> layOut(const std::string& root) {
    namespace manifest = zembra::manifest;
    std::vector<std::string> plugIns;
    for (int i = 0; i < applications; ++i) {
        const std::string name = "Bench" + std::to_string(i);
        const std::string application = root + "/Applications/" + name + ".app";
        writeManifest(application, {{manifest::bundleIdentifier, "org.example." + name}, {manifest::bundleName, name}});

        platform::MutableDictionary attributes{{manifest::version, "1.0"},
                                               {manifest::pointName, "org.example.bench-service"}};
        for (int key = 0; key < 5; ++key) {
            attributes.set("SampleAttribute" + std::to_string(key),
                           "a value of the length that values in manifests have");
        }
        const std::string plugIn = application + "/PlugIns/" + name + ".appex";
        writeManifest(plugIn,
                      {{manifest::bundleIdentifier, "org.example." + name + ".plug-in"},
                       {manifest::bundleName, name},
                       {manifest::bundleDisplayName, "Bench plug-in " + std::to_string(i)},
                       {manifest::bundleVersion, "1.0"},
                       {manifest::extension, Dictionary{{manifest::pointIdentifier, "org.example.bench-service"},
                                                        {manifest::attributes, attributes}}}});
        plugIns.push_back(plugIn);
    }
    return plugIns;
}

std::string requestFrame(std::uint64_t id, std::string_view key, const Value& value) {
    std::string frame;
    qmx::appendFrame(frame, qmx::FrameType::request, id,
                     Dictionary{{zembra::key::request, zembra::requestType::find},
                                {zembra::key::version, static_cast<std::uint64_t>(zembra::currentVersion)},
                                {key, value}});
    return frame;
}

/// The reply as trees: the message, and the form that it carries as one value.
Dictionary decodedForm(std::string_view body) {
    const auto message = platform::decodeCompact(body, platform::UUIDs::allowed);
    const auto reply = message ? message->dictionary() : std::nullopt;
    const Value matches = reply ? (*reply)[zembra::key::matches] : Value();
    const auto form = matches.data() ? platform::decodeCompact(*matches.data(), platform::UUIDs::refused)
                                     : platform::Result<Value>(platform::Error{});
    if (!form || !form->dictionary()) fail("a reply without a form");
    return *form->dictionary();
}

/// The real daemon on its scratch root, its plug-ins found once, so that its cache is hot.
class Daemon {
public:
    Daemon(const Settings& settings, const std::string& directory)
        : _root(directory + "/root"),
          _plugIns(layOut(_root)),
          _environment("NORDANE_ROOT=" + _root),
          _process({settings.daemon}, {_environment, "NORDANE_LOG=stderr"}) {
        const Descriptor socket = connectTo(path(), _process);
        FrameReader reader;
        for (const auto& plugIn : _plugIns) {
            const std::string url = platform::URL::file(plugIn).absoluteString();
            sendAll(socket.get(), requestFrame(1, zembra::key::paths, url));
            const auto uuid = UUID::parse(decodedForm(reader.next(socket.get()).body).string("uuid").value_or(""));
            if (!uuid) fail("a form without a UUID");
            _uuids.push_back(*uuid);
            _requests.push_back(requestFrame(_uuids.size(), zembra::key::uuids, *uuid));
        }
        for (const auto& request : _requests) {
            sendAll(socket.get(), request);
            reader.next(socket.get());
            if (_replySize != 0 && reader.frameSize() != _replySize) fail("the forms differ in size");
            _replySize = reader.frameSize();
        }
    }
    ~Daemon() {
        if (_process.stop() != 0) fail("the daemon did not end well");
    }

    std::string path() const { return _root + "/run/nordane/" + zembra::serviceName; }
    Target target() { return {path(), _process, _requests, _replySize}; }
    const std::string& root() const { return _root; }
    const std::vector<UUID>& uuids() const { return _uuids; }

private:
    std::string _root;
    std::vector<std::string> _plugIns;
    std::string _environment;
    Process _process;
    std::vector<UUID> _uuids;
    std::vector<std::string> _requests;
    std::size_t _replySize = 0;
};

/// Mean microseconds of a find through the client library, form included.
double clientRoundTrip(const Daemon& daemon, double seconds) {
    platform::linux_::WorkQueues queues;
    platform::linux_::Transport transport(platform::linux_::Root(daemon.root()));
    const auto client = zembra::ZBDaemonClient::initWithServiceName(transport, queues, std::nullopt);
    std::size_t count = 0;
    const auto ask = [&] {
        const auto answer = std::make_shared<std::promise<platform::ReplyOrError>>();
        client->findPlugInByUUID(daemon.uuids()[count++ % daemon.uuids().size()],
                                 [answer](const platform::ReplyOrError& reply) { answer->set_value(reply); });
        const auto reply = answer->get_future().get();
        const auto* message = std::get_if<Dictionary>(&reply);
        if (message == nullptr || !client->convertFromQMX((*message)[zembra::key::matches])) fail("no form");
    };
    for (int i = 0; i < 100; ++i) ask();
    count = 0;
    const double start = secondsNow();
    double end = start;
    do {
        for (int i = 0; i < 50; ++i) ask();
        end = secondsNow();
    } while (end - start < seconds);
    return (end - start) / static_cast<double>(count) * 1e6;
}

/// One placement of the processes on the CPUs: everything is started anew, and inherits it.
void measure(const Settings& settings, const std::string& placement, const std::string& directory) {
    std::filesystem::create_directories(directory);
    Daemon daemon(settings, directory);
    const Target find = daemon.target();
    const std::string echoPath = directory + "/echo";
    Process echoServer({settings.self, "echo", echoPath, std::to_string(find.replySize)}, {});
    const Target echo{echoPath, echoServer, find.requests, find.replySize};
    BusReference bus(settings.self, directory, find.replySize);

    Series echoTrip;
    Series findTrip;
    Series decodedTrip;
    Series clientTrip;
    Series busTrip;
    for (int round = 0; round < settings.rounds; ++round) {
        echoTrip.add(roundTrip(echo, settings.seconds, nullptr));
        findTrip.add(roundTrip(find, settings.seconds, nullptr));
        decodedTrip.add(roundTrip(find, settings.seconds, [](std::string_view body) { decodedForm(body); }));
        clientTrip.add(clientRoundTrip(daemon, settings.seconds));
        if (bus.isAvailable()) busTrip.add(bus.roundTrip(settings.seconds));
    }
    std::printf("\n%s; request %zu bytes, reply %zu bytes\n", placement.c_str(), find.requests.front().size(),
                find.replySize);
    printHeader("Round trip, one client");
    printRow("echo, one hop", echoTrip, nullptr, "us");
    printRow("find, bytes only", findTrip, &echoTrip, "us");
    printRow("find, reply decoded into trees", decodedTrip, &echoTrip, "us");
    printRow("find through the client library, form decoded", clientTrip, &echoTrip, "us");
    if (bus.isAvailable())
        printRow("as many bytes through a message bus daemon", busTrip, &echoTrip, "us");
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
            printRow(load + "echo", echoRate, nullptr, "1/s");
            printRow(load + "find", findRate, &echoRate, "1/s");
        }
    }
    std::fflush(stdout);
}

void runOn(const cpu_set_t& cpus) {
    if (sched_setaffinity(0, sizeof cpus, &cpus) != 0) failSystem("sched_setaffinity");
}

void measureBothPlacements(const Settings& settings) {
    std::string pattern = std::filesystem::temp_directory_path().string() + "/zbd-bench-XXXXXX";
    if (mkdtemp(pattern.data()) == nullptr) failSystem(pattern);

    cpu_set_t allowed;
    if (sched_getaffinity(0, sizeof allowed, &allowed) != 0) failSystem("sched_getaffinity");
    int last = 0; // interrupts tend to be served by the first
    for (int cpu = 0; cpu < CPU_SETSIZE; ++cpu) {
        if (CPU_ISSET(cpu, &allowed)) last = cpu;
    }
    cpu_set_t one;
    CPU_ZERO(&one);
    CPU_SET(last, &one);

    utsname system{};
    uname(&system);
    std::printf("%s %s, %d CPUs, compiled by %s, %d rounds of %.2f s\n", system.sysname, system.release,
                CPU_COUNT(&allowed), __VERSION__, settings.rounds, settings.seconds);
    runOn(one);
    measure(settings, "All processes on one CPU", pattern + "/one");
    runOn(allowed);
    measure(settings, "Free placement", pattern + "/free");
    std::filesystem::remove_all(pattern);
}

} // namespace

int main(int argc, char** argv) {
    const std::vector<std::string> arguments(argv, argv + argc);
    if (arguments.size() == 4 && arguments[1] == "echo") EchoServer(arguments[2], std::stoul(arguments[3])).run();
    if (arguments.size() == 4 && arguments[1] == "bus") runBusService(arguments[2], std::stoul(arguments[3]));
    if (arguments.size() < 2 || arguments.size() > 4) {
        std::fprintf(stderr, "usage: FindBench DAEMON [ROUNDS [SECONDS]]\n");
        return 2;
    }
    Settings settings{std::filesystem::read_symlink("/proc/self/exe"), arguments[1]};
    if (arguments.size() > 2) settings.rounds = std::stoi(arguments[2]);
    if (arguments.size() > 3) settings.seconds = std::stod(arguments[3]);
    if (settings.rounds < 1 || !(settings.seconds > 0)) fail("at least one round of some length");
    measureBothPlacements(settings);
    return 0;
}
