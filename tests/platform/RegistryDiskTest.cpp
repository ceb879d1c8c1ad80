#include "platform/linux/Containers.h"
#include "platform/linux/Entitlements.h"
#include "platform/linux/PeerProcess.h"
#include "platform/linux/Registry.h"
#include "platform/linux/RegistryStore.h"
#include "tests/support/BundleTree.h"
#include "tests/support/LocaleFake.h"
#include "tests/support/Sanitizers.h"
#include "tests/support/ScratchDirectory.h"

#include <algorithm>
#include <condition_variable>
#include <fcntl.h>
#include <fstream>
#include <functional>
#include <gtest/gtest.h>
#include <map>
#include <mutex>
#include <sys/resource.h>
#include <sys/stat.h>
#include <thread>
#include <unistd.h>

// What happens on disk, and what the registry makes of it.

namespace {

using namespace platform;
using support::plugInInfo;
using support::writeApplication;
using support::writeFile;
using support::writeManifest;
namespace fs = std::filesystem;

/// Keeps the notices, each as a sign and an identifier; can hold the registry's thread in one.
class Observer final : public RegistryObserver {
public:
    void pluginsDidInstall(const std::vector<PlugInProxyRef>& proxies) override { add("+", proxies); }
    void pluginsWillUninstall(const std::vector<PlugInProxyRef>& proxies) override {
        for (const auto& proxy : proxies) {
            if (registry != nullptr && registry->plugInForUUID(*proxy->uuid) != nullptr) add("found", {proxy});
        }
        add("-", proxies);
    }

    std::vector<std::string> take() {
        const std::lock_guard lock(_mutex);
        return std::exchange(_notices, {});
    }
    std::map<std::string, int> counts() {
        std::map<std::string, int> counts;
        for (const auto& notice : take()) ++counts[notice];
        return counts;
    }
    void hold() { set(true); }
    void release() { set(false); }
    void waitUntilHeld() {
        std::unique_lock lock(_mutex);
        ASSERT_TRUE(_changed.wait_for(lock, std::chrono::seconds(30), [&] { return _isHeld; }));
    }

    Registry* registry = nullptr; // to be asked inside the notices

private:
    void set(bool isHolding) {
        const std::lock_guard lock(_mutex);
        _isHolding = isHolding;
        _isHeld = false;
        _changed.notify_all();
    }
    void add(const std::string& sign, const std::vector<PlugInProxyRef>& proxies) {
        std::unique_lock lock(_mutex);
        for (const auto& proxy : proxies) _notices.push_back(sign + proxy->plugInIdentifier.value_or("none"));
        _isHeld = _isHolding;
        _changed.notify_all();
        _changed.wait_for(lock, std::chrono::seconds(30), [&] { return !_isHolding; });
    }

    std::mutex _mutex;
    std::condition_variable _changed;
    std::vector<std::string> _notices;
    bool _isHolding = false;
    bool _isHeld = false;
};

class RegistryOnDisk : public testing::Test {
protected:
    using Notices = std::vector<std::string>;

    explicit RegistryOnDisk(const std::string& place = "/tmp") : scratch(place) {
        fs::create_directories(applications);
    }

    void start(linux_::RegistryLimits limits = {}) {
        _registry.reset();
        _registry.emplace(linux_::Root(scratch.path()), locale, _containers, limits);
        observer->registry = &*_registry;
        _registry->addObserver(observer);
    }
    void stop() { _registry.reset(); }
    /// Stops a registry that takes files for unchanged at its next start. It does not as long as another change of a
    /// plug-in could have the same time; then it is started again, and looks again.
    void stopOnceFilesAreOld() {
        const auto latest = std::chrono::steady_clock::now() + std::chrono::seconds(30);
        const auto areOld = [&] {
            linux_::SharedStrings strings;
            linux_::RegistryStore store(scratch / "var/db/Catalix.sqlite", strings);
            std::optional<std::string> problem;
            return std::ranges::all_of(store.open(problem).plugIns,
                                       [](const auto& place) { return place.second->facts->evidence != 0; });
        };
        do {
            ASSERT_LT(std::chrono::steady_clock::now(), latest);
            start();
            settle();
            stop();
        } while (!areOld());
    }
    linux_::Registry& registry() { return *_registry; }
    Notices settle() {
        _registry->settle();
        return observer->take();
    }
    PlugInProxyRef at(const std::string& path) { return _registry->plugInForURL(URL::file(path)); }
    UUID uuidAt(const std::string& path) {
        const auto proxy = at(path);
        return proxy ? *proxy->uuid : UUID{};
    }
    std::size_t count() { return _registry->installedPlugIns()->size(); }

    support::ScratchDirectory scratch;
    const std::string applications = scratch / "Applications";
    const std::string app = applications + "/One.app";
    const std::string plugIn = app + "/PlugIns/a.appex";
    support::FakeLocale locale;
    const std::shared_ptr<Observer> observer = std::make_shared<Observer>();

private:
    linux_::Containers _containers{linux_::Root(scratch.path())};
    std::optional<linux_::Registry> _registry;
};

TEST_F(RegistryOnDisk, EachChangeGivesItsNoticesOnce) {
    start();
    EXPECT_EQ(settle(), Notices{});
    writeApplication(app, {"a", "b"});
    EXPECT_EQ(settle(), (Notices{"+a", "+b"}));
    const UUID uuid = uuidAt(plugIn);

    const std::string renamed = applications + "/Two.app";
    fs::rename(app, renamed);
    EXPECT_EQ(settle(), (Notices{"-a", "-b", "+a", "+b"}));
    EXPECT_EQ(at(plugIn), nullptr);
    EXPECT_EQ(uuidAt(renamed + "/PlugIns/a.appex"), uuid) << "the same bundle elsewhere";

    fs::remove_all(renamed + "/PlugIns/b.appex");
    EXPECT_EQ(settle(), Notices{"-b"});
    fs::rename(renamed, scratch / "elsewhere.app");
    EXPECT_EQ(settle(), Notices{"-a"});
    fs::rename(scratch / "elsewhere.app", app);
    EXPECT_EQ(settle(), Notices{"+a"});
    EXPECT_EQ(uuidAt(plugIn), uuid);
    fs::remove_all(applications);
    EXPECT_EQ(settle(), Notices{"-a"});
    writeApplication(applications + "/deep/deeper/New.app", {"n"});
    EXPECT_EQ(settle(), Notices{"+n"});
}

TEST_F(RegistryOnDisk, ReplacedBundleKeepsItsUUIDIfItIsTheSamePlugIn) {
    writeApplication(app, {"a"});
    start();
    const auto before = at(plugIn);
    for (const char* identifier : {"a", "other"}) {
        const std::string next = scratch / "next.app";
        writeApplication(next, {"a"});
        writeManifest(next + "/PlugIns/a.appex", plugInInfo(identifier));
        fs::remove_all(app);
        fs::rename(next, app);
        const auto notices = settle();
        const bool isSame = identifier == std::string("a");
        EXPECT_EQ(notices, (Notices{"-a", "+" + std::string(identifier)}));
        EXPECT_EQ(uuidAt(plugIn) == *before->uuid, isSame);
        EXPECT_EQ(at(plugIn)->originalIdentifier, identifier);
    }
}

TEST_F(RegistryOnDisk, ChangeInPlaceKeepsTheUUIDAndIsToldWhenAnythingShows) {
    writeApplication(app, {"a"});
    writeFile(plugIn + "/program", "code");
    writeManifest(plugIn, plugInInfo("a", {}, {{"VBBundleExecutable", "program"}}));
    start();
    const auto uuid = uuidAt(plugIn);
    const auto date = at(plugIn)->registrationDate;
    auto knowledge = registry().knowledgeUUID();
    const Notices replaced{"founda", "-a", "+a"}; // it can be found all the time
    const auto expectChanged = [&](bool isChanged, const char* what, bool isApplication = false) {
        EXPECT_EQ(settle(), isChanged && !isApplication ? replaced : Notices{}) << what;
        EXPECT_EQ(registry().knowledgeUUID() != knowledge, isChanged) << what;
        knowledge = registry().knowledgeUUID();
        EXPECT_EQ(uuidAt(plugIn), uuid) << what;
        EXPECT_EQ(at(plugIn)->registrationDate, date) << what;
    };
    const auto info = plugInInfo("a", {}, {{"VBBundleExecutable", "program"}, {"VBBundleVersion", "2"}});
    writeManifest(plugIn, info);
    expectChanged(true, "manifest");
    EXPECT_EQ(at(plugIn)->bundleVersion, "2");
    writeManifest(plugIn, info);
    expectChanged(false, "the same manifest again");
    writeFile(plugIn + "/program", "other code");
    expectChanged(false, "program");
    writeFile(plugIn + "/notes", "text");
    expectChanged(false, "another file");
    writeFile(plugIn + "/Resources/en/InfoVlist.vlist", *encodeXML(Dictionary{{"VBBundleName", "Name"}}));
    expectChanged(true, "names");
    EXPECT_EQ(at(plugIn)->localizedShortName, "Name");
    ASSERT_FALSE(linux_::writeEntitlements(plugIn + "/program", Dictionary{{"com.nordane.any", true}}));
    expectChanged(true, "entitlements");
    ASSERT_TRUE(at(plugIn)->entitlements);
    EXPECT_TRUE(at(plugIn)->entitlements->contains("com.nordane.any"));
    writeManifest(app, Dictionary{{"VBBundleIsPlaceholder", true}, {"VBBundleName", "One"}});
    expectChanged(true, "application", true);
    EXPECT_TRUE(at(plugIn)->containingBundle->isPlaceholder);
    EXPECT_EQ(at(plugIn)->containingBundle->localizedName, "One");

    writeManifest(plugIn, plugInInfo("renamed"));
    EXPECT_EQ(settle(), (Notices{"-a", "+renamed"}));
    EXPECT_EQ(uuidAt(plugIn), uuid);
    EXPECT_EQ(at(plugIn)->originalIdentifier, "a");
}

TEST_F(RegistryOnDisk, StatePersists) {
    writeApplication(app, {"a", "b"});
    const std::string byPath = scratch / "work/tool.plugin";
    writeManifest(byPath, plugInInfo("tool"));
    start();
    ASSERT_TRUE(registry().registerPlugIn(URL::file(byPath)));
    ASSERT_TRUE(registry().unregisterPlugIn(URL::file(app + "/PlugIns/b.appex")));
    const UUID uuid = uuidAt(plugIn);
    const UUID tool = uuidAt(byPath);
    const auto sequence = registry().knowledgeSequenceNumber();
    writeManifest(plugIn, plugInInfo("renamed"));
    settle();
    start();
    EXPECT_EQ(settle(), Notices{});
    EXPECT_EQ(count(), 2U);
    EXPECT_EQ(uuidAt(plugIn), uuid);
    EXPECT_EQ(at(plugIn)->originalIdentifier, "a");
    EXPECT_EQ(uuidAt(byPath), tool);
    const auto knowledge = registry().knowledgeUUID();
    EXPECT_GE(registry().knowledgeSequenceNumber(), sequence);
    start();
    EXPECT_EQ(count(), 2U);
    EXPECT_EQ(registry().knowledgeUUID(), knowledge);

    stop();
    fs::remove_all(byPath);
    start();
    EXPECT_EQ(count(), 1U);
    EXPECT_NE(registry().knowledgeUUID(), knowledge);
    settle();
    writeManifest(byPath, plugInInfo("tool"));
    EXPECT_EQ(settle(), Notices{"+tool"}) << "a registration outlives its bundle";
    EXPECT_EQ(uuidAt(byPath), tool);
}

TEST_F(RegistryOnDisk, FirstAnswerKnowsWhatChangedWhileStopped) {
    const auto info = [](const char* version) { return plugInInfo("a", {}, {{"VBBundleVersion", version}}); };
    const std::string moved = applications + "/Two.app";
    UUID uuid;
    const auto one = [&](const std::vector<PlugInProxyRef>& proxies) {
        const auto found = std::ranges::find(proxies, "a", [](const auto& proxy) { return *proxy->plugInIdentifier; });
        return found == proxies.end() ? PlugInProxyRef() : *found;
    };
    const auto all = [](const auto&, const auto&) { return true; };
    const auto place = [&] { return fs::exists(moved) ? moved : app; };
    // Each is the first question after a start.
    const std::vector<std::function<PlugInProxyRef()>> questions{
        [&] { return registry().plugInForUUID(uuid); }, [&] { return at(place() + "/PlugIns/a.appex"); },
        [&] { return one(*registry().installedPlugIns()); },
        [&] { return one(*registry().plugInsMatching({{"VKExtensionIdentifier", "a"}}, all)); },
        [&] {
            const auto around = registry().applicationForURL(URL::file(place()));
            return around ? one(registry().plugInsOfApplication(*around)) : nullptr;
        }};
    struct Change {
        std::string what;
        std::function<void()> make;
        std::string answer; // the version of "a" that is found
    };
    const std::vector<Change> changes{
        {"nothing", [] {}, "1"},
        {"deleted", [&] { fs::remove_all(plugIn); }, "none"},
        {"without manifest", [&] { fs::remove(plugIn + "/Info.vlist"); }, "none"},
        {"application deleted", [&] { fs::remove_all(app); }, "none"},
        {"edited in place", [&] { writeManifest(plugIn, info("2")); }, "2"},
        {"application moved", [&] { fs::rename(app, moved); }, "1"},
        {"replaced", [&] { fs::rename(plugIn, scratch / "old"), writeManifest(plugIn, info("3")); }, "3"},
        {"behind a link", [&] { fs::rename(app, scratch / "x"), fs::create_symlink(scratch / "x", app); }, "none"}};
    for (const auto& [what, make, answer] : changes) {
        for (std::size_t i = 0; i < questions.size(); ++i) {
            SCOPED_TRACE(what + ", question " + std::to_string(i));
            for (const auto& leftover : {app, moved, scratch / "old", scratch / "x"}) fs::remove_all(leftover);
            writeApplication(app, {"b"});
            writeManifest(plugIn, info("1"));
            start();
            settle();
            uuid = uuidAt(plugIn);
            // Some find files that can be believed, the others files that changed a moment before.
            i == 1 || i == 4 ? stop() : stopOnceFilesAreOld();
            make();
            start();
            const auto found = questions[i]();
            EXPECT_EQ(found ? found->bundleVersion : "none", answer);
            EXPECT_TRUE(!found || fs::exists(found->bundleURL->path()));
        }
    }
}

TEST_F(RegistryOnDisk, FirstQueryKnowsWhatBecameAPlugInWhileStopped) {
    const std::string otherKind = app + "/PlugIns/other.appex";
    const std::string two = applications + "/folder/Two.app";
    const std::string unusable = applications + "/Unusable.app";
    const std::string system = scratch / "System/Library/PlugIns/a.plugin";
    const std::string byPath = scratch / "work/a.plugin";
    const auto info = plugInInfo("a");
    struct Change {
        std::string what;
        std::function<void()> make;
    };
    const std::vector<Change> changes{
        {"another plug-in", [&] { writeManifest(app + "/PlugIns/b.appex", info); }},
        {"a bundle of another kind", [&] { writeManifest(otherKind, info); }},
        {"a new one in an application", [&] { writeManifest(plugIn, info); }},
        {"the first one in an application", [&] { writeManifest(two + "/PlugIns/a.appex", info); }},
        {"one in an application that was unusable", [&] { writeManifest(unusable, Dictionary()); }},
        {"one with its application", [&] { writeApplication(applications + "/folder/deep/New.app", {"a"}); }},
        {"one outside applications", [&] { writeManifest(system, info); }},
        {"one that is registered", [&] { writeManifest(byPath, info); }},
        {"another folder", [&] { fs::rename(applications, scratch / "x"), writeApplication(app, {"a"}); }}};
    for (const auto& [what, make] : changes) {
        SCOPED_TRACE(what);
        for (const auto& leftover : {"Applications", "System", "x", "work"}) fs::remove_all(scratch / leftover);
        writeApplication(app, {"b"});
        writeManifest(otherKind, Dictionary{{"VBBundleIdentifier", "no plug-in"}});
        writeApplication(two);
        writeApplication(unusable, {"a"});
        writeFile(unusable + "/Info.vlist", "nonsense");
        if (what == "one that is registered") {
            start();
            writeManifest(byPath, plugInInfo("b"));
            ASSERT_TRUE(registry().registerPlugIn(URL::file(byPath)));
        }
        stopOnceFilesAreOld();
        make();
        start();
        const auto found =
            registry().plugInsMatching({{"VKExtensionIdentifier", "a"}}, [](const auto&, const auto&) { return true; });
        EXPECT_EQ(found->size(), 1U);
        settle();
        writeManifest(app + "/PlugIns/late.appex", plugInInfo("late"));
        EXPECT_EQ(settle(), Notices{"+late"}) << "it is watched";
    }
}

TEST_F(RegistryOnDisk, RegistrationByPath) {
    start();
    const std::string outside = scratch / "work/Dev.app/deep/tool.plugin";
    EXPECT_FALSE(registry().registerPlugIn(URL::file(outside)));
    writeManifest(outside, Dictionary{{"VBBundleIdentifier", "no plug-in"}});
    EXPECT_FALSE(registry().registerPlugIn(URL::file(outside)));
    writeFile(outside + "/Info.vlist", "nonsense");
    EXPECT_FALSE(registry().registerPlugIn(URL::file(outside)));
    writeManifest(outside, plugInInfo("tool"));
    EXPECT_EQ(settle(), Notices{}) << "nobody registered it";

    fs::create_directory_symlink(scratch / "work", scratch / "link");
    for (const char* other : {"link/Dev.app/deep/tool.plugin", "work/../work/Dev.app/deep/tool.plugin"})
        EXPECT_FALSE(registry().registerPlugIn(URL::file(scratch / other))) << other;
    EXPECT_TRUE(registry().registerPlugIn(URL::file(outside)));
    EXPECT_EQ(observer->take(), Notices{"+tool"});
    EXPECT_TRUE(registry().registerPlugIn(URL::file(outside))) << "again";
    EXPECT_EQ(observer->take(), Notices{});
    EXPECT_EQ(at(scratch / "link/Dev.app/deep/tool.plugin"), nullptr) << "whoever asks resolves links";
    ASSERT_NE(at(outside), nullptr);
    EXPECT_EQ(at(outside)->containingBundle, nullptr) << "no manifest, no application";
    writeApplication(scratch / "work/Dev.app");
    EXPECT_EQ(settle(), Notices{});
    ASSERT_NE(at(outside)->containingBundle, nullptr);
    EXPECT_EQ(at(outside)->containingBundle->bundleURL.path(), scratch / "work/Dev.app");
    EXPECT_NE(registry().applicationForURL(URL::file(scratch / "work/Dev.app")), nullptr);

    fs::rename(scratch / "work", scratch / "away");
    EXPECT_EQ(settle(), Notices{"-tool"}) << "a directory far above went";
    EXPECT_EQ(registry().applicationForURL(URL::file(scratch / "work/Dev.app")), nullptr);
    fs::rename(scratch / "away", scratch / "work");
    EXPECT_EQ(settle(), Notices{"+tool"});
    EXPECT_TRUE(registry().unregisterPlugIn(URL::file(outside)));
    EXPECT_EQ(observer->take(), Notices{"-tool"});
    EXPECT_FALSE(registry().unregisterPlugIn(URL::file(outside)));
}

TEST_F(RegistryOnDisk, MayRegisterWhoMayReadTheManifest) {
    if (geteuid() != 0) GTEST_SKIP() << "for root's daemon";
    start();
    const std::string bundle = scratch / "work/tool.plugin";
    const std::string manifest = bundle + "/Info.vlist";
    writeManifest(bundle, plugInInfo("tool"));
    ASSERT_EQ(chmod(scratch.path().c_str(), 0711), 0);
    fs::create_directory_symlink(bundle, scratch / "link");
    const auto may = [&](uid_t user, const std::string& name = "work/tool.plugin") {
        const auto process = linux_::LinuxPeerProcess::look(getpid());
        return registry().mayRegister(URL::file(scratch / name), {getpid(), user, user, process});
    };
    constexpr uid_t other = 65534;
    EXPECT_TRUE(may(other));
    EXPECT_FALSE(may(other, "link"));
    ASSERT_EQ(chmod(bundle.c_str(), 0711), 0);
    EXPECT_TRUE(may(other)) << "to list the directory is another right";
    ASSERT_EQ(chmod(manifest.c_str(), 0600), 0);
    EXPECT_FALSE(may(other));
    EXPECT_TRUE(may(0)) << "root's own rights again";
    ASSERT_EQ(chmod(manifest.c_str(), 0644), 0);
    ASSERT_EQ(chmod((scratch / "work").c_str(), 0700), 0);
    EXPECT_FALSE(may(other));
    EXPECT_FALSE(registry().mayRegister(URL::file(bundle), {getpid(), other, other, nullptr})) << "groups unknown";
}

TEST_F(RegistryOnDisk, UnregisteredStaysAwayUntilRegisteredOrReplaced) {
    writeApplication(app, {"a"});
    start();
    ASSERT_TRUE(registry().unregisterPlugIn(URL::file(plugIn)));
    EXPECT_EQ(observer->take(), Notices{"-a"});
    writeManifest(plugIn, plugInInfo("a", {{"key", "value"}}));
    EXPECT_EQ(settle(), Notices{}) << "changed in place";
    start();
    EXPECT_EQ(at(plugIn), nullptr) << "restarted";
    ASSERT_TRUE(registry().registerPlugIn(URL::file(plugIn)));
    EXPECT_EQ(observer->take(), Notices{"+a"});
    ASSERT_TRUE(registry().unregisterPlugIn(URL::file(plugIn)));
    observer->take();
    fs::rename(plugIn, scratch / "old");
    writeManifest(plugIn, plugInInfo("a"));
    EXPECT_EQ(settle(), Notices{"+a"}) << "replaced";
}

TEST_F(RegistryOnDisk, UnusableBundlesAreLeftOut) {
    writeApplication(app, {"good"});
    const auto bad = [&](const char* name) { return app + "/PlugIns/" + name + "/Info.vlist"; };
    writeFile(bad("text"), "not a property list");
    writeFile(bad("array"), *encodeXML(Array{"VKExtension"}));
    writeFile(bad("empty"), "");
    writeFile(bad("large"), *encodeXML(plugInInfo("large")));
    fs::resize_file(bad("large"), 100U << 20U);
    writeManifest(app + "/PlugIns/slash", plugInInfo("../../escape"));
    writeManifest(app + "/PlugIns/other", Dictionary{{"VKExtension", "no dictionary"}});
    fs::create_directories(app + "/PlugIns/pipe");
    ASSERT_EQ(mkfifo(bad("pipe").c_str(), 0600), 0);
    fs::create_directories(bad("directory"));
    writeManifest(scratch / "outside", plugInInfo("outside"));
    fs::create_directory_symlink(scratch / "outside", app + "/PlugIns/link");
    fs::create_directories(app + "/PlugIns/linked");
    fs::create_symlink(scratch / "outside/Info.vlist", bad("linked"));
    writeApplication(scratch / "Outside.app", {"far"});
    fs::create_directory_symlink(scratch / "Outside.app", applications + "/Link.app");
    fs::create_directory_symlink(applications, applications + "/loop");
    writeManifest(applications + "/NoManifest.app/PlugIns/x.appex", plugInInfo("x"));
    writeApplication(applications + "/1/2/3/4/Deep.app", {"deep"});
    writeApplication(applications + "/1/2/3/4/5/TooDeep.app", {"tooDeep"});
    writeApplication(applications + "/.Copying.app", {"copying"});
    start();
    std::set<std::string> found;
    const auto installed = registry().installedPlugIns();
    for (const auto& proxy : *installed) found.insert(*proxy->plugInIdentifier);
    EXPECT_EQ(found, (std::set<std::string>{"good", "deep"}));

    // The same when they come one by one.
    fs::rename(applications + "/.Copying.app", applications + "/Copied.app");
    writeManifest(app + "/PlugIns/text", plugInInfo("text"));
    fs::remove(bad("large"));
    EXPECT_EQ(settle(), (Notices{"+copying", "+text"}));
    writeFile(bad("text"), "broken again");
    EXPECT_EQ(settle(), Notices{"-text"});

    // The bytes of padding decide; the limit itself is allowed.
    const std::string text = *encodeXML(plugInInfo("text"));
    for (const bool isTooLarge : {false, true}) {
        writeFile(bad("text"), text + std::string((1U << 20U) - text.size() + isTooLarge, '\n'));
        EXPECT_EQ(settle(), isTooLarge ? Notices{"-text"} : Notices{"+text"});
    }
}

TEST_F(RegistryOnDisk, NamesFollowTheLanguages) {
    writeApplication(app, {"a"}, {{"VBBundleName", "App"}});
    writeManifest(plugIn, plugInInfo("a", {}, {{"VBBundleName", "Short"}, {"VBBundleDisplayName", "Long"}}));
    const auto table = [&](const std::string& name, const Dictionary& strings) {
        writeFile(plugIn + "/Resources/" + name + ".vlist", *encodeXML(strings));
    };
    table("pt/InfoVlist", {{"VBBundleDisplayName", "Comprido"}, {"VBBundleName", "Curto"}});
    table("pt-BR/InfoVlist", {{"VBBundleName", "Curtinho"}, {"VBBundleDisplayName", 5}});
    table("pt/Localizable", {{"open", "Abrir"}, {"close", "Fechar"}});
    table("en/Localizable", {{"open", "Open"}, {"help", "Help"}});
    writeFile(app + "/Resources/de/InfoVlist.vlist", *encodeXML(Dictionary{{"VBBundleName", "Anwendung"}}));
    start();
    struct Case {
        std::vector<std::string> languages;
        std::string name, shortName, containing, open;
    };
    for (const auto& [languages, name, shortName, containing, open] : std::vector<Case>{
             {{"pt-BR", "en"}, "Comprido", "Curtinho", "App", "Abrir"},
             {{"pt", "en"}, "Comprido", "Curto", "App", "Abrir"},
             {{"de-AT", "en"}, "Long", "Short", "Anwendung", "Open"},
             {{"en"}, "Long", "Short", "App", "Open"},
             {{"../../pt", "en"}, "Long", "Short", "App", "Open"},
         }) {
        locale.setLanguages(languages);
        const auto proxy = at(plugIn);
        EXPECT_EQ(proxy->localizedName, name) << languages[0];
        EXPECT_EQ(proxy->localizedShortName, shortName) << languages[0];
        EXPECT_EQ(proxy->containingBundle->localizedName, containing) << languages[0];
        EXPECT_EQ(registry().localizedStrings(*proxy, {"open"}, "Localizable")["open"], open) << languages[0];
        EXPECT_TRUE(registry().localizedStrings(*proxy, {"open"}, "../pt/Localizable").empty());
    }
    EXPECT_EQ(at(plugIn), at(plugIn)) << "made once per language";
}

TEST_F(RegistryOnDisk, ContainersAreMadeForPlugInsWithCode) {
    writeApplication(app, {"a"});
    writeManifest(app + "/PlugIns/code.appex",
                  Dictionary{{"VBBundleIdentifier", "code"}, {"VKExtension", Dictionary()}});
    writeManifest(app + "/PlugIns/old", Dictionary{{"Zembra", Dictionary{{"VKExtensionIdentifier", "old"}}}});
    start();
    EXPECT_FALSE(at(plugIn)->dataContainerURL);
    for (const char* name : {"code.appex", "old"}) {
        const auto container = at(app + "/PlugIns/" + name)->dataContainerURL;
        ASSERT_TRUE(container) << name;
        EXPECT_TRUE(fs::is_directory(container->path())) << name;
    }
    EXPECT_EQ(at(app + "/PlugIns/old")->plugInIdentifier, "old");
    EXPECT_TRUE(at(app + "/PlugIns/old")->plugInDictionary);
}

TEST_F(RegistryOnDisk, ContainersOfRewrittenIdentifiersDoNotPileUp) {
    const auto write = [&](const std::string& bundle, const std::string& identifier) {
        writeManifest(app + "/PlugIns/" + bundle,
                      Dictionary{{"VBBundleIdentifier", identifier}, {"VKExtension", Dictionary()}});
    };
    const auto containers = [&] {
        const fs::path folder = linux_::Root(scratch.path()).users() + "/" + std::to_string(geteuid()) + "/Containers";
        Notices names;
        if (fs::exists(folder))
            for (const auto& entry : fs::directory_iterator(folder)) names.push_back(entry.path().filename());
        std::ranges::sort(names);
        return names;
    };
    writeApplication(app);
    start();
    write("a.appex", "first");
    write("b.appex", "shared");
    write("c.appex", "shared");
    EXPECT_EQ(settle().size(), 3U);
    EXPECT_EQ(containers(), Notices{}) << "nobody asked for them";
    for (const char* identifier : {"second", "third", "used"}) {
        EXPECT_EQ(count(), 3U);
        write("a.appex", identifier);
        settle();
        EXPECT_EQ(containers(), Notices{"shared"}) << identifier;
    }
    fs::create_directory(at(app + "/PlugIns/a.appex")->dataContainerURL->path() + "/data");
    fs::remove_all(app + "/PlugIns/a.appex");
    fs::remove_all(app + "/PlugIns/b.appex");
    settle();
    EXPECT_EQ(containers(), (Notices{"shared", "used"})) << "another one's, and what is not empty, stay";
    fs::remove_all(app);
    settle();
    EXPECT_EQ(containers(), Notices{"used"});
}

TEST_F(RegistryOnDisk, DamagedDatabaseIsMovedAside) {
    const std::string file = scratch / "var/db/Catalix.sqlite";
    writeApplication(app, {"a"});
    for (const std::uintmax_t soundBytes : {0, 4096}) {
        start();
        EXPECT_EQ(count(), 1U);
        stop();
        const auto size = fs::file_size(file);
        fs::resize_file(file, soundBytes);
        std::ofstream(file, std::ios::binary | std::ios::app) << std::string(size - soundBytes, 'x');
        fs::remove(file + "-wal");
        start();
        EXPECT_EQ(count(), 1U);
        EXPECT_TRUE(fs::exists(file + ".damaged")) << soundBytes;
        const UUID uuid = uuidAt(plugIn);
        start();
        EXPECT_EQ(uuidAt(plugIn), uuid) << "the new one keeps";
        fs::remove(file + ".damaged");
    }
    stop();
    fs::remove(file);
    fs::create_directories(file + "/in the way");
    start();
    EXPECT_EQ(count(), 1U) << "without any database";
    writeApplication(applications + "/Two.app", {"b"});
    EXPECT_EQ(settle(), Notices{"+b"});
}

/// Where making ten thousand files and directories takes no minute.
class RegistryUnderLoad : public RegistryOnDisk {
protected:
    RegistryUnderLoad() : RegistryOnDisk(access("/dev/shm", W_OK) == 0 ? "/dev/shm" : "/tmp") {}
};

TEST_F(RegistryUnderLoad, ThousandsAtOnceAreEachToldOnce) {
    constexpr int many = 2000;
    // More events than the kernel keeps, while nobody reads them.
    int queue = 0;
    std::ifstream("/proc/sys/fs/inotify/max_queued_events") >> queue;
    if (queue > 100'000) GTEST_SKIP() << "the kernel's queue is too long to fill";
    const auto path = [&](int i) { return applications + "/" + std::to_string(i) + ".app"; };
    const auto overflow = [&] {
        // Equal events in a row count as one, so they take turns.
        const std::string files[] = {applications + "/noise", applications + "/more noise"};
        for (const auto& file : files) writeFile(file, "noise");
        for (int i = 0; i < queue + 100; ++i) ASSERT_EQ(chmod(files[i % 2].c_str(), 0600), 0);
    };
    const auto holdInNotice = [&](const std::string& name, bool isInstall) {
        observer->hold();
        if (isInstall)
            writeApplication(applications + "/" + name, {"held"});
        else
            fs::remove_all(applications + "/" + name);
        observer->waitUntilHeld();
        overflow();
    };
    start();
    holdInNotice("Held.app", true);
    for (int i = 0; i < many; ++i) writeApplication(path(i), {std::to_string(i)});
    observer->release();
    registry().settle();
    auto counts = observer->counts();
    EXPECT_EQ(counts.size(), many + 1U);
    for (const auto& [notice, times] : counts) EXPECT_EQ(times, 1) << notice;
    EXPECT_EQ(count(), many + 1U);

    holdInNotice("Held.app", false);
    for (int i = 0; i < many; i += 2) fs::remove_all(path(i));
    observer->release();
    registry().settle();
    counts = observer->counts();
    EXPECT_EQ(counts.size(), many / 2 + 1U);
    for (const auto& [notice, times] : counts) EXPECT_EQ(times, 1) << notice;
    EXPECT_EQ(count(), many / 2U);

    // And without overflow, while the registry keeps reading and others keep asking.
    const std::jthread reader([&](const std::stop_token& stop) {
        while (!stop.stop_requested()) {
            const auto found = registry().plugInsMatching({{"VKExtensionIdentifier", "1"}},
                                                          [](const auto&, const auto&) { return true; });
            EXPECT_LE(found->size(), 1U);
            EXPECT_LE(count(), many);
        }
    });
    for (int i = 1; i < many; i += 2) fs::rename(path(i), path(i - 1));
    registry().settle();
    counts = observer->counts();
    EXPECT_EQ(counts.size(), many);
    for (const auto& [notice, times] : counts) EXPECT_EQ(times, 1) << notice;
}

TEST_F(RegistryOnDisk, UnwatchedBundlesAreVerifiedWhenSomebodyAsks) {
    start({.watches = 2});
    writeApplication(app, {"a"});
    EXPECT_EQ(settle(), Notices{"+a"});
    observer->hold();
    writeManifest(app + "/PlugIns/b.appex", plugInInfo("b"));
    (void)count();
    observer->waitUntilHeld();
    observer->release();
    EXPECT_EQ(settle(), Notices{"+b"});
    fs::remove_all(plugIn);
    EXPECT_EQ(settle(), Notices{"-a"});
}

TEST_F(RegistryOnDisk, NothingGoesForWantOfDescriptors) {
    if (support::checkerNeedsDescriptors) GTEST_SKIP() << "the checker needs descriptors itself";
    writeApplication(app, {"a"});
    start();
    rlimit before{};
    ASSERT_EQ(getrlimit(RLIMIT_NOFILE, &before), 0);
    const rlimit none{0, before.rlim_max};
    ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &none), 0);
    ASSERT_EQ(utimensat(AT_FDCWD, (plugIn + "/Info.vlist").c_str(), nullptr, 0), 0); // an event
    const auto notices = settle();
    const auto installed = count();
    ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &before), 0);
    EXPECT_EQ(notices, Notices{});
    EXPECT_EQ(installed, 1U);
    fs::remove_all(plugIn);
    EXPECT_EQ(settle(), Notices{"-a"});
}

} // namespace
