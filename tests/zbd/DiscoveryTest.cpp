#include "tests/support/Requests.h"

namespace {

using namespace platform;
using support::errorReply;

struct Discovery : support::Requests {
    Discovery() { fake.preferences.addDomain("com.nordane.zembra.userprefs"); }

    void becomeManager() {
        fake.sandbox.unconfined.insert(77);
        grant({{"com.nordane.private.zembra.manager", true}});
    }
    Array forms(const MutableDictionary& message = {}) {
        return *decodeCompact(daemon.ask("match", message)["matches"].data().value(), UUIDs::refused)->array();
    }
    /// The last digits of the UUIDs answered, in order.
    std::string answer(std::uint64_t flags = 0, const Dictionary& rules = {}) {
        std::string digits;
        for (const Value& form : forms({{"flags", flags}, {"rules", rules}}))
            digits += form.dictionary()->string("uuid")->back();
        return digits;
    }
};

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
    EXPECT_EQ(answer(), "123");
    expectLogged(info, "Resulting plugin count: 3, UUIDs: " + Value(Array{idOf(1), idOf(2), idOf(3)}).description());
    EXPECT_EQ(answer(0, identified("com.example.2")), "2");
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

TEST_F(Discovery, OneOfEachIdentifierUnlessTheHostCarriesAnotherOrAllVersionsAreAskedFor) {
    const auto version = [this](int number, const char* text, const std::string& within = application) {
        const Dictionary attributes{{"VKExtensionVersion", text}};
        return described(number, {{"VKExtensionIdentifier", "p"}, {"VKExtensionAttributes", attributes}}, within);
    };
    auto newer = version(2, "1.10");
    newer.registrationDate = Date{2'000'000'000};
    install({version(1, "01.10"), newer, version(3, "1.2"), described(4)});
    EXPECT_EQ(answer(), "24");
    EXPECT_EQ(answer(zembra::ZBDiscoverAllVersions), "234");
    install({version(5, "1.10", "/System/Applications/S.app")});
    EXPECT_EQ(answer(), "45") << "the system's own wins a tie";
    install({version(6, "1.0", "/Applications/Host.app")}); // whose program asks
    EXPECT_EQ(answer(), "46");
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
    const std::pair<Value, Value> expected[] = {
        {idOf(2), Value()}, {idOf(3), "com.example.1"}, {Value(), "com.example.2"}};
    const auto found = forms();
    for (std::size_t i = 0; i < 3; ++i) {
        const auto form = *found[i].dictionary();
        EXPECT_EQ(std::pair(form["overrider"], form["overriding"]), expected[i]) << i;
    }
    expectLogged(info, "plug-in " + idOf(2) + " overrides " + idOf(1));
}

TEST_F(Discovery, APlugInThatVanishedIsSentAsFarAsItIsKnown) {
    installThree();
    record(1);
    fake.registry.before("knowledgeUUID", [&] { fake.registry.uninstall(uuid(1)); });
    EXPECT_EQ(answer(), "123");
    expectLogged(error, "failed to export matching plug-in " + idOf(1) + ": the plug-in has no \"bundleInfo\"");
}

TEST_F(Discovery, AnAnswerThatNoMessageHoldsIsAnError) {
    const Value filler = std::string(std::size_t{8} << 20U, 'x'); // twice in each form
    for (int number = 1; number <= 5; ++number) install({described(number, {{"Filler", filler}})});
    EXPECT_EQ(daemon.ask("match"), errorReply(4, "the matching plug-ins are too many for one reply"));
    for (const int number : {4, 5}) {
        const Dictionary newer{{"VKExtensionVersion", "9"}};
        install({described(number + 2, {{"VKExtensionIdentifier", "com.example." + std::to_string(number)},
                                        {"VKExtensionAttributes", newer}})});
    }
    EXPECT_EQ(answer(), "12367") << "what is replaced does not count";
}

TEST_F(Discovery, WhatIsAskedAgainFollowsEveryChange) {
    for (const char* category : {"cx", "sandbox"}) support::processLog.setLevel(category, info);
    const auto version = [this](int number, const char* text) {
        return described(number, {{"VKExtensionAttributes", Dictionary{{"VKExtensionVersion", text}}}});
    };
    const auto expect = [this](const Dictionary& rules, const char* expected) {
        for (int time = 0; time < 3; ++time) EXPECT_EQ(answer(0, rules), expected) << time;
    };
    const Dictionary newer{{"VKExtensionVersion", Array{">1.9", "=0.1"}}};
    fake.sandbox.interval = std::chrono::hours(1);
    install({version(1, "1.10"), version(2, "1.2"), version(3, "2")});
    for (int number = 1; number <= 3; ++number) {
        fake.sandbox.allowFile(pathOf(number));
        fake.sandbox.services.insert("com.example." + std::to_string(number));
    }
    expect(newer, "13");
    install({version(2, "0.01")});
    expect(newer, "123");
    hold(3);
    expect(newer, "12");
    // Tokens serve for a while, and others are asked for where one was refused. Annotations serve until they change.
    const auto issues = fake.sandbox.issues;
    expect({}, "12");
    EXPECT_EQ(fake.sandbox.issues, issues);
    const Dictionary elected{{"VKUserElection", "1"}};
    expect(elected, "");
    for (const auto& uuids : {Array{uuid(1)}, Array{uuid(2)}}) {
        fake.sandbox.services.erase("com.example.2");
        daemon.ask("annotate", {{"uuids", uuids}, {"annotations", Dictionary{{"election", 1}}}});
    }
    expect(elected, "12");
    EXPECT_EQ(forms()[0].dictionary()->dictionary("annotations"), (Dictionary{{"election", 1}}));
    EXPECT_FALSE(forms()[1].dictionary()->contains("service-extension"));
    fake.sandbox.services.insert("com.example.2");
    EXPECT_TRUE(forms()[1].dictionary()->contains("service-extension"));
    // The log tells of what nobody understands each time, for each plug-in.
    const auto lines = [] {
        return std::ranges::count(support::processLog.messages("ops"), "unrecognized match operator:?X");
    };
    expect({{"VKExtensionVersion", "?X"}}, "");
    EXPECT_EQ(lines(), 6);
    for (const char* category : {"cx", "sandbox"}) support::processLog.setLevel(category, debug);
}

TEST_F(Discovery, FormsCarryWhatAnnotationRequestsChange) {
    install({described(1)});
    const Dictionary bad = errorReply(4, "invalid request format (annotation extension)");
    const Dictionary unstorable{{"k", uuid(1)}};
    const Dictionary large{{"k", std::string(64 << 10, 'x')}};
    const Dictionary oneGoodOneBad{{idOf(1), Dictionary{{"a", 1}}}, {"x", Dictionary()}};
    const std::tuple<const char*, Dictionary, Dictionary> cases[] = {
        {"annotate", {{"extension", large}}, bad},
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
    EXPECT_EQ(forms()[0].dictionary()->dictionary("annotations"),
              (Dictionary{{"election", 2}, {"extension", Dictionary{{"a", 1}}}}));
    expectLogged(info, "client 77 plug-in com.example.1(" + idOf(1) + ") election := 2");
    EXPECT_TRUE(support::logged(debug, "client 77 bulk plug-in com.example.1("));
}

} // namespace
