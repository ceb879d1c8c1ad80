// Measures "ready" and "access" against the real daemon, beside a round trip and what the answers cannot do without.
//
//   ActivationBench DAEMON [ROUNDS [SECONDS]]
//
// Every figure is taken in rounds that alternate with its reference; see docs/benchmarks.md.

#include "Zembra/ZBProtocol.h"
#include "bench/Bundles.h"
#include "bench/Daemon.h"
#include "bench/EchoServer.h"
#include "bench/Load.h"
#include "bench/Run.h"
#include "bench/Statistics.h"

#include <fcntl.h>
#include <fstream>
#include <functional>
#include <list>
#include <memory>
#include <openssl/core_names.h>
#include <openssl/evp.h>
#include <openssl/params.h>
#include <sys/stat.h>
#include <unistd.h>

namespace {

using namespace bench;
using platform::Array;
namespace requestType = zembra::requestType;
namespace key = zembra::key;

constexpr std::size_t manyPlugIns = 100;
constexpr const char* program = "program";

/// Applications with a plug-in each that has a program; answers the plug-ins' paths.
std::vector<std::string> layOut(const std::string& root) {
    std::vector<std::string> plugIns;
    for (std::size_t i = 0; i < manyPlugIns; ++i) {
        const std::string name = "Bench" + std::to_string(i);
        const std::string path =
            writePlugIn(writeApplication(root, name), name, {.manifest = {{"VBBundleExecutable", program}}});
        std::ofstream(path + "/" + program) << "#!/bin/sh\n";
        std::filesystem::permissions(path + "/" + program, std::filesystem::perms(0755));
        plugIns.push_back(path);
    }
    return plugIns;
}

/// The size of what the daemon has in the service manager's directory for one of `count` plug-ins.
std::size_t registrationSize(const Daemon& daemon, std::size_t count) {
    std::size_t size = 0;
    for (const auto& entry :
         std::filesystem::recursive_directory_iterator(daemon.root() + "/run/nordane/ignitd/hosts")) {
        if (entry.is_regular_file()) size += entry.file_size();
    }
    if (size == 0) fail("the service manager has no registrations");
    return size / count;
}

/// The calls that the registration of a program for a host is made of: which bundle and which program it is now, and a
/// file in place of the earlier one.
class Registrations {
public:
    Registrations(const std::string& directory, const std::vector<std::string>& bundles, std::size_t size)
        : _directory(directory), _bundles(bundles), _bytes(size, 'x') {
        std::filesystem::create_directories(_directory);
    }

    /// In place of those that the call before made.
    void make(std::size_t count) {
        ++_round;
        for (std::size_t i = 0; i < count; ++i) make(_bundles[i], _directory + "/" + std::to_string(i));
    }

private:
    static Descriptor opened(int descriptor, const std::string& path) {
        if (descriptor < 0) failSystem(path);
        return Descriptor(descriptor);
    }

    void make(const std::string& bundle, const std::string& name) {
        const Descriptor directory = opened(open(bundle.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC), bundle);
        const Descriptor executable = opened(openat(directory.get(), program, O_PATH | O_CLOEXEC), bundle);
        for (const auto* file : {&directory, &executable}) {
            struct statx status{};
            if (statx(file->get(), "", AT_EMPTY_PATH, STATX_BASIC_STATS | STATX_BTIME, &status) != 0)
                failSystem(bundle);
        }
        const std::string former = name + "-" + std::to_string(_round - 1);
        const std::string current = name + "-" + std::to_string(_round);
        const Descriptor file = opened(open(current.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600), current);
        if (write(file.get(), _bytes.data(), _bytes.size()) < 0) failSystem(current);
        unlink(former.c_str());
    }

    std::string _directory;
    std::vector<std::string> _bundles;
    std::string _bytes;
    std::size_t _round = 0;
};

/// What a token is made of: which bundle it is now, and a message authentication code with a key whose schedule is
/// kept.
class Tokens {
public:
    explicit Tokens(std::string text) : _text(std::move(text)) {
        const std::unique_ptr<EVP_MAC, void (*)(EVP_MAC*)> algorithm(EVP_MAC_fetch(nullptr, "HMAC", nullptr),
                                                                     EVP_MAC_free);
        _context.reset(EVP_MAC_CTX_new(algorithm.get()));
        char digest[] = "SHA256";
        const OSSL_PARAM parameters[] = {OSSL_PARAM_construct_utf8_string(OSSL_MAC_PARAM_DIGEST, digest, 0),
                                         OSSL_PARAM_construct_end()};
        const unsigned char bytes[32] = {};
        if (!_context || EVP_MAC_init(_context.get(), bytes, sizeof bytes, parameters) != 1) fail("no HMAC");
    }

    void make(const std::string& bundle) {
        struct statx status{};
        if (statx(AT_FDCWD, bundle.c_str(), 0, STATX_BASIC_STATS | STATX_BTIME, &status) != 0) failSystem(bundle);
        unsigned char code[32];
        std::size_t size = 0;
        if (EVP_MAC_init(_context.get(), nullptr, 0, nullptr) != 1 ||
            EVP_MAC_update(_context.get(), reinterpret_cast<const unsigned char*>(_text.data()), _text.size()) != 1 ||
            EVP_MAC_final(_context.get(), code, &size, sizeof code) != 1)
            fail("no HMAC");
    }

private:
    std::string _text;
    std::unique_ptr<EVP_MAC_CTX, void (*)(EVP_MAC_CTX*)> _context{nullptr, EVP_MAC_CTX_free};
};

/// A request beside an echo of as many bytes and `work`, which the answer cannot do without.
class Comparison {
public:
    Comparison(const Settings& settings, const std::string& name, Target asked, std::string workName,
               std::function<void()> work)
        : _settings(settings),
          _name(name),
          _workName(std::move(workName)),
          _asked(std::move(asked)),
          _echo(settings.self, _asked.path + "-" + name, _asked.replySize),
          _work(std::move(work)) {}

    void measure() {
        _reference.add(roundTrip(_echo.targetLike(_asked), _settings.seconds) +
                       meanMicroseconds(_settings.seconds, _work));
        _answered.add(roundTrip(_asked, _settings.seconds));
    }

    void print() const {
        printReference("an echo, and " + _workName, _reference, "us");
        printRow(_name, _answered, "us", _reference);
    }

private:
    const Settings& _settings;
    std::string _name;
    std::string _workName;
    Target _asked;
    EchoProcess _echo;
    std::function<void()> _work;
    Series _reference;
    Series _answered;
};

void measure(const Settings& settings, const std::string& directory) {
    const std::string root = directory + "/root";
    const auto bundles = layOut(root);
    Daemon daemon(settings.daemon, root);
    std::vector<Value> uuids;
    const Array forms = decodedMatches(daemon.ask(requestType::match)).array().value_or(Array());
    for (const Value& form : forms) uuids.emplace_back(uuidOf(form));
    if (uuids.size() != manyPlugIns) fail("some plug-ins are missing");
    const Dictionary one{{key::uuids, Array{uuids.front()}}};
    const Dictionary many{{key::uuids, Array(uuids)}};

    const Target readyOne = daemon.targetFor({requestFrame(requestType::ready, one)});
    Registrations registration(root + "/run/bench-one", bundles, registrationSize(daemon, 1));
    const Target readyMany = daemon.targetFor({requestFrame(requestType::ready, many)});
    Registrations registrations(root + "/run/bench-many", bundles, registrationSize(daemon, manyPlugIns));

    const auto tokens = daemon.ask(requestType::access, many).array(key::extensions);
    const auto token = tokens && tokens->size() == manyPlugIns ? (*tokens)[0].string() : std::nullopt;
    constexpr std::size_t codeSize = 64; // of a token, in hexadecimal
    if (!token || token->size() <= codeSize) fail("no tokens");
    Tokens made{std::string(token->substr(codeSize))};

    std::list<Comparison> comparisons;
    comparisons.emplace_back(settings, "ready of 1", readyOne, "the files of a registration",
                             [&] { registration.make(1); });
    comparisons.emplace_back(settings, "ready of 100", readyMany, "the files of 100 registrations",
                             [&] { registrations.make(manyPlugIns); });
    comparisons.emplace_back(settings, "access of 100", daemon.targetFor({requestFrame(requestType::access, many)}),
                             "100 bundles looked at and signatures", [&] {
                                 for (const auto& bundle : bundles) made.make(bundle);
                             });
    for (int round = 0; round < settings.rounds; ++round) {
        for (auto& comparison : comparisons) comparison.measure();
    }
    printHeader("Ready and access, one host");
    for (const auto& comparison : comparisons) comparison.print();
    std::fflush(stdout);
}

} // namespace

int main(int argc, char** argv) {
    const std::vector<std::string> arguments(argv, argv + argc);
    if (arguments.size() == 4 && arguments[1] == "echo") EchoServer(arguments[2], std::stoul(arguments[3])).run();
    const Settings settings = settingsFrom(arguments);
    const ScratchDirectory scratch;
    printMachine(settings);
    runOnOneCPU();
    std::printf("\nAll processes on one CPU\n");
    measure(settings, scratch.path());
    return 0;
}
