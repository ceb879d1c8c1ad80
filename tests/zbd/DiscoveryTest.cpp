#include "tests/support/Requests.h"

#include <gmock/gmock.h>

namespace {

using namespace platform;
using support::errorReply;

struct Discovery : support::Requests {
    Discovery() { fake.preferences.addDomain("com.nordane.zembra.userprefs"); }

    void becomeManager() {
        fake.sandbox.unconfined.insert(77);
        grant({{"com.nordane.private.zembra.manager", true}});
    }
    /// What the reply to a match or a find carries.
    Value matches(const std::string& type, const MutableDictionary& message) {
        return *decodeCompact(daemon.ask(type, message)["matches"].data().value(), UUIDs::refused);
    }
    Array forms(std::uint64_t flags = 0) { return *matches("match", {{"flags", flags}}).array(); }
    /// The last digits of the UUIDs answered, in order.
    std::string answer(std::uint64_t flags = 0) {
        std::string digits;
        for (const Value& form : forms(flags)) digits += form.dictionary()->string("uuid")->back();
        return digits;
    }
};

TEST_F(Discovery, AnswersInTheOrderOfUUIDsAndLogsWhatItFound) {
    EXPECT_EQ(answer(), "");
    expectLogged(info, "Candidate plugin count: 0");
    expectLogged(info, "Resulting plugin count: 0");
    installThree();
    EXPECT_EQ(answer(), "123");
    EXPECT_TRUE(support::logged(info, "Candidate plugin count: 3, info: "));
    expectLogged(info, "Resulting plugin count: 3, UUIDs: " + Value(Array{idOf(1), idOf(2), idOf(3)}).description());
    expectLogged(debug, "reply marshalled");
    fake.registry.answerNothing();
    EXPECT_EQ(answer(), "");
}

TEST_F(Discovery, HostSideFiltersAreSkippedForAnUnconfinedManagerThatAsks) {
    auto loose = described(1, {{"VKExtensionProtocol", "#Data"}});
    loose.containingBundle = nullptr;
    loose.path = "/System/loose.plugin"; // below that directory, but on another volume
    install({loose, described(2, {}, "/System/Applications/S.app"), described(3, {{"Dedicated", true}}), described(4),
             described(5, {{"VKExtensionHostEntitlement", "needed"}})});
    hold(4);
    EXPECT_EQ(answer(), "2");
    becomeManager();
    EXPECT_EQ(answer(zembra::ZBDiscoverAll | zembra::ZBDiscoverSystemOnly), "12345");
    fake.sandbox.unconfined.clear();
    EXPECT_EQ(daemon.ask("match", {{"flags", 0x200}}), errorReply(11, "unauthorized discovery flag (ZBDiscoverAll)"));
    grant({{"needed", "for a string counts"}});
    EXPECT_EQ(answer(), "25");
    // The dedicated one is for the host whose bundle carries it.
    fake.processes.paths[77] = "/Applications/A.app/host";
    fake.bundles.add(application, {}, "/Applications/A.app/host");
    EXPECT_EQ(answer(), "235");
    EXPECT_EQ(answer(zembra::ZBDiscoverSystemOnly), "2");
}

TEST_F(Discovery, RulesExclusionsAndRestrictionsApply) {
    const auto identified = [](const char* name) { return Dictionary{{"VKExtensionIdentifier", name}}; };
    installThree();
    EXPECT_EQ(matches("match", {{"rules", identified("com.example.2")}}).array()->size(), 1U);
    // What is no rules dictionary excludes nothing.
    fake.preferences.store("com.nordane.zembra.userprefs", "exclusions", Array{"1", identified("com.example.2"), 4});
    becomeManager();
    EXPECT_EQ(answer(zembra::ZBDiscoverAll), "13");
    expectLogged(info, "client 77 plugin " + idOf(2) + " globally excluded");
    const std::tuple<Value, const char*, const char*> restrictions[] = {
        {identified("com.example.3"), "3", "the host's plug-in entitlement does not allow this plug-in"},
        {true, "", "invalid host restriction entitlement"}};
    for (const auto& [restriction, expected, reason] : restrictions) {
        grant({{"com.nordane.developer.zembra.allowedplugins", restriction}});
        EXPECT_EQ(answer(), expected);
        expectLogged(info, "client 77 cannot use plugin " + idOf(1) + ": " + reason);
    }
}

TEST_F(Discovery, OneOfEachIdentifierUnlessTheHostCarriesAnotherOrTheFlagsAskForMore) {
    const auto version = [this](int number, const char* text, const std::string& within = application) {
        const Dictionary attributes{{"VKExtensionVersion", text}};
        return described(number, {{"VKExtensionIdentifier", "p"}, {"VKExtensionAttributes", attributes}}, within);
    };
    auto newer = version(2, "1.10");
    newer.registrationDate = Date{2'000'000'000};
    install({version(1, "1.10"), newer, version(3, "1.2"), described(4)});
    EXPECT_EQ(answer(), "24");
    EXPECT_EQ(answer(zembra::ZBDiscoverAllVersions), "234");
    EXPECT_EQ(answer(zembra::ZBDiscoverAllVersions | zembra::ZBDiscoverDuplicates), "1234");
    install({version(5, "1.10", "/System/Applications/S.app")});
    EXPECT_EQ(answer(), "45") << "the system's own wins a tie";
    const std::string host = "/Applications/Host.app"; // whose program asks
    install({version(6, "1.0", host)});
    EXPECT_EQ(answer(), "46");
    expectLogged(info, "Ignoring " + idOf(6) + " @ '" + pathOf(3) + "' in favor of bundle-relative '" +
                           pathOf(6, host) + "'");
    fake.processes.paths.clear();
    EXPECT_EQ(answer(), "45");
    expectLogged(error, "Failed to determine path for pid 77, [3: No such process]");
}

TEST_F(Discovery, ReplacingAndReplacedPlugInsPointAtEachOther) {
    std::vector plugIns{described(1), described(2), described(3)};
    const Array several{"com.example.1", 7, "com.example.x"};
    plugIns[1].entitlements = Dictionary{{"com.nordane.developer.replace-plugin", several}};
    plugIns[2].entitlements = Dictionary{{"com.nordane.developer.replace-plugin", "com.example.2"}};
    install(plugIns);
    const auto found = forms();
    EXPECT_EQ(found[0].dictionary()->string("overrider"), idOf(2));
    EXPECT_FALSE(found[0].dictionary()->contains("overriding"));
    EXPECT_EQ(found[1].dictionary()->string("overriding"), "com.example.1");
    EXPECT_EQ(found[1].dictionary()->string("overrider"), idOf(3));
    EXPECT_EQ(found[2].dictionary()->string("overriding"), "com.example.2");
    expectLogged(info, "plug-in " + idOf(2) + " overrides " + idOf(1));
}

TEST_F(Discovery, APlugInThatVanishedIsSentAsFarAsItIsKnown) {
    installThree();
    const std::string description = record(1)->description();
    const std::string line = "failed to export matching plug-in " + idOf(1) + ": the plug-in has no \"bundleInfo\"";
    fake.registry.before("knowledgeUUID", [&] { fake.registry.uninstall(uuid(1)); });
    EXPECT_EQ(answer(), "123");
    expectLogged(error, line);
    support::processLog.clear();
    EXPECT_FALSE(matches("find", {{"uuids", uuid(1)}}).dictionary()->contains("bundleInfo"));
    expectLogged(error, line);
    expectLogged(standard, "plugin found " + description);
    EXPECT_EQ(daemon.ask("find"), errorReply(15, "Cannot locate PlugIn"));
    expectLogged(standard, "plugin not found");
}

TEST_F(Discovery, AnAnswerThatNoMessageHoldsIsAnError) {
    const Value filler = std::string(std::size_t{8} << 20U, 'x'); // twice in each form
    for (int number = 1; number <= 5; ++number) install({described(number, {{"Filler", filler}})});
    EXPECT_EQ(daemon.ask("match"), errorReply(4, "the matching plug-ins are too many for one reply"));
}

TEST_F(Discovery, FormsCarryWhatAnnotationRequestsChange) {
    install({described(1)});
    const Dictionary bad = errorReply(4, "invalid request format (annotation extension)");
    const Dictionary unstorable{{"k", uuid(1)}};
    const Dictionary large{{"k", std::string(64 << 10, 'x')}};
    const Dictionary oneGoodOneBad{{idOf(1), Dictionary{{"a", 1}}}, {"x", Dictionary()}};
    const std::tuple<const char*, Dictionary, Dictionary> cases[] = {
        {"annotate", {{"extension", unstorable}}, bad},
        {"annotate", {{"extension", large}}, bad},
        {"annotate", {{"extension", Dictionary{{"b", 1}}}, {"other", 1}}, succeeded},
        {"annotate", {{"election", 2}}, succeeded},
        {"bulk-annotate", {{idOf(1), unstorable}}, errorReply(18, "the extension cannot be stored")},
        {"bulk-annotate", {}, succeeded},
        {"bulk-annotate", oneGoodOneBad, errorReply(18, "invalid plug-in UUID value")},
    };
    for (const auto& [type, annotations, reply] : cases) {
        const auto before = posts();
        EXPECT_EQ(daemon.ask(type, {{"uuids", Array{uuid(1)}}, {"annotations", annotations}}), reply);
        EXPECT_EQ(posts() - before, reply.empty() ? 1U : 0U) << type << Value(annotations).description();
    }
    // What came before a failure stays, though nobody is notified; an extension replaces no election.
    const auto annotations = [&] { return *forms()[0].dictionary()->dictionary("annotations"); };
    EXPECT_EQ(annotations(), (Dictionary{{"election", 2}, {"extension", Dictionary{{"a", 1}}}}));
    const auto before = posts();
    const Array known{uuid(1), uuid(9)};
    EXPECT_TRUE(daemon.ask("annotate", {{"uuids", known}, {"annotations", Dictionary{{"election", 3}}}})["error"]);
    EXPECT_EQ(posts(), before);
    EXPECT_EQ(annotations()["election"], Value(3));
    expectLogged(info, "client 77 plug-in com.example.1(" + idOf(1) + ") election := 3");
    expectLogged(debug, "bulk change requested for 2 plug-ins");
    const auto line = testing::MatchesRegex("client 77 bulk plug-in com.example.1\\(.*\\) annotation change: .a = 1.");
    EXPECT_THAT(support::processLog.messages("ops"), testing::Contains(line));
}

} // namespace
