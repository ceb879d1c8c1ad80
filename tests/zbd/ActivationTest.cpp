#include "Zembra/ZBUtilities.h"
#include "tests/support/Requests.h"

namespace {

using namespace platform;
using support::errorReply;

struct Activation : support::Requests {
    const Dictionary guarded{{"VKExtensionHostEntitlement", "needed"}};

    Activation() {
        fake.serviceManager.allow();
        fake.bundles.add(application, {{"VBBundleIdentifier", "com.example.a"}});
    }
    Dictionary ready(const Array& uuids, const Value& environment = "none") {
        return daemon.ask("ready", {{"uuids", uuids}, {"environment", environment}});
    }
    /// The service description that the service manager got last.
    Dictionary service() const { return *fake.serviceManager.additions().back().overlay.dictionary("QMXService"); }
};

TEST_F(Activation, TheServiceManagerLearnsHostExecutableAndOverlay) {
    grant({{"com.nordane.developer.zembra.provide-environment", true}});
    fake.processes.environment["ZBTEST_SDK"] = "daemon";
    const Dictionary ofHost{{"HOME", "host"}, {"TMPDIR", "host"}, {"ZBTEST_SDK", "host"}, {"OWN", "host"}};
    const Dictionary ofPlugIn{{"HOME", "own"}, {"ZBTEST_SDK", "own"}};
    const Dictionary whole{{"Kept", 1}, {"_SandboxProfile", "none"}, {"EnvironmentVariables", ofPlugIn}};
    const std::string given = "/containers/any";
    for (const auto& [declared, home, sdk] : {std::tuple(Value("a text"), given, "daemon"), {whole, "own", "own"}}) {
        auto plugIn = described(1);
        plugIn.info = *zembra::dictionaryChanging(plugIn.info, "QMXService", declared);
        install({plugIn});
        EXPECT_EQ(ready({uuid(1)}, ofHost), succeeded);
        auto environment = MutableDictionary::copyOf(ofHost);
        environment.merge(
            {{"HOME", home}, {"VBFIXED_USER_HOME", given}, {"TMPDIR", given + "/tmp"}, {"ZBTEST_SDK", sdk}});
        EXPECT_EQ(service()["EnvironmentVariables"], Value(environment)) << "later sources replace earlier ones";
    }
    EXPECT_EQ((Array{service()["Kept"], service()["_SandboxProfile"], service()["_OmitSandboxParameters"]}),
              (Array{1, "plugin", true}));
    const auto added = fake.serviceManager.additions().back();
    EXPECT_EQ(added.host, 77);
    EXPECT_EQ(added.executablePath, pathOf(1) + "/run");
    EXPECT_EQ(added.overlay, (Dictionary{{"QMXService", service()}, {"VBBundlePackageType", "QMX!"}}));
    expectLogged(standard, "allowing host 77 /Applications/Host.app/host to use plug-in com.example.1(1.0) uuid=" +
                               idOf(1) + " at " + pathOf(1));
}

TEST_F(Activation, ExtensionPointsChooseTheProfile) {
    int number = 0;
    const auto profile = [&](const std::string& point, const Value& openAccess) {
        const Dictionary attributes{{"RequestsOpenAccess", openAccess}};
        const auto name = "com.nordane." + point;
        install({described(++number, {{"VKExtensionPointIdentifier", name}, {"VKExtensionAttributes", attributes}})});
        EXPECT_EQ(ready({uuid(number)}), succeeded);
        return std::string(*service().string("_SandboxProfile"));
    };
    for (const auto& [point, openAccess, expected] :
         {std::tuple("netplug.filter-data", Value(true), "network-filter"),
          {"app.non-ui-extension.multiple-instances", true, "sketchpad-devtools"},
          {"Keyboard-service", true, "plugin"},
          {"keyboard-service", false, "keyboard"},
          {"keyboard-service", "true", "keyboard"}})
        EXPECT_EQ(profile(point, openAccess), expected);
    EXPECT_TRUE(fake.privacyConsent.asked.empty()) << "nobody wants it";
    // Consent is asked for afresh, and no failure grants it.
    fake.privacyConsent.decide("com.example.a", "another", true);
    for (const auto& granted : {std::optional<bool>(), std::optional(false), std::optional(true)}) {
        fake.privacyConsent.decide("com.example.a", keyboardNetworkAccess, granted);
        EXPECT_EQ(profile("keyboard-service", true), granted == true ? "plugin" : "keyboard");
    }
    fake.privacyConsent.isUnavailable = true;
    EXPECT_EQ(profile("keyboard-service", true), "keyboard");
}

TEST_F(Activation, NothingIsEnabledUnlessEverythingIsAllowed) {
    const Dictionary data{{"VKExtensionProtocol", "#Data"}, {"VKExtensionHostEntitlement", "needed"}};
    const Dictionary split{{"VKExtensionHostEntitlement", "two\nlines"}};
    install({described(1), described(2, guarded), described(3), described(4, data), described(5, split)});
    hold(3);
    EXPECT_EQ(ready({uuid(4)}), succeeded) << "data runs nothing, so nothing is checked";
    const std::string refusal =
        "Transmission of environment variables requires the com.nordane.developer.zembra.provide-environment host entitlement";
    EXPECT_EQ(ready({uuid(1)}, Dictionary()), errorReply(11, refusal));
    for (const auto& [number, reason] :
         {std::pair(2, "the host does not have the \"needed\" entitlement"), {3, "the plug-in is on hold"}}) {
        const std::string name = "com.example." + std::to_string(number);
        EXPECT_EQ(ready({uuid(1), uuid(number)}), errorReply(11, "access to plugin " + name + " denied: " + reason));
        expectLogged(standard, "denied access to 77 for plugin " + name + "(" + idOf(number) + "): " + reason);
    }
    EXPECT_TRUE(ready({uuid(1), uuid(9)})["error"]);
    EXPECT_TRUE(ready({uuid(5)}).string("error")->ends_with("have the \"two\nlines\" entitlement"));
    grant({{"com.nordane.developer.zembra.allowedplugins", Dictionary{{"VKExtensionIdentifier", "other"}}}});
    EXPECT_TRUE(
        ready({uuid(2)}).string("error")->ends_with("the host's plug-in entitlement does not allow this plug-in"))
        << "before what the plug-in needs";
    EXPECT_TRUE(fake.serviceManager.additions().empty());
}

TEST_F(Activation, AFailureIsToldAndStopsNoOther) {
    install({described(1), described(2)});
    fake.bundles.add(pathOf(2), {});
    const auto missing = errorReply(4, "cannot obtain executable path for plug-in com.example.2(" + idOf(2) + ")");
    // In either order, for they are enabled in the order of a set.
    EXPECT_EQ(ready({uuid(2), uuid(1)}), missing);
    EXPECT_EQ(ready({uuid(1), uuid(2), uuid(1)}), missing);
    EXPECT_EQ(fake.serviceManager.additions().size(), 2U) << "once for each request";
    fake.serviceManager.failAdditions(EIO);
    EXPECT_TRUE(ready({uuid(2), uuid(1)})["error"]) << "two failures, one reply";
    EXPECT_EQ(ready({uuid(1)}), errorReply(4, "unable to enable plug-in com.example.1(" + idOf(1) + ")"));
    EXPECT_TRUE(
        support::logged(error, "ignitd error 5 trying to allow 77 /Applications/Host.app/host to use plug-in "));
}

TEST_F(Activation, AccessGivesATokenForEachBundleOrNone) {
    install({described(1, guarded), described(2, guarded)});
    hold(2); // neither keeps anybody from reading
    fake.sandbox.allowFile(pathOf(1));
    const auto access = [&](const Array& uuids, const Value& paths) {
        return daemon.ask("access", {{"uuids", uuids}, {"paths", paths}});
    };
    // The walk ends at the first that is known neither by its UUID nor by a path.
    for (const auto& [uuids, paths] : {std::pair(Array{uuid(1), uuid(9), uuid(2)}, Value(pathOf(2))),
                                       {Array{uuid(9), uuid(9)}, Array{pathOf(2)}},
                                       {Array{uuid(9)}, Array{7}}})
        EXPECT_EQ(access(uuids, paths), errorReply(4, "no such plugin (uuid not found)"));
    const Array pathsFor2{"/nowhere", pathOf(2)};
    EXPECT_EQ(access({uuid(1), uuid(9)}, pathsFor2),
              errorReply(4, "cannot create file extension to " + pathOf(2) + ": 1"));
    fake.sandbox.allowFile(pathOf(2));
    const std::string prefix = "file:com.nordane.app-sandbox.read:";
    EXPECT_EQ(access({uuid(1), uuid(9)}, pathsFor2),
              (Dictionary{{"extensions", Array{prefix + pathOf(1), prefix + pathOf(2)}}}));
    expectLogged(standard, "Paths present but has different count than UUIDs (ignoring)", "traffic");
}

} // namespace
