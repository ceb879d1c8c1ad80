#include "tests/support/FakeDaemon.h"
#include "zbd/Transaction.h"

#include <gtest/gtest.h>

#include <cerrno>

namespace {

using platform::Array;
using platform::Dictionary;
using platform::LogLevel;
using platform::MutableDictionary;
using platform::URL;
using platform::UUID;
using platform::Value;
using support::errorReply;
using support::processLog;

constexpr std::string_view application = "/Applications/A.app";

struct Activation : testing::Test {
    support::FakeDaemon daemon;

    Activation() {
        daemon.fake.serviceManager.allow();
        daemon.fake.bundles.add(std::string(application), {{"VBBundleIdentifier", "com.example.a"}});
    }

    /// A plug-in with code and an executable. `extension` and `manifest` complete its dictionaries.
    support::FakePlugIn install(const std::string& name, const Dictionary& extension = {},
                                const Dictionary& manifest = {}) {
        auto plugIn = support::dataPlugIn(name);
        plugIn.path = std::string(application) + "/PlugIns/" + name + ".plugin";
        plugIn.onSystemPartition = false;
        plugIn.containingBundle = std::make_shared<platform::ApplicationRecord>(
            platform::ApplicationRecord{URL::file(std::string(application)), "com.example.a", "A"});
        MutableDictionary plugInDictionary{{"VKExtensionProtocol", "Proto"},
                                           {"VKExtensionAttributes", Dictionary{{"VKExtensionVersion", "1"}}}};
        plugInDictionary.merge(extension);
        auto info = MutableDictionary::copyOf(support::manifestOf("com.example." + name, plugInDictionary));
        info.merge(manifest);
        plugIn.info = info;
        daemon.fake.bundles.add(plugIn.path, info, plugIn.path + "/run");
        daemon.fake.registry.install(plugIn);
        return plugIn;
    }
    Dictionary ready(const Array& uuids, const Value& environment = {}) {
        MutableDictionary message{{"uuids", uuids}};
        if (environment) message.set("environment", environment);
        return daemon.ask("ready", message);
    }
    /// The service description that the service manager got last.
    Dictionary service() const {
        const auto additions = daemon.fake.serviceManager.additions();
        return additions.empty() ? Dictionary()
                                 : additions.back().overlay.dictionary("QMXService").value_or(Dictionary());
    }
    bool logged(LogLevel level, const std::string& message) { return processLog.contains(level, "ops", message); }
};

TEST_F(Activation, TheServiceManagerLearnsHostExecutableAndOverlay) {
    const auto plugIn = install("code");
    EXPECT_EQ(ready({*plugIn.uuid, *plugIn.uuid}), Dictionary());
    const auto additions = daemon.fake.serviceManager.additions();
    ASSERT_EQ(additions.size(), 1U) << "a plug-in named twice is enabled once";
    EXPECT_EQ(additions[0].host, 77);
    EXPECT_EQ(additions[0].executablePath, plugIn.path + "/run");
    EXPECT_EQ(additions[0].overlay,
              (Dictionary{{"QMXService",
                           Dictionary{{"EnvironmentVariables", Dictionary{{"HOME", "/containers/any"},
                                                                          {"VBFIXED_USER_HOME", "/containers/any"},
                                                                          {"TMPDIR", "/containers/any/tmp"}}},
                                      {"_SandboxProfile", "plugin"},
                                      {"_OmitSandboxParameters", true}}},
                          {"VBBundlePackageType", "QMX!"}}));
    EXPECT_TRUE(logged(LogLevel::info, "no QMXService for plug-in; database returned (null)"));
    EXPECT_TRUE(logged(LogLevel::debug, "activation overlay=" + Value(additions[0].overlay).description()));
    EXPECT_TRUE(
        logged(LogLevel::info, "assigning plug-in com.example.code(1) " + plugIn.uuid->text() + " to plugin sandbox"));
    EXPECT_TRUE(logged(LogLevel::standard,
                       "allowing host 77 /Applications/Host.app/host to use plug-in com.example.code(1) uuid=" +
                           plugIn.uuid->text() + " at " + plugIn.path));
}

TEST_F(Activation, LaterSourcesOfTheEnvironmentReplaceEarlierOnes) {
    daemon.fake.codeSigning.entitlements[77] = {{"com.nordane.developer.zembra.provide-environment", true}};
    daemon.fake.processes.environment["ZBTEST_SDK"] = "daemon";
    const Dictionary fromHost{{"HOME", "host"}, {"LANG", "host"}, {"ZBTEST_SDK", "host"}, {"OWN", "host"}};
    const auto plain = install("plain");
    EXPECT_EQ(ready({*plain.uuid}, fromHost), Dictionary());
    EXPECT_TRUE(logged(LogLevel::debug, "pid 77 provided 4 environment entries"));
    EXPECT_EQ(service()["EnvironmentVariables"], Value(Dictionary{{"HOME", "/containers/any"},
                                                                  {"LANG", "host"},
                                                                  {"ZBTEST_SDK", "daemon"},
                                                                  {"OWN", "host"},
                                                                  {"VBFIXED_USER_HOME", "/containers/any"},
                                                                  {"TMPDIR", "/containers/any/tmp"}}));
    const Dictionary declared{{"Kept", 1},
                              {"_SandboxProfile", "none"},
                              {"EnvironmentVariables", Dictionary{{"HOME", "own"}, {"ZBTEST_SDK", "own"}}}};
    const auto own = install("own", {}, {{"QMXService", declared}});
    EXPECT_EQ(ready({*own.uuid}, fromHost), Dictionary());
    EXPECT_TRUE(processLog.contains(LogLevel::debug, "cx", "raw QMXService=" + Value(declared).description()));
    const auto variables = service().dictionary("EnvironmentVariables").value_or(Dictionary());
    EXPECT_EQ(variables["HOME"], Value("own"));
    EXPECT_EQ(variables["ZBTEST_SDK"], Value("own"));
    EXPECT_EQ(variables["LANG"], Value("host"));
    EXPECT_EQ(service()["Kept"], Value(1));
    EXPECT_EQ(service()["_SandboxProfile"], Value("plugin"));

    const std::pair<const char*, Value> wrongTypes[] = {{"odd", Dictionary{{"EnvironmentVariables", "x"}}},
                                                        {"text", "QMXService"}};
    for (const auto& [name, value] : wrongTypes) {
        const auto plugIn = install(name, {}, {{"QMXService", value}});
        EXPECT_EQ(ready({*plugIn.uuid}), Dictionary());
        EXPECT_TRUE(service().dictionary("EnvironmentVariables")) << name;
    }
    EXPECT_TRUE(logged(LogLevel::info, "no QMXService for plug-in; database returned QMXService"));
}

TEST_F(Activation, ExtensionPointsChooseTheProfile) {
    struct Case {
        std::string point;
        Value requestsOpenAccess;
        std::optional<bool> granted;
        std::string profile;
    };
    const std::string keyboard = "com.nordane.keyboard-service";
    const std::vector<Case> cases{
        {keyboard, {}, true, "keyboard"},
        {keyboard, false, true, "keyboard"},
        {keyboard, "true", true, "keyboard"},
        {keyboard, true, std::nullopt, "keyboard"},
        {keyboard, true, false, "keyboard"},
        {keyboard, true, true, "plugin"},
        {"com.nordane.Keyboard-service", true, true, "plugin"},
        {"com.nordane.netplug.filter-data", {}, {}, "network-filter"},
        {"com.nordane.peekview.extension.preview", {}, {}, "peekviewd"},
        {"com.nordane.peekview.preview", {}, {}, "peekview-preview"},
        {"com.nordane.peekview.thumbnail", {}, {}, "peekview-thumbnail"},
        {"com.nordane.app.non-ui-extension", {}, {}, "sketchpad-devtools"},
        {"com.nordane.app.non-ui-extension.multiple-instances", {}, {}, "sketchpad-devtools"},
        {"com.nordane.senderscreen.message-filter", {}, {}, "message-filter"},
        {"com.example.other", {}, {}, "plugin"},
    };
    for (std::size_t i = 0; i < cases.size(); ++i) {
        const Case& c = cases[i];
        daemon.fake.privacyConsent = {};
        daemon.fake.privacyConsent.decide("com.example.a", platform::keyboardNetworkAccess, c.granted);
        MutableDictionary attributes;
        if (c.requestsOpenAccess) attributes.set("RequestsOpenAccess", c.requestsOpenAccess);
        const auto plugIn = install("p" + std::to_string(i),
                                    {{"VKExtensionPointIdentifier", c.point}, {"VKExtensionAttributes", attributes}});
        EXPECT_EQ(ready({*plugIn.uuid}), Dictionary());
        EXPECT_EQ(service()["_SandboxProfile"], Value(c.profile)) << i;
        const bool mayAsk = c.point == keyboard && c.requestsOpenAccess == Value(true);
        EXPECT_EQ(!daemon.fake.privacyConsent.asked.empty(), mayAsk) << i;
    }
}

TEST_F(Activation, ConsentIsAskedForAfreshAndFailuresGrantNothing) {
    auto plugIn = install("p");
    const auto record = daemon.server->findPlugIn(*plugIn.uuid);
    daemon.fake.privacyConsent.decide("com.example.a", "one", true);
    daemon.fake.privacyConsent.decide("com.example.a", "two", std::nullopt);
    EXPECT_EQ(record->allowedPVCServices(), (std::set<std::string>{"one"}));
    daemon.fake.privacyConsent.decide("com.example.a", "three", true);
    EXPECT_EQ(record->allowedPVCServices(), (std::set<std::string>{"one", "three"}));
    daemon.fake.privacyConsent.isUnavailable = true;
    EXPECT_EQ(record->allowedPVCServices(), std::set<std::string>());
    EXPECT_TRUE(logged(LogLevel::info, "PVCAccessCopyInformationForBundle failed for <bundle /Applications/A.app>"));
}

TEST_F(Activation, NothingIsEnabledUnlessEverythingIsAllowed) {
    const auto first = install("first");
    const auto guarded = install("guarded", {{"VKExtensionHostEntitlement", "needed"}});
    const auto held = install("held");
    const auto data = install("data", {{"VKExtensionProtocol", "#Data"}, {"VKExtensionHostEntitlement", "needed"}});
    const auto record = daemon.server->findPlugIn(*held.uuid);
    daemon.server->addHold(zbd::ZBDPlugInHold::initWithPlugIns(daemon.fake.transport, {record}, nullptr));
    const std::string environmentRefusal =
        "Transmission of environment variables requires the com.nordane.developer.zembra.provide-environment host "
        "entitlement";

    EXPECT_EQ(ready({}), Dictionary());
    EXPECT_EQ(ready({*data.uuid}), Dictionary()) << "data runs nothing, so nothing is checked";
    EXPECT_EQ(ready({*first.uuid}, Dictionary()), errorReply(11, environmentRefusal));
    EXPECT_EQ(ready({*first.uuid, *held.uuid}),
              errorReply(11, "access to plugin com.example.held denied: the plug-in is on hold"));
    EXPECT_TRUE(logged(LogLevel::standard, "denied access to 77 for plugin com.example.held(" + held.uuid->text() +
                                               "): the plug-in is on hold"));
    EXPECT_EQ(ready({*first.uuid, *guarded.uuid}),
              errorReply(11, "access to plugin com.example.guarded denied: the host does not have the \"needed\" "
                             "entitlement"));
    EXPECT_TRUE(logged(LogLevel::standard, "denied access to 77 for plugin com.example.guarded(" +
                                               guarded.uuid->text() +
                                               "): the host does not have the \"needed\" entitlement"));
    EXPECT_EQ(ready({*first.uuid, UUID::random()}), errorReply(4, "no such plugin (uuid not found)"));
    EXPECT_TRUE(daemon.fake.serviceManager.additions().empty());
    EXPECT_EQ(ready({*first.uuid}, "no dictionary, so none"), Dictionary());
}

TEST_F(Activation, AFailureIsToldAndStopsNoOther) {
    const auto whole = install("whole");
    auto broken = install("broken");
    daemon.fake.bundles.add(broken.path, broken.info);
    const auto missing =
        errorReply(4, "cannot obtain executable path for plug-in com.example.broken(" + broken.uuid->text() + ")");
    // In either order, for they are enabled in the order of a set.
    EXPECT_EQ(ready({*broken.uuid, *whole.uuid}), missing);
    EXPECT_EQ(ready({*whole.uuid, *broken.uuid}), missing);
    EXPECT_EQ(daemon.fake.serviceManager.additions().size(), 2U);
    EXPECT_TRUE(logged(LogLevel::error, "failed to obtain execPath for plug-in " +
                                            daemon.server->findPlugIn(*broken.uuid)->description() + "(" +
                                            broken.uuid->text() + ") bundle=<bundle " + broken.path + ">"));
    daemon.fake.serviceManager.failAdditions(EIO);
    EXPECT_TRUE(ready({*broken.uuid, *whole.uuid})["error"]) << "two failures, one reply";
    EXPECT_EQ(ready({*whole.uuid}),
              errorReply(4, "unable to enable plug-in com.example.whole(" + whole.uuid->text() + ")"));
    EXPECT_TRUE(logged(LogLevel::error, "ignitd error 5 trying to allow 77 /Applications/Host.app/host to use plug-in "
                                        "com.example.whole(1) uuid=" +
                                            whole.uuid->text() + " at " + whole.path));
}

TEST_F(Activation, AccessGivesATokenForEachBundleOrNone) {
    const auto first = install("first", {{"VKExtensionHostEntitlement", "needed"}});
    const auto second = install("second");
    EXPECT_EQ(daemon.ask("access", {{"uuids", Array()}}), (Dictionary{{"extensions", Array()}}));
    daemon.fake.sandbox.allowFile(first.path);
    const auto access = [&] { return daemon.ask("access", {{"uuids", Array{*first.uuid, *second.uuid}}}); };
    EXPECT_EQ(access(), errorReply(4, "cannot create file extension to " + second.path + ": 1"));
    daemon.fake.sandbox.allowFile(second.path);
    daemon.server->addHold(zbd::ZBDPlugInHold::initWithPlugIns(
        daemon.fake.transport, {daemon.server->findPlugIn(*second.uuid)}, nullptr)); // a hold keeps nobody from reading
    const auto tokens = access().array("extensions").value_or(Array());
    ASSERT_EQ(tokens.size(), 2U);
    EXPECT_TRUE(tokens[0].string()->ends_with(first.path));
    EXPECT_TRUE(tokens[1].string()->ends_with(second.path));
}

} // namespace
