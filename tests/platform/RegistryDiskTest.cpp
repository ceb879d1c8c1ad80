#include "platform/linux/BundleScanner.h"
#include "platform/linux/Containers.h"
#include "platform/linux/DirectoryFiles.h"
#include "platform/linux/Entitlements.h"
#include "platform/linux/PeerProcess.h"
#include "platform/linux/Registry.h"
#include "platform/linux/RegistryStore.h"
#include "tests/support/BundleTree.h"
#include "tests/support/LocaleFake.h"
#include "tests/support/Sanitizers.h"
#include "tests/support/ScratchDirectory.h"
#include "tests/support/SystemLogFake.h"

#include <algorithm>
#include <fcntl.h>
#include <future>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <thread>
#include <unistd.h>

// What happens on disk, and what the registry makes of it.

namespace {

using namespace platform;
using namespace support;
using Proxies = std::vector<PlugInProxyRef>;
using Action = std::function<void()>;
namespace fs = std::filesystem;

/// Keeps the notices, each as a sign and an identifier: + for what came, - for what went, ~ for what changed in place
/// and so is found all the time.
class Observer final : public RegistryObserver {
public:
    void pluginsDidInstall(const Proxies& proxies) override { add("+", proxies); }
    void pluginsWillUninstall(const Proxies& proxies) override {
        add(registry->plugInForUUID(*proxies.front()->uuid) != nullptr ? "~" : "-", proxies);
    }
    std::vector<std::string> take() {
        const std::lock_guard lock(_mutex);
        return std::exchange(_notices, {});
    }
    /// Runs once, on the registry's thread.
    void inNextNotice(Action action) {
        const std::lock_guard lock(_mutex);
        _action = std::move(action);
    }

    Registry* registry = nullptr;

private:
    void add(const std::string& sign, const Proxies& proxies) {
        std::unique_lock lock(_mutex);
        for (const auto& proxy : proxies) _notices.push_back(sign + *proxy->plugInIdentifier);
        const auto action = std::exchange(_action, nullptr);
        lock.unlock();
        if (action) action();
    }

    std::mutex _mutex;
    std::vector<std::string> _notices;
    Action _action;
};

class RegistryOnDisk : public testing::Test {
protected:
    explicit RegistryOnDisk(const std::string& place = "/tmp") : scratch(place) {
        fs::create_directories(applications);
    }

    void start(linux_::RegistryLimits limits = {}) {
        registry.reset();
        registry.emplace(linux_::Root(scratch.path()), locale, containers, limits);
        observer->registry = &*registry;
        registry->addObserver(observer);
    }
    /// Stops a registry that knows everything. One that is to take the files of plug-ins for unchanged at its next
    /// start does not as long as another change could have the same time; then it is started again, and looks again.
    void stop(bool onceFilesAreOld) {
        const auto latest = std::chrono::steady_clock::now() + std::chrono::seconds(30);
        for (bool areOld = false; !areOld;) {
            ASSERT_LT(std::chrono::steady_clock::now(), latest);
            start();
            settle();
            knowledge = registry->knowledgeUUID();
            registry.reset();
            linux_::SharedStrings strings;
            std::optional<std::string> problem;
            const auto known = linux_::RegistryStore(database, strings).open(problem).plugIns;
            areOld = !onceFilesAreOld || std::ranges::all_of(known, [](const auto& one) {
                return linux_::BundleScanner::isUnchanged(one.first, linux_::BundleKind::plugIn, *one.second->facts);
            });
        }
    }
    /// The notices since the last call.
    std::string told() {
        std::string told;
        for (const auto& notice : observer->take()) told += (told.empty() ? "" : " ") + notice;
        return told;
    }
    std::string settle() {
        registry->settle();
        return told();
    }
    // These answer the notices of what they do.
    std::string move(const std::string& from, const std::string& to) {
        fs::rename(from, to);
        return settle();
    }
    std::string erase(const std::string& path) {
        fs::remove_all(path);
        return settle();
    }
    std::string write(const std::string& bundle, const Value& manifest) {
        writeManifest(bundle, manifest);
        return settle();
    }
    std::string add(const std::string& path) {
        return registry->registerPlugIn(URL::file(path)) ? told() : "refused " + settle();
    }
    std::string drop(const std::string& path) {
        return registry->unregisterPlugIn(URL::file(path)) ? told() : "refused " + settle();
    }
    PlugInProxyRef at(const std::string& path) { return registry->plugInForURL(URL::file(path)); }
    Proxies matching(const char* identifier) {
        return *registry->plugInsMatching({{"VKExtensionIdentifier", identifier}}, [](auto&, auto&) { return true; });
    }
    UUID uuidAt(const std::string& path) { return at(path) ? *at(path)->uuid : UUID{}; }
    /// What shows of a plug-in's content: its version, its name, its application's name and its entitlements.
    static std::string contentOf(const PlugInProxyRef& proxy) {
        const auto& around = proxy->containingBundle;
        return proxy->bundleVersion.value_or("") + proxy->localizedShortName.value_or("") +
               (around ? around->localizedName.value_or("") : "") + (proxy->entitlements ? "!" : "");
    }
    std::size_t count() { return registry->installedPlugIns()->size(); }
    std::string inApp(const std::string& name) const { return app + "/PlugIns/" + name; }

    ScratchDirectory scratch;
    const std::string database = scratch / "var/db/Catalix.sqlite";
    const std::string applications = scratch / "Applications";
    const std::string app = applications + "/One.app";
    const std::string plugIn = inApp("a.appex");
    FakeLocale locale;
    linux_::Containers containers{linux_::Root(scratch.path())};
    const std::shared_ptr<Observer> observer = std::make_shared<Observer>();
    std::optional<linux_::Registry> registry;
    std::optional<UUID> knowledge; // what a test saw last
};

TEST_F(RegistryOnDisk, ChangesOfPlaceAreToldOnceAndTheUUIDGoesAlong) {
    const std::string two = applications + "/Two.app";
    const std::string away = scratch / "away.app";
    start();
    EXPECT_EQ(settle(), "");
    writeApplication(app, {"a", "b"});
    EXPECT_EQ(settle(), "+a +b");
    const UUID uuid = uuidAt(plugIn);
    EXPECT_EQ(move(app, two), "-a -b +a +b");
    EXPECT_EQ(at(plugIn), nullptr);
    EXPECT_EQ(uuidAt(two + "/PlugIns/a.appex"), uuid);
    EXPECT_EQ(erase(two + "/PlugIns/b.appex"), "-b");
    EXPECT_EQ(move(two, away), "-a");
    EXPECT_EQ(move(away, app), "+a");
    EXPECT_EQ(uuidAt(plugIn), uuid);
    for (const std::string identifier : {"a", "other"}) {
        writeApplication(away);
        writeManifest(away + "/PlugIns/a.appex", plugInInfo(identifier));
        fs::remove_all(app);
        EXPECT_EQ(move(away, app), "-a +" + identifier) << "another bundle at its place";
        EXPECT_EQ(uuidAt(plugIn) == uuid, identifier == "a");
        EXPECT_EQ(at(plugIn)->originalIdentifier, identifier);
    }
    writeApplication(scratch / "1/2/New.app", {"n"});
    EXPECT_EQ(move(scratch / "1", applications + "/1"), "+n");
    EXPECT_EQ(move(applications, away), "-n -other");
    writeApplication(app, {"a"});
    EXPECT_EQ(settle(), "+a");
}

TEST_F(RegistryOnDisk, ChangeInPlaceKeepsTheUUIDAndIsToldWhenAnythingShows) {
    const auto info = [](const char* version, const char* executable = "program") {
        return plugInInfo("a", {}, {{"VBBundleExecutable", executable}, {"VBBundleVersion", version}});
    };
    const auto entitle = [](const std::string& program) {
        writeFile(program, "code");
        EXPECT_FALSE(linux_::writeEntitlements(program, Dictionary{{"any", true}}));
    };
    writeApplication(app);
    writeManifest(plugIn, info("1"));
    start();
    const auto before = at(plugIn);
    knowledge = registry->knowledgeUUID();
    const auto expect = [&](const std::string& told, const std::string& content, bool isChange) {
        EXPECT_EQ(settle(), told) << content;
        EXPECT_EQ(registry->knowledgeUUID() != std::exchange(knowledge, registry->knowledgeUUID()), isChange);
        EXPECT_EQ(contentOf(at(plugIn)), content);
        EXPECT_EQ(uuidAt(plugIn), before->uuid) << content;
        EXPECT_EQ(at(plugIn)->registrationDate, before->registrationDate) << content;
    };
    writeManifest(plugIn, info("2"));
    expect("~a +a", "2", true);
    for (const char* name : {"/program", "/notes"}) writeFile(plugIn + name, "text");
    writeManifest(plugIn, info("2"));
    expect("", "2", false);
    writeFile(plugIn + "/Resources/en/InfoVlist.vlist", *encodeXML(Dictionary{{"VBBundleName", "Name"}}));
    expect("~a +a", "2Name", true);
    entitle(plugIn + "/program");
    expect("~a +a", "2Name!", true);
    writeManifest(app, Dictionary{{"VBBundleIsPlaceholder", true}, {"VBBundleName", "One"}});
    expect("", "2NameOne!", true);
    EXPECT_TRUE(at(plugIn)->containingBundle->isPlaceholder);
    EXPECT_EQ(at(plugIn)->entitlements, (Dictionary{{"any", true}}));

    entitle(app + "/program");
    fs::create_symlink(app + "/program", plugIn + "/link");
    for (const char* elsewhere : {"../../program", "link", "..", ""}) {
        writeManifest(plugIn, info("2", elsewhere));
        expect("~a +a", "2NameOne", true);
    }
    EXPECT_EQ(write(plugIn, plugInInfo("renamed")), "-a +renamed");
    EXPECT_EQ(uuidAt(plugIn), before->uuid);
    EXPECT_EQ(at(plugIn)->originalIdentifier, "a");
}

TEST_F(RegistryOnDisk, StatePersists) {
    writeApplication(app, {"a"});
    const std::string byPath = scratch / "work/tool.plugin";
    writeManifest(byPath, plugInInfo("tool"));
    start();
    add(byPath);
    const UUID uuid = uuidAt(plugIn);
    const UUID tool = uuidAt(byPath);
    write(plugIn, plugInInfo("renamed"));
    knowledge = registry->knowledgeUUID();
    const auto sequence = registry->knowledgeSequenceNumber();
    start();
    EXPECT_EQ(settle(), "");
    EXPECT_EQ(registry->knowledgeUUID(), knowledge);
    EXPECT_EQ(registry->knowledgeSequenceNumber(), sequence);
    EXPECT_EQ(uuidAt(plugIn), uuid);
    EXPECT_EQ(at(plugIn)->originalIdentifier, "a");
    EXPECT_EQ(uuidAt(byPath), tool);

    registry.reset();
    fs::remove_all(byPath);
    start();
    EXPECT_EQ(count(), 1U);
    EXPECT_NE(registry->knowledgeUUID(), knowledge);
    settle();
    EXPECT_EQ(write(byPath, plugInInfo("tool")), "+tool") << "a registration outlives its bundle";
    EXPECT_EQ(uuidAt(byPath), tool);
}

TEST_F(RegistryOnDisk, FirstAnswerKnowsWhatChangedWhileStopped) {
    const std::string two = applications + "/folder/Two.app";
    const std::string inTwo = two + "/PlugIns/a.appex";
    const std::string byPath = scratch / "work/a.plugin";
    const std::string away = scratch / "away";
    const auto info = [](const char* version) {
        return plugInInfo("a", {}, {{"VBBundleExecutable", "run"}, {"VBBundleVersion", version}});
    };
    const auto name = [](const std::string& bundle, const char* text, const std::string& language = "en") {
        const std::string table = bundle + "/Resources/" + language + "/InfoVlist.vlist";
        writeFile(table, *encodeXML(Dictionary{{"VBBundleName", text}}));
    };
    const auto put = [&](const std::string& bundle) {
        writeManifest(bundle, info("1"));
        name(bundle, "N");
        writeFile(bundle + "/run", "code");
    };
    const auto editWithinItsTime = [&] {
        const auto time = fs::last_write_time(plugIn + "/Info.vlist");
        writeManifest(plugIn, info("2"));
        fs::last_write_time(plugIn + "/Info.vlist", time);
    };
    UUID uuid;
    const auto place = [&] { return fs::exists(two) ? two : app; };
    // Each is the first question after a start.
    const std::vector<std::function<Proxies()>> questions{
        [&] { return matching("a"); }, [&] { return Proxies{registry->plugInForUUID(uuid)}; },
        [&] { return Proxies{at(place() + "/PlugIns/a.appex")}; }, [&] { return *registry->installedPlugIns(); },
        [&] {
            const auto around = registry->applicationForURL(URL::file(place()));
            return around ? registry->plugInsOfApplication(*around) : Proxies();
        }};
    struct Change {
        std::string what;
        Action make;
        std::string answer; // the content that is found then
        Action before = {}; // without "a"; else "a" is known
    };
    const Action nothing = [] {};
    const std::vector<Change> changes{
        {"nothing", nothing, "1N"},
        {"deleted", [&] { fs::remove_all(plugIn); }, "none"},
        {"without manifest", [&] { fs::remove(plugIn + "/Info.vlist"); }, "none"},
        {"application deleted", [&] { fs::remove_all(app); }, "none"},
        {"application moved", [&] { fs::create_directories(two), fs::rename(app, two); }, "1N"},
        {"behind a link", [&] { fs::rename(app, away), fs::create_symlink(away, app); }, "none"},
        {"replaced", [&] { fs::rename(plugIn, away), writeManifest(plugIn, info("3")); }, "3"},
        {"edited", editWithinItsTime, "2N"},
        {"entitled", [&] { EXPECT_FALSE(linux_::writeEntitlements(plugIn + "/run", Dictionary{{"any", true}})); },
         "1N!"},
        {"renamed", [&] { name(plugIn, "M"); }, "1M"},
        {"named in another language", [&] { name(plugIn, "D", "de"); }, "1D"},
        {"without a name", [&] { fs::remove_all(plugIn + "/Resources"); }, "1"},
        {"application named", [&] { name(app, "App"); }, "1NApp"},
        {"new", [&] { put(plugIn); }, "1N", nothing},
        {"once of another kind", [&] { put(plugIn); }, "1N", [&] { writeManifest(plugIn, Dictionary()); }},
        {"first one in its application", [&] { put(inTwo); }, "1N", [&] { writeApplication(two); }},
        {"application once unusable", [&] { writeApplication(two); }, "1N",
         [&] { put(inTwo), writeFile(two + "/Info.vlist", "?"); }},
        {"new with its application", [&] { writeApplication(two), put(inTwo); }, "1N", nothing},
        {"outside applications", [&] { put(scratch / "System/Library/PlugIns/a.plugin"); }, "1N", nothing},
        {"another folder", [&] { fs::rename(applications, away), writeApplication(app), put(plugIn); }, "1N", nothing},
        {"once registered as another", [&] { put(byPath); }, "1N",
         [&] { start(), writeManifest(byPath, plugInInfo("b")), add(byPath); }}};
    locale.setLanguages({"de", "en"});
    for (const auto& [what, make, answer, before] : changes) {
        for (std::size_t i = 0; i < (before ? 1 : questions.size()); ++i) {
            SCOPED_TRACE(what + ", question " + std::to_string(i));
            for (const auto& leftover : {"Applications", "System", "away", "work"}) fs::remove_all(scratch / leftover);
            writeApplication(app, {"b"});
            before ? before() : put(plugIn);
            start();
            uuid = uuidAt(plugIn);
            // Some find files that can be believed, the others files that changed a moment before.
            stop(i != 2 && i != 4);
            make();
            start();
            std::string found = "none";
            for (const auto& proxy : questions[i]()) {
                if (!proxy || proxy->plugInIdentifier != "a") continue;
                EXPECT_TRUE(fs::exists(proxy->bundleURL->path()));
                found = contentOf(proxy);
            }
            EXPECT_EQ(found, answer);
            settle();
            EXPECT_EQ(registry->knowledgeUUID() == knowledge, what == "nothing");
            if (!before) continue;
            EXPECT_EQ(write(inApp("late.appex"), plugInInfo("late")), "+late") << "it is watched";
        }
    }
}

TEST_F(RegistryOnDisk, FilesThatChangedJustNowAreReadAgain) {
    linux_::SharedStrings strings;
    const linux_::BundleScanner scanner([](int, const std::string&) {}, strings);
    const auto latest = std::chrono::steady_clock::now() + std::chrono::seconds(30);
    // A busy machine may take longer for this than files stay recent, but not always.
    for (bool isBelieved = true; isBelieved;) {
        ASSERT_LT(std::chrono::steady_clock::now(), latest);
        writeManifest(plugIn, plugInInfo("a"));
        const auto directory = linux_::openDirectory(plugIn);
        const auto scanned = scanner.scan(directory.get(), plugIn, linux_::BundleKind::plugIn, nullptr);
        isBelieved = scanned.facts->evidence != 0;
    }
}

TEST_F(RegistryOnDisk, RegistrationByPath) {
    const std::string around = scratch / "work/Dev.app";
    const std::string outside = around + "/deep/tool.plugin";
    start();
    EXPECT_EQ(add(outside), "refused ");
    writeFile(outside + "/Info.vlist", "nonsense");
    EXPECT_EQ(add(outside), "refused ");
    writeManifest(outside, plugInInfo("tool"));
    fs::create_directory_symlink(scratch / "work", scratch / "link");
    for (const char* name : {"link/Dev.app/deep/tool.plugin", "work/../work/Dev.app/deep/tool.plugin"})
        EXPECT_EQ(add(scratch / name), "refused ") << name;
    EXPECT_EQ(add(outside), "+tool");
    EXPECT_EQ(add(outside), "");
    EXPECT_EQ(at(scratch / "link/Dev.app/deep/tool.plugin"), nullptr) << "whoever asks resolves links";
    EXPECT_EQ(at(outside)->containingBundle, nullptr) << "no manifest, no application";
    writeApplication(around);
    EXPECT_EQ(settle(), "");
    EXPECT_EQ(at(outside)->containingBundle, registry->applicationForURL(URL::file(around)));
    EXPECT_NE(at(outside)->containingBundle, nullptr);

    EXPECT_EQ(move(scratch / "work", scratch / "away"), "-tool") << "a directory far above went";
    EXPECT_EQ(registry->applicationForURL(URL::file(around)), nullptr);
    EXPECT_EQ(move(scratch / "away", scratch / "work"), "+tool");
    EXPECT_EQ(drop(outside), "-tool");
    EXPECT_EQ(drop(outside), "refused ");
}

TEST_F(RegistryOnDisk, MayRegisterWhoMayReadTheManifest) {
    if (geteuid() != 0) GTEST_SKIP() << "for root's daemon";
    const std::string bundle = scratch / "work/tool.plugin";
    writeManifest(bundle, plugInInfo("tool"));
    fs::create_directory_symlink(bundle, scratch / "link");
    for (const auto& path : {scratch.path(), bundle}) fs::permissions(path, fs::perms(0711));
    start();
    const auto process = linux_::LinuxPeerProcess::look(getpid());
    const auto may = [&](const std::string& path, uid_t user, auto peer) {
        return registry->mayRegister(URL::file(path), {getpid(), user, user, peer});
    };
    constexpr uid_t other = 65534;
    EXPECT_TRUE(may(bundle, other, process)) << "to list directories is another right";
    EXPECT_FALSE(may(scratch / "link", other, process));
    EXPECT_FALSE(may(bundle, other, decltype(process)())) << "groups unknown";
    fs::permissions(bundle + "/Info.vlist", fs::perms(0600));
    EXPECT_FALSE(may(bundle, other, process));
    EXPECT_TRUE(may(bundle, 0, process)) << "root's own rights again";
}

TEST_F(RegistryOnDisk, UnregisteredStaysAwayUntilRegisteredOrReplaced) {
    writeApplication(app, {"a"});
    start();
    EXPECT_EQ(drop(plugIn), "-a");
    EXPECT_EQ(write(plugIn, plugInInfo("a", {{"key", "value"}})), "") << "changed in place";
    start();
    EXPECT_EQ(at(plugIn), nullptr) << "restarted";
    EXPECT_EQ(add(plugIn), "+a");
    EXPECT_EQ(drop(plugIn), "-a");
    fs::rename(plugIn, scratch / "old");
    EXPECT_EQ(write(plugIn, plugInInfo("a")), "+a") << "replaced";
}

TEST_F(RegistryOnDisk, UnusableBundlesAreLeftOut) {
    const auto with = [](const Value& more) { return *encodeXML(plugInInfo("a", {}, {{"more", more}})); };
    // The manifest itself is one container, and its values are the others.
    Value deep = "core";
    for (std::size_t i = 1; i < maximumManifestNesting; ++i) deep = Array{deep};
    // Beside the array stand five values: identifier, plug-in dictionary, protocol, attributes and the array itself.
    const std::vector<Value> values(linux_::maximumManifestValues - 5, true);
    std::string largest = with(1);
    largest.resize(linux_::maximumManifestSize, '\n');
    const char* usable = "no reason";
    struct Manifest {
        std::string name, bytes, reason;
    };
    const std::vector<Manifest> manifests{
        {"good", with(1), usable},
        {"text", "not a property list", "Info.vlist: syntax error in line 1"},
        {"array", *encodeXML(Array{"VKExtension"}), "Info.vlist: not a dictionary"},
        {"deepest", with(deep), usable},
        {"too deep", with(Array{deep}), "Info.vlist: containers nested too deep in line 69"},
        {"fullest", with(Array(values)), usable},
        {"too full", with(Array{Array(values)}), "Info.vlist: more than 20000 values"},
        {"largest", largest, usable},
        {"too large", largest + "\n", "Info.vlist: larger than 1048576 bytes"},
        {"slash", *encodeXML(plugInInfo("../../escape")), "unusable identifier"},
        {"empty", "", ""},
        {"other", *encodeXML(Dictionary{{"VKExtension", "no dictionary"}}), ""}};
    writeApplication(app);
    for (const auto& [name, bytes, reason] : manifests) writeFile(inApp(name) + "/Info.vlist", bytes);
    for (const char* name : {"pipe", "linked", "directory/Info.vlist"}) fs::create_directories(inApp(name));
    ASSERT_EQ(mkfifo(inApp("pipe/Info.vlist").c_str(), 0600), 0);
    fs::create_symlink(inApp("good/Info.vlist"), inApp("linked/Info.vlist"));
    writeApplication(scratch / "Outside.app", {"far"});
    fs::create_directory_symlink(scratch / "Outside.app/PlugIns/far.appex", inApp("link"));
    fs::create_directory_symlink(scratch / "Outside.app", applications + "/Link.app");
    fs::create_directory_symlink(applications, applications + "/loop");
    writeManifest(applications + "/NoManifest.app/PlugIns/x.appex", plugInInfo("x"));
    writeApplication(applications + "/1/2/3/4/Deep.app", {"deep"});
    writeApplication(applications + "/1/2/3/4/5/TooDeep.app", {"tooDeep"});
    writeApplication(applications + "/.Copying.app", {"copying"});
    processLog.clear();
    start();
    EXPECT_EQ(count(), 5U) << "the usable ones and the deep one";
    EXPECT_NE(at(applications + "/1/2/3/4/Deep.app/PlugIns/deep.appex"), nullptr);
    for (const auto& [name, bytes, reason] : manifests) {
        const auto found = at(inApp(name));
        EXPECT_EQ(found != nullptr, reason == usable) << name;
        EXPECT_TRUE(!found || found->infoDictionary == decodePropertyList(bytes)->dictionary()) << name;
        const bool isLogged =
            processLog.contains(LogLevel::error, "cx", "ignoring bundle at " + inApp(name) + ": " + reason);
        EXPECT_EQ(isLogged, reason != usable && !reason.empty()) << name;
    }

    // The same when they come one by one.
    EXPECT_EQ(move(applications + "/.Copying.app", applications + "/Copied.app"), "+copying");
    EXPECT_EQ(erase(inApp("too large/Info.vlist")), "");
    EXPECT_EQ(write(inApp("text"), plugInInfo("text")), "+text");
    EXPECT_EQ(write(inApp("text"), "broken again"), "-text");
}

TEST_F(RegistryOnDisk, NamesFollowTheLanguages) {
    writeApplication(app, {}, {{"VBBundleName", "App"}});
    writeManifest(plugIn, plugInInfo("a", {}, {{"VBBundleName", "Short"}, {"VBBundleDisplayName", "Long"}}));
    const auto table = [](const std::string& bundle, const std::string& name, const Dictionary& strings) {
        writeFile(bundle + "/Resources/" + name + ".vlist", *encodeXML(strings));
    };
    table(plugIn, "pt/InfoVlist", {{"VBBundleDisplayName", "Comprido"}, {"VBBundleName", "Curto"}});
    table(plugIn, "pt-BR/InfoVlist", {{"VBBundleName", "Curtinho"}, {"VBBundleDisplayName", 5}});
    table(plugIn, "pt/Localizable", {{"open", "Abrir"}, {"close", "Fechar"}});
    table(plugIn, "en/Localizable", {{"open", "Open"}, {"help", "Help"}});
    table(app, "de/InfoVlist", {{"VBBundleName", "Anwendung"}});
    start();
    const std::string cases[][4] = {{"pt-BR", "CurtinhoApp", "Comprido", "Abrir"},
                                    {"pt", "CurtoApp", "Comprido", "Abrir"},
                                    {"de-AT", "ShortAnwendung", "Long", "Open"},
                                    {"en", "ShortApp", "Long", "Open"},
                                    {"../../pt", "ShortApp", "Long", "Open"}};
    for (const auto& [language, content, name, open] : cases) {
        locale.setLanguages({language, "en"});
        const auto proxy = at(plugIn);
        EXPECT_EQ(proxy, at(plugIn)) << "made once per language";
        registry->clearSchemaCaches();
        EXPECT_NE(proxy, at(plugIn));
        EXPECT_EQ(contentOf(proxy), content) << language;
        EXPECT_EQ(proxy->localizedName, name) << language;
        EXPECT_EQ(registry->localizedStrings(*proxy, {"open"}, "Localizable")["open"], open) << language;
        EXPECT_TRUE(registry->localizedStrings(*proxy, {"open"}, "../pt/Localizable").empty());
    }
}

TEST_F(RegistryOnDisk, ContainersAreMadeForPlugInsWithCodeAndDoNotPileUp) {
    using Names = std::set<std::string>;
    const auto writeCode = [&](const char* name, const char* identifier) {
        writeManifest(inApp(name), Dictionary{{"VBBundleIdentifier", identifier}, {"VKExtension", Dictionary()}});
    };
    const auto made = [&] {
        registry->settle();
        Names names;
        std::error_code none; // when there is no folder
        const std::string folder = scratch / "var/db/users/" + std::to_string(geteuid()) + "/Containers";
        for (const auto& entry : fs::directory_iterator(folder, none)) names.insert(entry.path().filename());
        return names;
    };
    writeApplication(app, {"data"});
    writeManifest(inApp("old"), Dictionary{{"Zembra", Dictionary{{"VKExtensionIdentifier", "old"}}}});
    for (const char* name : {"b.appex", "c.appex"}) writeCode(name, "shared");
    start();
    writeCode("a.appex", "first");
    EXPECT_EQ(made(), Names{}) << "nobody asked for them";
    for (const char* identifier : {"second", "third", "used"}) {
        EXPECT_EQ(count(), 5U);
        writeCode("a.appex", identifier);
        EXPECT_EQ(made(), (Names{"old", "shared"})) << identifier;
    }
    EXPECT_TRUE(at(inApp("old"))->plugInDictionary);
    EXPECT_FALSE(at(inApp("data.appex"))->dataContainerURL);
    fs::create_directory(at(plugIn)->dataContainerURL->path() + "/data");
    for (const auto& bundle : {plugIn, inApp("b.appex")}) fs::remove_all(bundle);
    EXPECT_EQ(made(), (Names{"old", "shared", "used"})) << "another one's, and what is not empty, stay";
    fs::remove_all(app);
    EXPECT_EQ(made(), Names{"used"});
}

TEST_F(RegistryOnDisk, DamagedDatabaseIsMovedAside) {
    writeApplication(app, {"a"});
    for (const std::uintmax_t soundBytes : {0U, 4096U}) {
        start();
        registry.reset();
        const auto size = fs::file_size(database);
        fs::resize_file(database, soundBytes);
        std::ofstream(database, std::ios::binary | std::ios::app) << std::string(size - soundBytes, 'x');
        fs::remove(database + "-wal");
        start();
        const UUID uuid = uuidAt(plugIn);
        EXPECT_NE(uuid, UUID{});
        EXPECT_TRUE(fs::remove(database + ".damaged")) << soundBytes;
        start();
        EXPECT_EQ(uuidAt(plugIn), uuid) << "the new one keeps";
    }
    registry.reset();
    fs::remove(database);
    fs::create_directories(database + "/in the way");
    start();
    EXPECT_EQ(count(), 1U) << "without any database";
    EXPECT_EQ(write(inApp("b.appex"), plugInInfo("b")), "+b");
}

/// Where making ten thousand files and directories takes no minute.
class RegistryUnderLoad : public RegistryOnDisk {
protected:
    RegistryUnderLoad() : RegistryOnDisk(access("/dev/shm", W_OK) == 0 ? "/dev/shm" : "/tmp") {}
};

TEST_F(RegistryUnderLoad, ThousandsAtOnceAreEachToldOnce) {
    constexpr int many = 2000;
    int queue = 0;
    std::ifstream("/proc/sys/fs/inotify/max_queued_events") >> queue;
    if (queue > 100'000) GTEST_SKIP() << "the kernel's queue is too long to fill";
    const auto path = [&](int i) { return applications + "/" + std::to_string(i) + ".app"; };
    const auto expectToldOnce = [&](std::size_t told, std::size_t left) {
        registry->settle();
        registry->settle(); // what happened inside a notice
        auto notices = observer->take();
        EXPECT_EQ(notices.size(), told);
        std::ranges::sort(notices);
        EXPECT_TRUE(std::ranges::adjacent_find(notices) == notices.end());
        EXPECT_EQ(count(), left);
    };
    start();
    writeApplication(path(0), {"0"});
    settle();
    // More events than the kernel keeps, while nobody reads them: the registry's thread is here.
    observer->inNextNotice([&] {
        // Equal events in a row count as one, so they take turns.
        const std::string files[] = {applications + "/noise", applications + "/more noise"};
        for (const auto& file : files) writeFile(file, "noise");
        for (int i = 0; i < queue + 100; ++i) fs::permissions(files[i % 2], fs::perms(0600));
        for (int i = 1; i < many; ++i) writeApplication(path(i), {std::to_string(i)});
        fs::remove_all(path(0));
    });
    writeApplication(app, {"held"});
    expectToldOnce(many + 1, many);

    // And without overflow, while the registry keeps reading and others keep asking.
    const std::jthread reader([&](const std::stop_token& stop) {
        while (!stop.stop_requested()) {
            EXPECT_LE(matching("1").size(), 1U);
            EXPECT_LE(count(), many);
        }
    });
    for (int i = 1; i < many; ++i) fs::rename(path(i), path(i + many));
    expectToldOnce(2 * (many - 1), many);
}

TEST_F(RegistryOnDisk, UnwatchedBundlesAreVerifiedWhenSomebodyAsks) {
    start({.watches = 2});
    writeApplication(app, {"a"});
    EXPECT_EQ(settle(), "+a");
    std::promise<void> noticed;
    observer->inNextNotice([&] { noticed.set_value(); });
    writeManifest(inApp("b.appex"), plugInInfo("b"));
    (void)count();
    EXPECT_EQ(noticed.get_future().wait_for(std::chrono::seconds(30)), std::future_status::ready);
    EXPECT_EQ(settle(), "+b");
    EXPECT_EQ(erase(plugIn), "-a");
}

TEST_F(RegistryOnDisk, NothingGoesForWantOfDescriptors) {
    if (checkerNeedsDescriptors) GTEST_SKIP() << "the checker needs descriptors itself";
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
    EXPECT_EQ(notices, "");
    EXPECT_EQ(installed, 1U);
    EXPECT_EQ(erase(plugIn), "-a");
}

} // namespace
