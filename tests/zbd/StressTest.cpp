#include "Zembra/ZBDaemonClient.h"
#include "Zembra/ZBProtocol.h"
#include "platform/linux/Transport.h"
#include "platform/linux/WorkQueue.h"
#include "tests/support/FakePlatform.h"
#include "tests/support/Mailbox.h"
#include "tests/support/ScratchDirectory.h"
#include "zbd/ZBDServer.h"

#include <gtest/gtest.h>

#include <array>
#include <atomic>
#include <random>
#include <thread>
#include <unistd.h>

namespace {

using namespace platform;

std::atomic<std::uint64_t> now = 0; // counts events, so that their order is known

/// When something was under way: a moment before its request was sent, and one after its reply came.
struct Span {
    std::uint64_t begin = ++now;
    std::uint64_t end = ~std::uint64_t{0};
};

/// The values of one thing that one thread changes, oldest first.
class History {
public:
    void begin(std::uint64_t value) {
        const std::lock_guard lock(_mutex);
        _changes.emplace_back(value, Span());
    }
    void end(bool cameAbout = true) {
        const std::lock_guard lock(_mutex);
        _changes.back().second.end = ++now;
        if (!cameAbout) _changes.pop_back();
    }
    /// Whether, at some moment of `span`, the value may have been this one; or another, when `isEqual` is false.
    bool was(std::uint64_t value, const Span& span, bool isEqual = true) const {
        const std::lock_guard lock(_mutex);
        for (auto change = _changes.rbegin(); change != _changes.rend(); ++change) {
            const auto& [each, during] = *change;
            if (during.begin < span.end && (each == value) == isEqual) return true;
            if (during.end < span.begin) return false; // those before it were over
        }
        return false;
    }

private:
    using Change = std::pair<std::uint64_t, Span>;
    mutable std::mutex _mutex;
    std::vector<Change> _changes{Change()};
};

/// A real server with real queues and transport; the rest of the platform is in memory. Each worker changes things of
/// its own, and judges the answers it gets by the histories of all.
struct Stress : testing::Test {
    static constexpr std::size_t workers = 4;
    static constexpr std::size_t count = 2 * workers; // plug-ins
    support::FakePlatform fake;
    support::ScratchDirectory scratch;
    linux_::WorkQueues queues;
    linux_::Transport transport{linux_::Root(scratch.path())};
    linux_::Transport outside{linux_::Root(scratch.path())}; // of the clients
    Platform platform = fake.with(queues, transport);
    std::shared_ptr<zbd::ZBDServer> server;
    std::mutex notices;                                    // the registry gives one at a time
    std::array<History, count> versions;                   // of what is installed; 0 when it is not
    std::array<History, count> elections;                  // 0 before the first
    std::array<std::array<History, count>, workers> holds; // 1 while the worker has one
    std::array<std::atomic<unsigned>, 2> answers{};        // that lacked a plug-in, that showed it

    Stress() {
        support::processLog.setLevel("", LogLevel::error);
        server = zbd::ZBDServer::initForService(platform, zembra::serviceName, std::nullopt);
        server->service()->resume();
        fake.files.allowPeers(getuid());
        for (std::size_t i = 0; i < count; ++i) fake.files.addDirectory(path(i));
        fake.registry.before("knowledgeUUID", [] { std::this_thread::yield(); }); // records take a while
    }
    ~Stress() override {
        server->stop();
        support::processLog.setLevel("", LogLevel::debug);
    }
    static UUID uuid(std::size_t i) { return *UUID::parse("00000000-0000-0000-0000-00000000000" + std::to_string(i)); }
    static std::string path(std::size_t i) { return support::dataPlugIn(std::to_string(i)).path; }
    static std::size_t indexOf(const std::string& path) { return std::stoul(path.substr(path.rfind('/') + 1)); }

    /// Installs a version or replaces another; 0 uninstalls.
    void set(std::size_t i, std::uint64_t version) {
        const std::lock_guard lock(notices);
        const auto old = fake.registry.plugInForUUID(uuid(i));
        const std::string text = std::to_string(version);
        auto proxy = support::proxyFor(support::dataPlugIn(std::to_string(i), text));
        proxy.uuid = uuid(i);
        proxy.localizedName = text;
        if (version == 0) fake.registry.uninstall(uuid(i));
        if (version != 0) fake.registry.fireDidInstall({fake.registry.install(proxy)});
        if (old) fake.registry.fireWillUninstall({old});
    }

    class Client {
    public:
        explicit Client(Stress& stress)
            : _zbd(zembra::ZBDaemonClient::initWithServiceName(stress.outside, stress.queues, std::nullopt)) {}
        ~Client() { EXPECT_EQ(_replies->size(), 0U) << "replies that nobody asked for"; }

        void send(std::string_view type, const Dictionary& content) {
            auto message = _zbd->request(type);
            message.merge(content);
            _zbd->send(message, [to = _replies](const ReplyOrError& reply) { to->put(reply); });
        }
        Dictionary receive() {
            const auto reply = _replies->take();
            const auto* answer = reply ? std::get_if<Dictionary>(&*reply) : nullptr;
            EXPECT_TRUE(answer) << "a request without its reply";
            return answer ? *answer : Dictionary();
        }
        Dictionary ask(std::string_view type, const Dictionary& content = {}) {
            during = Span();
            send(type, content);
            const auto answer = receive();
            during.end = ++now;
            return answer;
        }
        /// The same; what is in "matches", which is absent when nothing was found.
        Value find(std::string_view type, const Dictionary& content = {}) {
            return _zbd->convertFromQMX(ask(type, content)["matches"]);
        }
        Span during; // of the last request

    private:
        const std::shared_ptr<zembra::ZBDaemonClient> _zbd;
        const std::shared_ptr<support::Mailbox<ReplyOrError>> _replies =
            std::make_shared<support::Mailbox<ReplyOrError>>();
    };

    void expectKnown(std::size_t i, bool isKnown, const Span& span) {
        EXPECT_TRUE(versions[i].was(0, span, !isKnown)) << i << " known: " << isKnown;
    }
    void check(std::size_t i, const Dictionary& form, const Span& span) {
        expectKnown(i, true, span);
        for (const char* fact : {"version", "localizedDisplayName"}) {
            const std::string version(form.string(fact).value_or("none"));
            EXPECT_TRUE(versions[i].was(version == "<none>" ? 0 : std::stoull(version), span))
                << Value(form).description();
        }
        const auto election = form.dictionary("annotations").value_or(Dictionary())["election"].integerValue();
        EXPECT_TRUE(elections[i].was(static_cast<std::uint64_t>(election.value_or(0)), span));
    }
    void discover(Client& client) {
        const auto found = client.find("match", {{"rules", Dictionary{{"VKExtensionVersion", "<>x"}}}}).array();
        ASSERT_TRUE(found);
        std::array<bool, count> isOffered{};
        for (const Value& form : *found) {
            const std::size_t i = indexOf(std::string(*form.dictionary()->string("path")));
            EXPECT_FALSE(std::exchange(isOffered[i], true)) << i << " twice";
            check(i, *form.dictionary(), client.during);
        }
        for (std::size_t i = 0; i < count; ++i) {
            bool mayBeMissing = versions[i].was(0, client.during);
            for (const auto& holder : holds) {
                EXPECT_TRUE(!isOffered[i] || holder[i].was(0, client.during)) << i << " was held";
                mayBeMissing = mayBeMissing || holder[i].was(1, client.during);
            }
            EXPECT_TRUE(isOffered[i] || mayBeMissing) << i << " was not offered";
            ++answers[isOffered[i] ? 1 : 0];
        }
    }
    void hold(std::size_t worker, std::unique_ptr<Client>& client, std::size_t i, std::uint64_t round) {
        const std::uint64_t flags = round % 2 == 0 ? 1 : 5; // the second ends the instances
        holds[worker][i].begin(1);
        const Value token = client->ask("lock", {{"paths", Array{path(i)}}, {"flags", flags}})["uuids"];
        holds[worker][i].end(static_cast<bool>(token));
        expectKnown(i, static_cast<bool>(token), client->during);
        if (!token) return;
        discover(*client);
        holds[worker][i].begin(0);
        if (round % 4 < 3) {
            EXPECT_EQ(client->ask("lock", {{"uuids", Array{token}}}), Dictionary());
        } else {
            client = std::make_unique<Client>(*this); // the hold ends with its client
            const auto tokenOf = [](const auto& hold) { return Value(hold->uuid()); };
            while (std::ranges::count(server->holds(), token, tokenOf) > 0) client->ask("bulk");
        }
        holds[worker][i].end();
    }
    void work(std::size_t worker) {
        auto client = std::make_unique<Client>(*this);
        std::mt19937 random(static_cast<unsigned>(worker));
        for (std::uint64_t round = 1; round <= 1000; ++round) {
            const std::size_t installed = worker + workers * (random() % 2);
            const std::uint64_t version = random() % 2 == 0 ? 0 : round;
            versions[installed].begin(version);
            set(installed, version);
            versions[installed].end();

            const std::size_t elected = (installed + 1) % count;
            const Dictionary wish{{"election", round}};
            elections[elected].begin(round);
            const auto reply = client->ask("annotate", {{"uuids", Array{uuid(elected)}}, {"annotations", wish}});
            elections[elected].end(reply.empty());
            expectKnown(elected, reply.empty(), client->during);

            hold(worker, client, random() % count, round);
            discover(*client);
            const std::size_t sought = random() % count;
            const auto form = client->find("find", {{"uuids", uuid(sought)}}).dictionary();
            if (form) check(sought, *form, client->during);
            expectKnown(sought, form.has_value(), client->during);
        }
    }
};

TEST_F(Stress, ManyHoldsEndTogetherWhileOthersAreServed) {
    constexpr std::size_t many = 10'000;
    set(0, 1);
    Client other(*this);
    for (const bool byDeath : {true, false}) {
        auto holder = std::make_unique<Client>(*this);
        const auto before = fake.notifications.posts().size();
        for (std::size_t i = 0; i < many; ++i) holder->send("lock", {{"paths", Array{path(0)}}, {"flags", 1}});
        MutableArray tokens;
        for (std::size_t i = 0; i < many; ++i) tokens.append(holder->receive()["uuids"]);
        EXPECT_EQ(server->holds().size(), many);
        byDeath ? holder.reset() : holder->send("lock", {{"uuids", tokens}});
        do EXPECT_TRUE(other.find("match"));
        while (!server->holds().empty());
        EXPECT_TRUE(byDeath || holder->receive().empty());
        EXPECT_EQ(fake.notifications.posts().size() - before, 2 * many);
    }
}

TEST_F(Stress, AServiceManagerThatNeverAnswersBlocksNobodyElse) {
    fake.serviceManager.holdAnswers();
    set(0, 1);
    std::vector<std::unique_ptr<Client>> waiting;
    for (int i = 0; i < 3; ++i) { // with more holds together than there are threads
        waiting.push_back(std::make_unique<Client>(*this));
        for (int n = 0; n < 200; ++n) waiting[i]->send("lock", {{"paths", Array{path(0)}}, {"flags", 5}});
    }
    Client other(*this);
    while (server->holds().size() < 600) EXPECT_TRUE(other.find("find", {{"uuids", uuid(0)}}));
    EXPECT_TRUE(other.ask("lock", {{"paths", Array{path(0)}}, {"flags", 1}})["uuids"]);
    waiting.clear(); // those who wait may go, and their holds with them
    while (server->holds().size() > 1) EXPECT_EQ(other.ask("bulk"), Dictionary());
}

TEST_F(Stress, EveryAnswerIsOneThatSomeOrderOfTheEventsAllows) {
    std::vector<std::thread> threads;
    for (std::size_t worker = 0; worker < workers; ++worker) threads.emplace_back([this, worker] { work(worker); });
    for (auto& thread : threads) thread.join();
    for (const auto& number : answers) EXPECT_GT(number, 0U);
    EXPECT_TRUE(server->holds().empty());
}

} // namespace
