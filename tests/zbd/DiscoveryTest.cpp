#include "tests/support/FakeDaemon.h"
#include "zbd/Transaction.h"

#include <gtest/gtest.h>

namespace {

using platform::Array;
using platform::Dictionary;
using platform::LogLevel;
using platform::MutableDictionary;
using platform::URL;
using platform::UUID;
using platform::Value;
using support::errorReply;
using support::FakePlugIn;
using support::processLog;

constexpr std::uint64_t all = zembra::ZBDiscoverAll;

/// UUIDs that sort by their number, so that answers have an order that a test can state.
UUID uuid(int number) { return *UUID::parse("00000000-0000-0000-0000-00000000000" + std::to_string(number)); }

struct Discovery : testing::Test {
    support::FakeDaemon daemon;

    Discovery() { daemon.fake.preferences.addDomain("com.nordane.zembra.userprefs"); }

    /// A data plug-in in the application A, or on the system volume.
    FakePlugIn described(int number, const std::string& name, const std::string& version = "1.0",
                         const std::string& application = "/Applications/A.app") {
        auto plugIn = support::dataPlugIn(name);
        plugIn.uuid = uuid(number);
        plugIn.path = application + "/PlugIns/" + std::to_string(number) + ".plugin";
        plugIn.info = support::manifestOf(
            "com.example." + name,
            {{"VKExtensionProtocol", "#Data"}, {"VKExtensionAttributes", Dictionary{{"VKExtensionVersion", version}}}});
        plugIn.onSystemPartition = application.starts_with("/System");
        plugIn.containingBundle = std::make_shared<platform::ApplicationRecord>(
            platform::ApplicationRecord{URL::file(application), "com.example.a", "A"});
        return plugIn;
    }
    void install(const FakePlugIn& plugIn) { daemon.fake.registry.install(plugIn); }
    void grant(const Dictionary& entitlements) { daemon.fake.codeSigning.entitlements[77] = entitlements; }

    std::vector<Dictionary> forms(std::uint64_t flags = 0, const Value& rules = {}) {
        MutableDictionary message{{"flags", flags}};
        if (rules) message.set("rules", rules);
        const auto reply = daemon.ask("match", message);
        std::vector<Dictionary> found;
        const auto bytes = reply["matches"].data();
        if (!bytes) {
            ADD_FAILURE() << Value(reply).description();
            return found;
        }
        const auto matches = *platform::decodeCompact(*bytes, platform::UUIDs::refused)->array();
        for (const Value& form : matches) found.push_back(*form.dictionary());
        return found;
    }
    /// The last digits of the UUIDs answered, in order.
    std::string answer(std::uint64_t flags = 0, const Value& rules = {}) {
        std::string digits;
        for (const Dictionary& form : forms(flags, rules)) digits += form.string("uuid")->back();
        return digits;
    }
    bool logged(LogLevel level, const std::string& message) { return processLog.contains(level, "ops", message); }
};

TEST_F(Discovery, RefusesBadRulesAndTheUnprivilegedFlag) {
    EXPECT_EQ(daemon.ask("match", {{"rules", "x"}}), errorReply(4, "invalid request format (bad rules dictionary)"));
    const auto refusal = errorReply(11, "unauthorized discovery flag (ZBDiscoverAll)");
    daemon.fake.sandbox.unconfined.insert(77);
    EXPECT_EQ(daemon.ask("match", {{"flags", all}}), refusal);
    grant({{"com.nordane.private.zembra.manager", true}});
    EXPECT_EQ(answer(all), "");
    daemon.fake.sandbox.unconfined.clear();
    EXPECT_EQ(daemon.ask("match", {{"flags", all}}), refusal);
}

TEST_F(Discovery, AnswersInTheOrderOfUUIDsAndLogsWhatItFound) {
    EXPECT_EQ(answer(), "");
    EXPECT_TRUE(logged(LogLevel::info, "Candidate plugin count: 0"));
    EXPECT_TRUE(logged(LogLevel::info, "Resulting plugin count: 0"));
    for (const int number : {3, 1, 2}) install(described(number, "p" + std::to_string(number)));
    EXPECT_EQ(answer(), "123");
    const auto lines = processLog.messages("ops");
    EXPECT_EQ(std::count_if(lines.begin(), lines.end(),
                            [](const auto& line) { return line.starts_with("Candidate plugin count: 3, info: "); }),
              1);
    EXPECT_TRUE(logged(LogLevel::info, "Resulting plugin count: 3, UUIDs: " +
                                           Value(Array{uuid(1).text(), uuid(2).text(), uuid(3).text()}).description()));
    EXPECT_TRUE(logged(LogLevel::debug, "reply marshalled"));
    daemon.fake.registry.answerNothing();
    EXPECT_EQ(answer(), "");
}

TEST_F(Discovery, HostSideFiltersAreSkippedForAManagerThatAsks) {
    auto loose = described(1, "loose");
    loose.containingBundle = nullptr;
    loose.path = "/System/loose.plugin"; // below that directory, but on another volume
    auto dedicated = described(3, "dedicated");
    dedicated.info = support::manifestOf("com.example.dedicated",
                                         {{"VKExtensionProtocol", "#Data"},
                                          {"Dedicated", true},
                                          {"VKExtensionAttributes", Dictionary{{"VKExtensionVersion", "1"}}}});
    auto guarded = described(5, "guarded");
    guarded.info = support::manifestOf("com.example.guarded", {{"VKExtensionProtocol", "#Data"},
                                                               {"VKExtensionHostEntitlement", "needed"},
                                                               {"VKExtensionAttributes", Dictionary()}});
    install(loose);
    install(described(2, "system", "1.0", "/System/Applications/S.app"));
    install(dedicated);
    install(described(4, "held"));
    install(guarded);
    const auto plugIn = daemon.server->findPlugIn(uuid(4));
    daemon.server->addHold(zbd::ZBDPlugInHold::initWithPlugIns(daemon.fake.transport, {plugIn}, nullptr));

    EXPECT_EQ(answer(), "2");
    EXPECT_EQ(answer(zembra::ZBDiscoverSystemOnly), "2");
    EXPECT_TRUE(logged(LogLevel::info, "client 77 cannot use plugin " + uuid(5).text() +
                                           ": the host does not have the \"needed\" entitlement"));
    daemon.fake.sandbox.unconfined.insert(77);
    grant({{"com.nordane.private.zembra.manager", true}});
    EXPECT_EQ(answer(all | zembra::ZBDiscoverSystemOnly), "12345");
    grant({{"needed", "for a string counts"}});
    EXPECT_EQ(answer(), "25");
    // The dedicated one is for the host whose bundle carries it.
    daemon.fake.processes.paths[77] = "/Applications/A.app/host";
    daemon.fake.bundles.add("/Applications/A.app", {}, "/Applications/A.app/host");
    EXPECT_EQ(answer(), "235");
}

TEST_F(Discovery, RulesExclusionsAndRestrictionsApply) {
    for (const int number : {1, 2, 3}) install(described(number, "p" + std::to_string(number)));
    EXPECT_EQ(answer(0, Dictionary{{"VKExtensionIdentifier", "com.example.p2"}}), "2");
    // What is no rules dictionary excludes nothing.
    daemon.fake.preferences.store("com.nordane.zembra.userprefs", "exclusions",
                                  Array{"p1", Dictionary{{"VKExtensionIdentifier", "com.example.p2"}}, 4});
    daemon.fake.sandbox.unconfined.insert(77);
    grant({{"com.nordane.private.zembra.manager", true}});
    EXPECT_EQ(answer(all), "13");
    EXPECT_TRUE(logged(LogLevel::info, "client 77 plugin " + uuid(2).text() + " globally excluded"));

    grant({{"com.nordane.developer.zembra.allowedplugins", Dictionary{{"VKExtensionIdentifier", "com.example.p3"}}}});
    EXPECT_EQ(answer(), "3");
    EXPECT_TRUE(logged(LogLevel::info, "client 77 cannot use plugin " + uuid(1).text() +
                                           ": the host's plug-in entitlement does not allow this plug-in"));
    grant({{"com.nordane.developer.zembra.allowedplugins", true}});
    EXPECT_EQ(answer(), "");
    EXPECT_TRUE(logged(LogLevel::info,
                       "client 77 cannot use plugin " + uuid(1).text() + ": invalid host restriction entitlement"));
}

TEST_F(Discovery, OneOfEachIdentifierUnlessTheFlagsAskForMore) {
    install(described(1, "p", "1.2"));
    install(described(2, "p", "1.10"));
    auto newer = described(3, "p", "1.10");
    newer.registrationDate = platform::Date{2'000'000'000};
    install(newer);
    EXPECT_EQ(answer(), "3");
    EXPECT_EQ(answer(zembra::ZBDiscoverAllVersions), "13");
    EXPECT_EQ(answer(zembra::ZBDiscoverDuplicates), "3");
    EXPECT_EQ(answer(zembra::ZBDiscoverAllVersions | zembra::ZBDiscoverDuplicates), "123");
    install(described(4, "p", "1.10", "/System/Applications/S.app"));
    EXPECT_EQ(answer(), "4") << "the system's own wins a tie";
}

TEST_F(Discovery, AHostPrefersThePlugInsThatItCarries) {
    install(described(1, "p", "2.0"));
    install(described(2, "p", "1.0", "/Applications/B.app"));
    install(described(3, "other"));
    daemon.fake.processes.paths[77] = "/Applications/B.app/host";
    EXPECT_EQ(answer(), "23");
    EXPECT_TRUE(logged(LogLevel::info, "Ignoring " + uuid(2).text() +
                                           " @ '/Applications/A.app/PlugIns/1.plugin' in favor of bundle-relative "
                                           "'/Applications/B.app/PlugIns/2.plugin'"));
    daemon.fake.processes.paths.clear();
    EXPECT_EQ(answer(), "13");
    EXPECT_TRUE(logged(LogLevel::error, "Failed to determine path for pid 77, [3: No such process]"));
}

TEST_F(Discovery, ReplacingAndReplacedPlugInsPointAtEachOther) {
    auto replacing = described(2, "replacing");
    replacing.entitlements =
        Dictionary{{"com.nordane.developer.replace-plugin", Array{"com.example.p", 7, "com.example.x"}}};
    install(described(1, "p"));
    install(replacing);
    const auto found = forms();
    ASSERT_EQ(found.size(), 2U);
    EXPECT_EQ(found[0]["overrider"], Value(uuid(2).text()));
    EXPECT_FALSE(found[0]["overriding"]);
    EXPECT_EQ(found[1]["overriding"], Value("com.example.p"));
    EXPECT_TRUE(logged(LogLevel::info, "plug-in " + uuid(2).text() + " overrides " + uuid(1).text()));
}

TEST_F(Discovery, FormsCarryTheUsersAnnotations) {
    install(described(1, "p"));
    EXPECT_EQ(forms().at(0)["annotations"], Value(Dictionary()));
    EXPECT_EQ(daemon.ask("annotate", {{"uuids", Array{uuid(1)}}, {"annotations", Dictionary{{"election", 1}}}}),
              Dictionary());
    EXPECT_TRUE(logged(LogLevel::info, "client 77 plug-in com.example.p(" + uuid(1).text() + ") election := 1"));
    EXPECT_EQ(forms().at(0)["annotations"], Value(Dictionary{{"election", 1}}));
    EXPECT_EQ(answer(0, Dictionary{{"VKUserElection", "1"}}), "1");
    EXPECT_EQ(answer(0, Dictionary{{"VKUserElection", "0"}}), "");
    // Stored and saved before the failure is told, and nobody notified.
    const auto posts = daemon.fake.notifications.posts().size();
    EXPECT_EQ(
        daemon.ask("annotate", {{"uuids", Array{uuid(1), uuid(9)}}, {"annotations", Dictionary{{"election", 3}}}}),
        errorReply(4, "no such plugin (uuid not found)"));
    EXPECT_EQ(forms().at(0)["annotations"], Value(Dictionary{{"election", 3}}));
    EXPECT_EQ(daemon.fake.notifications.posts().size(), posts);
}

TEST_F(Discovery, APlugInThatCannotBeExportedWholeIsAnsweredWithAnError) {
    auto plugIn = described(1, "p");
    install(plugIn);
    daemon.server->findPlugIn(uuid(1));
    daemon.fake.registry.before("knowledgeUUID", [&] { daemon.fake.registry.uninstall(uuid(1)); });
    EXPECT_EQ(answer(), "1");
    EXPECT_TRUE(logged(LogLevel::error,
                       "failed to export matching plug-in " + uuid(1).text() + ": the plug-in has no \"bundleInfo\""));
}

TEST_F(Discovery, AnAnswerThatNoMessageHoldsIsAnError) {
    const Value filler = std::string(std::size_t{8} << 20U, 'x'); // twice in each form
    for (int number = 1; number <= 5; ++number) {
        auto plugIn = described(number, "p" + std::to_string(number));
        plugIn.info = support::manifestOf(
            "com.example.p" + std::to_string(number),
            {{"VKExtensionProtocol", "#Data"}, {"VKExtensionAttributes", Dictionary()}, {"Filler", filler}});
        install(plugIn);
    }
    EXPECT_EQ(daemon.ask("match", {}), errorReply(4, "the matching plug-ins are too many for one reply"));
}

TEST_F(Discovery, AnnotationRequestsCheckBeforeTheyChange) {
    install(described(1, "p"));
    const auto posts = [&] { return daemon.fake.notifications.posts().size(); };
    const std::string bad = "invalid request format (bad annotations dictionary)";
    struct Case {
        const char* type;
        Value annotations;
        Dictionary reply;
        std::size_t notified;
    };
    const std::string known = uuid(1).text();
    const std::vector<Case> cases{
        {"annotate", {}, errorReply(4, bad), 0},
        {"annotate", "x", errorReply(4, bad), 0},
        {"annotate", Dictionary{{"election", "1"}}, errorReply(4, "invalid request format (annotation election)"), 0},
        {"annotate", Dictionary{{"extension", 1}}, errorReply(4, "invalid request format (annotation extension)"), 0},
        {"annotate", Dictionary{{"extension", Dictionary{{"id", uuid(1)}}}},
         errorReply(4, "invalid request format (annotation extension)"), 0},
        {"annotate", Dictionary{{"extension", Dictionary{{"k", std::string(64 << 10, 'x')}}}},
         errorReply(4, "invalid request format (annotation extension)"), 0},
        {"annotate", Dictionary{{"election", 7}, {"extension", 1}},
         errorReply(4, "invalid request format (annotation extension)"), 0},
        {"annotate", Dictionary{{"election", 2}}, Dictionary(), 1},
        {"bulk-annotate", {}, errorReply(4, bad), 0},
        {"bulk-annotate", Dictionary(), Dictionary(), 1},
        {"bulk-annotate", Dictionary{{known, 1}}, errorReply(18, "annotations values must be dictionaries"), 0},
        {"bulk-annotate", Dictionary{{known, Dictionary{{"id", uuid(1)}}}},
         errorReply(18, "the extension cannot be stored"), 0},
        {"annotate", Dictionary{{"extension", Dictionary{{"b", 1}}}, {"other", 1}}, Dictionary(), 1},
        {"bulk-annotate", Dictionary{{known, Dictionary{{"a", 1}}}, {"x", Dictionary()}},
         errorReply(18, "invalid plug-in UUID value"), 0},
        {"bulk-annotate", Dictionary{{uuid(9).text(), Dictionary()}},
         errorReply(2, "no plug-in with the requested uuid"), 0},
    };
    for (const Case& c : cases) {
        MutableDictionary message{{"uuids", Array{uuid(1)}}};
        if (c.annotations) message.set("annotations", c.annotations);
        const auto before = posts();
        EXPECT_EQ(daemon.ask(c.type, message), c.reply) << c.type << " " << c.annotations.description();
        EXPECT_EQ(posts() - before, c.notified) << c.type << " " << c.annotations.description();
    }
    // Without anything to store nobody looks at the UUIDs.
    EXPECT_EQ(daemon.ask("annotate", {{"uuids", "x"}, {"annotations", Dictionary{{"other", 1}}}}), Dictionary());
    // What came before a failure stays; an extension replaces no election.
    EXPECT_EQ(daemon.server->annotationForPlugIn(*daemon.server->findPlugIn(uuid(1))),
              (Dictionary{{"election", 2}, {"extension", Dictionary{{"a", 1}}}}));
    EXPECT_TRUE(logged(LogLevel::debug, "bulk change requested for 2 plug-ins"));
    const auto lines = processLog.messages("ops");
    EXPECT_TRUE(std::any_of(lines.begin(), lines.end(), [](const auto& line) {
        return line.starts_with("client 77 bulk plug-in com.example.p(") &&
               line.ends_with(" annotation change: {a = 1}");
    }));
}

} // namespace
