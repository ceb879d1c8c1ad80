#include "Zembra/ZBProtocol.h"
#include "platform/linux/Notifications.h"
#include "platform/linux/Transport.h"
#include "platform/linux/WorkQueue.h"
#include "tests/support/FakePlatform.h"
#include "tests/support/Mailbox.h"
#include "tests/support/ScratchDirectory.h"
#include "zbd/ZBDServer.h"

#include <gtest/gtest.h>

#include <array>
#include <atomic>
#include <filesystem>
#include <limits>
#include <random>
#include <thread>
#include <unistd.h>

namespace {

using namespace platform;

std::atomic<std::uint64_t> now = 0; // counts events, so that their order is known

/// When something was under way: a moment before its request was sent, and one after its reply came.
struct Span {
    std::uint64_t begin = ++now;
    std::uint64_t end = std::numeric_limits<std::uint64_t>::max();
    void close() { end = ++now; }
};

/// The values of one thing that one thread changes, oldest first.
class History {
public:
    /// `act` makes the change and answers whether it came about.
    template <class Act> void change(std::uint64_t value, const Act& act) {
        {
            const std::lock_guard lock(_mutex);
            _changes.push_back({value, Span()});
        }
        const bool isDone = act();
        const std::lock_guard lock(_mutex);
        _changes.back().during.close();
        if (!isDone) _changes.pop_back();
    }
    /// Whether, at some moment of `span`, the value may have been one that `fits`.
    template <class Fits> bool had(const Span& span, const Fits& fits) const {
        const std::lock_guard lock(_mutex);
        for (auto change = _changes.rbegin(); change != _changes.rend(); ++change) {
            if (change->during.begin < span.end && fits(change->value)) return true;
            if (change->during.end < span.begin) return false; // those before it were over
        }
        return false;
    }
    bool was(std::uint64_t value, const Span& span) const {
        return had(span, [&](std::uint64_t each) { return each == value; });
    }
    /// By the thread that changes it.
    std::uint64_t last() const { return _changes.back().value; }

private:
    struct Change {
        std::uint64_t value = 0;
        Span during;
    };
    mutable std::mutex _mutex;
    std::vector<Change> _changes{Change()};
};

/// A real server with real queues, transport and notifications; the rest of the platform is in memory.
struct Stress : testing::Test {
    static constexpr std::size_t count = 8; // plug-ins
    support::FakePlatform fake;
    support::ScratchDirectory scratch;
    const linux_::Root root{scratch.path()};
    const bool hasDirectory = std::filesystem::create_directories(root.runtime());
    linux_::Notifications notifications{root};
    std::unique_ptr<WorkQueues> queues = std::make_unique<linux_::WorkQueues>();
    std::unique_ptr<Transport> transport = std::make_unique<linux_::Transport>(root);
    std::unique_ptr<Transport> outside = std::make_unique<linux_::Transport>(root); // of the clients
    Platform platform = fake.with(*queues, *transport, notifications);
    std::shared_ptr<zbd::ZBDServer> server;
    std::array<UUID, count> uuids;
    std::mutex notices; // the registry gives one at a time

    Stress() {
        support::processLog.setLevel("", LogLevel::error);
        server = zbd::ZBDServer::initForService(platform, zembra::serviceName, std::nullopt);
        server->service()->resume();
        fake.files.allowPeers(getuid());
        fake.codeSigning.entitlements[getpid()] = Dictionary{{zembra::entitlement::manager, true}};
        fake.serviceManager.allow();
        for (std::size_t i = 0; i < count; ++i) {
            uuids[i] = UUID::random();
            fake.files.addDirectory(path(i));
        }
    }
    ~Stress() override {
        server->stop();
        outside.reset(); // before the queues: no handler is called afterwards
        transport.reset();
        support::processLog.setLevel("", LogLevel::debug);
    }
    static std::string path(std::size_t i) { return support::dataPlugIn(std::to_string(i)).path; }
    support::FakePlugIn plugIn(std::size_t i, std::uint64_t version) {
        auto made = support::dataPlugIn(std::to_string(i));
        const std::string text = std::to_string(version);
        const Array actions{Dictionary{{"VKExtensionFilevaneActionName", "act"}}};
        const Dictionary attributes{{"VKExtensionVersion", text}};
        made.uuid = uuids[i];
        auto info = MutableDictionary::copyOf(
            support::manifestOf("com.example." + std::to_string(i), {{"VKExtensionProtocol", "#Data"},
                                                                     {"VKExtensionFilevaneActions", actions},
                                                                     {"VKExtensionAttributes", attributes}}));
        info.set("VBBundleDisplayName", text);
        made.info = info;
        return made;
    }
    /// Installs a version or replaces another; 0 uninstalls.
    void set(std::size_t i, std::uint64_t version) {
        const std::lock_guard lock(notices);
        const auto old = fake.registry.plugInForUUID(uuids[i]);
        if (version == 0) fake.registry.uninstall(uuids[i]);
        const auto made = version == 0 ? nullptr : fake.registry.install(plugIn(i, version));
        if (old) fake.registry.fireWillUninstall({old});
        if (made) fake.registry.fireDidInstall({made});
    }
    bool isHeld(const Value& token) {
        const auto holds = server->holds();
        return std::any_of(holds.begin(), holds.end(), [&](const auto& hold) { return token == Value(hold->uuid()); });
    }

    /// Asks one request after the other, or all at once.
    class Client {
    public:
        explicit Client(Stress& stress) : _queue(stress.queues->makeSerial("client")) {
            _connection = stress.outside->connect(zembra::serviceName, _queue);
            _connection->setEventHandler([](const ConnectionEvent&) {});
            _connection->resume();
        }
        ~Client() {
            EXPECT_EQ(_replies->size(), 0U) << "replies that nobody asked for";
            _connection->cancel();
        }
        void send(std::string_view type, MutableDictionary message) {
            message.set(zembra::key::request, type);
            message.set(zembra::key::version, zembra::currentVersion);
            _connection->sendWithReply(message, _queue, [to = _replies](const ReplyOrError& reply) { to->put(reply); });
        }
        Dictionary receive() {
            const auto reply = _replies->take();
            const auto* content = reply ? std::get_if<Dictionary>(&*reply) : nullptr;
            EXPECT_TRUE(content) << "a request without its reply";
            return content ? *content : Dictionary();
        }
        Dictionary ask(std::string_view type, MutableDictionary message) {
            send(type, std::move(message));
            return receive();
        }

    private:
        const std::shared_ptr<support::Mailbox<ReplyOrError>> _replies =
            std::make_shared<support::Mailbox<ReplyOrError>>();
        const std::shared_ptr<WorkQueue> _queue;
        std::shared_ptr<Connection> _connection;
    };
};

TEST_F(Stress, ManyHoldsEndWhileOthersAreServed) {
    constexpr std::size_t many = 10'000;
    set(0, 1);
    Client other(*this);
    for (const bool byDeath : {true, false}) {
        auto holder = std::make_unique<Client>(*this);
        MutableArray tokens;
        for (std::size_t i = 0; i < many; ++i) holder->send("lock", {{"paths", Array{path(0)}}, {"flags", 1}});
        for (std::size_t i = 0; i < many; ++i) tokens.append(holder->receive()["uuids"]);
        ASSERT_EQ(server->holds().size(), many);
        if (byDeath) {
            holder.reset();
        } else {
            holder->send("lock", {{"uuids", tokens}});
        }
        do EXPECT_TRUE(other.ask("match", {})["matches"]);
        while (!server->holds().empty());
        EXPECT_TRUE(byDeath || holder->receive().empty());
    }
}

TEST_F(Stress, AServiceManagerThatNeverAnswersBlocksNobodyElse) {
    constexpr std::size_t perClient = 200; // three times as many are more than there are threads
    fake.serviceManager.holdAnswers();
    set(0, 1);
    std::vector<std::unique_ptr<Client>> waiting;
    for (int i = 0; i < 3; ++i) {
        auto& client = *waiting.emplace_back(std::make_unique<Client>(*this));
        for (std::size_t n = 0; n < perClient; ++n) client.send("lock", {{"paths", Array{path(0)}}, {"flags", 5}});
        client.ask("bulk", {});
    }
    EXPECT_EQ(server->holds().size(), 3 * perClient);
    Client other(*this);
    EXPECT_TRUE(other.ask("find", {{"uuids", uuids[0]}})["matches"]);
    const Value token = other.ask("lock", {{"paths", Array{path(0)}}, {"flags", 1}})["uuids"];
    waiting.clear(); // those who wait may go, and their holds with them
    for (std::size_t left = 0; left != 1; left = server->holds().size()) EXPECT_TRUE(other.ask("bulk", {}).empty());
    EXPECT_TRUE(isHeld(token));
    while (fake.serviceManager.answer()) {
    }
}

/// What is asked of the server in the stress, and what the model knows of it.
struct Model : Stress {
    static constexpr std::size_t holders = 2;
    static constexpr unsigned rounds = 3000;
    std::array<History, count> versions;  // of what is installed; 0 when it is not
    std::array<History, count> elections; // 0 before the first
    std::array<std::array<History, count>, holders> holds;
    History language;
    std::array<std::atomic<std::uint64_t>, count> toInstall{};
    std::atomic<unsigned> offered = 0;
    std::atomic<unsigned> missing = 0;

    std::size_t indexOf(const std::string& bundle) {
        std::size_t i = 0;
        while (path(i) != bundle) ++i;
        return i;
    }
    bool mayBeInstalled(std::size_t i, const Span& span) {
        return versions[i].had(span, [](std::uint64_t version) { return version != 0; });
    }
    void check(std::size_t i, const Dictionary& form, const Span& span) {
        const auto annotations = form.dictionary("annotations").value_or(Dictionary());
        const auto titles = form.dictionary("localizedFilevaneActionNames").value_or(Dictionary());
        EXPECT_TRUE(mayBeInstalled(i, span));
        for (const auto& [history, value] : {std::pair(&versions[i], form["version"]),
                                             {&versions[i], form["localizedDisplayName"]},
                                             {&elections[i], annotations["election"]},
                                             {&language, titles["act"]}}) {
            // A form without a version is of a plug-in that has just gone.
            const std::string text(value.string().value_or(std::to_string(value.integerValue().value_or(0))));
            EXPECT_TRUE(history->was(text == "<none>" ? 0 : std::stoull(text), span)) << Value(form).description();
        }
    }

    void discover(Client& client) {
        Span span;
        const Value found = client.ask("match", {{"rules", Dictionary{{"VKExtensionVersion", "<>x"}}}})["matches"];
        span.close();
        ASSERT_TRUE(found);
        const auto forms = *decodeCompact(*found.data(), UUIDs::refused)->array();
        std::array<bool, count> isOffered{};
        for (const Value& each : forms) {
            const auto form = *each.dictionary();
            const std::size_t i = indexOf(std::string(*form.string("path")));
            EXPECT_FALSE(std::exchange(isOffered[i], true)) << i << " twice";
            check(i, form, span);
        }
        for (std::size_t i = 0; i < count; ++i) {
            bool mayBeMissing = versions[i].was(0, span);
            for (const auto& holder : holds) {
                EXPECT_TRUE(!isOffered[i] || holder[i].was(0, span)) << i << " was held";
                mayBeMissing = mayBeMissing || holder[i].was(1, span);
            }
            EXPECT_TRUE(isOffered[i] || mayBeMissing) << i << " was not offered";
            ++(isOffered[i] ? offered : missing);
        }
    }
    void discover() {
        Client client(*this);
        for (unsigned round = 0; round < rounds; ++round) discover(client);
    }
    void install(std::size_t first, bool byRequest) {
        Client client(*this);
        std::mt19937 random(static_cast<unsigned>(first));
        for (unsigned round = 1; round <= rounds; ++round) {
            const std::size_t i = first + 2 * (random() % (count / 2));
            const bool isEnd = versions[i].last() != 0 && random() % 2 == 0;
            versions[i].change(isEnd ? 0 : round, [&] {
                if (!byRequest) return set(i, isEnd ? 0 : round), true;
                toInstall[i] = round;
                EXPECT_EQ(client.ask(isEnd ? "remove" : "add", {{"paths", Array{path(i)}}}), Dictionary());
                return true;
            });
        }
    }
    void hold(std::size_t number) {
        auto client = std::make_unique<Client>(*this);
        support::Mailbox<int> changes;
        const auto observation = notifications.observe(zembra::annotationChangeNotification,
                                                       queues->makeSerial("changes"), [&changes] { changes.put(0); });
        std::mt19937 random(static_cast<unsigned>(number));
        for (unsigned round = 0; round < rounds; ++round) {
            const std::size_t i = random() % count;
            Value token;
            Span span;
            holds[number][i].change(1, [&] {
                const auto reply = client->ask("lock", {{"paths", Array{path(i)}}, {"flags", round % 2 == 0 ? 1 : 5}});
                token = reply["uuids"];
                return static_cast<bool>(token);
            });
            span.close();
            EXPECT_TRUE(token ? mayBeInstalled(i, span) : versions[i].was(0, span));
            if (!token) continue;
            discover(*client);
            holds[number][i].change(0, [&] {
                if (random() % 4 != 0) {
                    EXPECT_EQ(client->ask("lock", {{"uuids", Array{token}}}), Dictionary());
                } else {
                    client = std::make_unique<Client>(*this); // the hold ends with its client
                    while (isHeld(token) && changes.take()) {
                    }
                }
                return !isHeld(token);
            });
        }
    }
    void annotate() {
        Client client(*this);
        for (std::uint64_t round = 1; round <= rounds; ++round) {
            const std::size_t i = round % count;
            Span span;
            bool isKnown = false;
            elections[i].change(round, [&] {
                const Dictionary wish{{"election", round}};
                isKnown = client.ask("annotate", {{"uuids", Array{uuids[i]}}, {"annotations", wish}}).empty();
                return isKnown;
            });
            span.close();
            EXPECT_TRUE(isKnown ? mayBeInstalled(i, span) : versions[i].was(0, span));
        }
    }
    void changeLanguage() {
        Client client(*this);
        for (std::uint64_t round = 1; round <= rounds / 4; ++round) {
            language.change(round, [&] {
                for (std::size_t i = 0; i < count; ++i)
                    fake.registry.setStringTable(path(i), "Localizable", {{"act", std::to_string(round)}});
                fake.locale.setLanguages({"l" + std::to_string(round)});
                client.ask("find", {{"uuids", UUID::random()}}); // after the records of before are gone
                return true;
            });
        }
    }
    void find() {
        Client client(*this);
        for (unsigned round = 0; round < rounds; ++round) {
            const std::size_t i = round % count;
            Span span;
            const auto reply = client.ask("find", {{"uuids", uuids[i]}});
            span.close();
            const Value found = reply["matches"];
            if (found) check(i, *decodeCompact(*found.data(), UUIDs::refused)->dictionary(), span);
            EXPECT_TRUE(found || versions[i].was(0, span)) << i << " was not found";
        }
    }
};

TEST_F(Model, EveryAnswerIsOneThatSomeOrderOfTheEventsAllows) {
    fake.registry.allowRegistration();
    fake.registry.before("localizedStrings", [] { std::this_thread::yield(); }); // records take a while
    fake.registry.onRegister([&](const URL& url) { set(indexOf(url.path()), toInstall[indexOf(url.path())]); });
    fake.registry.onUnregister([&](const URL& url) { set(indexOf(url.path()), 0); });
    std::vector<std::thread> threads;
    for (const auto& work : std::vector<std::function<void()>>{
             [&] { install(0, true); }, [&] { install(1, false); }, [&] { hold(0); }, [&] { hold(1); },
             [&] { annotate(); }, [&] { changeLanguage(); }, [&] { find(); }, [&] { discover(); }})
        threads.emplace_back(work);
    for (auto& thread : threads) thread.join();
    EXPECT_GT(offered, 0U);
    EXPECT_GT(missing, 0U);
    EXPECT_TRUE(server->holds().empty());
}

} // namespace
