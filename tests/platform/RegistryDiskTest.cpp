#include "platform/linux/BundleScanner.h"
#include "platform/linux/Containers.h"
#include "platform/linux/Entitlements.h"
#include "platform/linux/InstalledBundles.h"
#include "platform/linux/PeerProcess.h"
#include "platform/linux/Registry.h"
#include "platform/linux/RegistryStore.h"
#include "tests/support/BundleTree.h"
#include "tests/support/LocaleFake.h"
#include "tests/support/ScratchDirectory.h"
#include "tests/support/SystemLogFake.h"

#include <algorithm>
#include <climits>
#include <gtest/gtest.h>
#include <iterator>
#include <sstream>
#include <sys/eventfd.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <thread>
#include <tuple>
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
    /// The notices since the last call.
    std::string take() {
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
        for (const auto& proxy : proxies) _notices += (_notices.empty() ? "" : " ") + sign + *proxy->plugInIdentifier;
        const auto action = std::exchange(_action, nullptr);
        lock.unlock();
        if (action) action();
    }

    std::mutex _mutex;
    std::string _notices;
    Action _action;
};

/// Keeps a descriptor from one registry to the next.
class KeepingManager final : public linux_::DescriptorStore {
public:
    Kept take(std::string_view prefix) override {
        return name.starts_with(prefix) ? Kept{name, duplicate(_descriptor.get())} : Kept();
    }
    bool keep(const std::string& given, int descriptor) override {
        if (isDeaf) return false;
        name = given;
        _descriptor = duplicate(descriptor);
        return true;
    }
    void drop(const std::string& dropped) override {
        if (dropped == name && !isDeaf) forget();
    }
    void forget() {
        name.clear();
        _descriptor.reset();
    }

    std::string name;
    bool isDeaf = false;

private:
    static linux_::Descriptor duplicate(int descriptor) { return linux_::Descriptor(dup(descriptor)); }
    linux_::Descriptor _descriptor;
};

/// The registry of a root, and what happens there.
struct Disk {
    explicit Disk(const std::string& place = "/tmp") : scratch(place) { fs::create_directories(applications); }

    void start() {
        registry.reset();
        registry.emplace(linux_::Root(scratch.path()), locale, containers, linux_::RegistryLimits(), &manager);
        observer->registry = &*registry;
        registry->addObserver(observer);
    }
    /// Stops a registry that knows everything and will take the files of plug-ins for unchanged at its next start. It
    /// does not as long as another change could have the same time; then it is started again, and looks again.
    void stop() {
        const auto isOld = [](const auto& known) {
            return linux_::BundleScanner::isUnchanged(known.first, linux_::BundleKind::plugIn, *known.second->facts);
        };
        for (bool areOld = false; !areOld;) {
            start();
            settle();
            uuid = uuidAt(plugIn);
            knowledge = registry->knowledgeUUID();
            registry.reset();
            linux_::SharedStrings strings;
            std::optional<std::string> problem;
            areOld = std::ranges::all_of(linux_::RegistryStore(database, strings).open(problem).plugIns, isOld);
        }
    }
    std::string settle() {
        registry->settle();
        return observer->take();
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
        return registry->registerPlugIn(URL::file(path)) ? observer->take() : "refused " + settle();
    }
    std::string drop(const std::string& path) {
        return registry->unregisterPlugIn(URL::file(path)) ? observer->take() : "refused " + settle();
    }
    PlugInProxyRef at(const std::string& path) { return registry->plugInForURL(URL::file(path)); }
    Proxies matching(const char* identifier) {
        return *registry->plugInsMatching({{"VKExtensionIdentifier", identifier}}, nullptr);
    }
    UUID uuidAt(const std::string& path) { return at(path) ? *at(path)->uuid : UUID{}; }
    /// What stays when a plug-in's content changes.
    auto identityAt(const std::string& path) {
        const auto proxy = at(path);
        return std::tuple(proxy->uuid, proxy->originalIdentifier, proxy->registrationDate);
    }
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
    const std::string two = applications + "/folder/Two.app";
    const std::string plugIn = inApp("a.appex");
    const std::string away = scratch / "away";
    KeepingManager manager;
    FakeLocale locale;
    linux_::Containers containers{linux_::Root(scratch.path())};
    const std::shared_ptr<Observer> observer = std::make_shared<Observer>();
    std::optional<linux_::Registry> registry;
    // What a test saw last.
    std::optional<UUID> knowledge;
    UUID uuid; // of `plugIn`
};

Dictionary infoOf(const char* version, const char* executable = "program") {
    return plugInInfo("a", {}, {{"VBBundleExecutable", executable}, {"VBBundleVersion", version}});
}
void writeTable(const std::string& bundle, const std::string& name, const Dictionary& strings) {
    const std::string table = bundle + "/Resources/" + name;
    writeFile(table, *encodeXML(strings));
    fs::rename(table, table + ".vlist"); // whole, for the registry may look while it is written
}
void writeName(const std::string& bundle, const char* name) {
    writeTable(bundle, "en/InfoVlist", {{"VBBundleName", name}});
}
void entitle(const std::string& program) {
    writeFile(program, "code");
    EXPECT_FALSE(linux_::writeEntitlements(program, Dictionary{{"any", true}}));
}

struct RegistryOnDisk : testing::Test, Disk {};

TEST_F(RegistryOnDisk, ChangesOfPlaceAreToldOnceAndTheUUIDGoesAlong) {
    start();
    EXPECT_EQ(settle(), "");
    writeApplication(app, {"a", "b"});
    EXPECT_EQ(settle(), "+a +b");
    uuid = uuidAt(plugIn);
    fs::create_directory(applications + "/folder");
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
    EXPECT_EQ(move(applications, away), "-other");
    writeApplication(app, {"a"});
    EXPECT_EQ(settle(), "+a");
}

TEST_F(RegistryOnDisk, ChangeInPlaceKeepsTheUUIDAndIsToldWhenAnythingShows) {
    writeApplication(app);
    writeManifest(plugIn, infoOf("1"));
    start();
    const auto identity = identityAt(plugIn);
    uuid = uuidAt(plugIn);
    knowledge = registry->knowledgeUUID();
    const auto expect = [&](const std::string& told, const std::string& content, bool isChange = true) {
        EXPECT_EQ(settle(), told) << content;
        EXPECT_EQ(registry->knowledgeUUID() != std::exchange(knowledge, registry->knowledgeUUID()), isChange);
        EXPECT_EQ(contentOf(at(plugIn)), content);
        EXPECT_EQ(identityAt(plugIn), identity) << content;
    };
    writeManifest(plugIn, infoOf("2"));
    expect("~a +a", "2");
    for (const char* name : {"/program", "/notes"}) writeFile(plugIn + name, "text");
    writeManifest(plugIn, infoOf("2"));
    expect("", "2", false);
    writeName(plugIn, "Name");
    expect("~a +a", "2Name");
    entitle(plugIn + "/program");
    expect("~a +a", "2Name!");
    writeManifest(app, Dictionary{{"VBBundleIsPlaceholder", true}, {"VBBundleName", "One"}});
    expect("", "2NameOne!");
    EXPECT_TRUE(at(plugIn)->containingBundle->isPlaceholder);
    EXPECT_EQ(at(plugIn)->entitlements, (Dictionary{{"any", true}}));

    entitle(app + "/program");
    fs::create_symlink(app + "/program", plugIn + "/link");
    for (const char* elsewhere : {"../../program", "link", "..", ""}) {
        writeManifest(plugIn, infoOf("2", elsewhere));
        expect("~a +a", "2NameOne");
    }
    EXPECT_EQ(write(plugIn, plugInInfo("renamed")), "-a +renamed");
    EXPECT_EQ(uuidAt(plugIn), uuid);
    EXPECT_EQ(at(plugIn)->originalIdentifier, "a");
}

TEST_F(RegistryOnDisk, StatePersists) {
    writeApplication(app, {"a"});
    writeApplication(two, {"b"});
    writeName(app, "App");
    writeManifest(away, plugInInfo("tool"));
    start();
    add(away);
    write(plugIn, plugInInfo("renamed")); // in the database it is behind that of the other application now
    const auto identity = identityAt(plugIn);
    const auto tool = identityAt(away);
    knowledge = registry->knowledgeUUID();
    start();
    EXPECT_EQ(settle(), "");
    EXPECT_EQ(registry->knowledgeUUID(), knowledge);
    EXPECT_EQ(identityAt(plugIn), identity);
    EXPECT_EQ(identityAt(away), tool);
    EXPECT_EQ(at(plugIn)->containingBundle->localizedName, "App");
    EXPECT_EQ(at(two + "/PlugIns/b.appex")->containingBundle->bundleURL, URL::file(two));
    registry.reset();
    fs::remove_all(away);
    start();
    EXPECT_EQ(count(), 2U);
    settle();
    EXPECT_EQ(write(away, plugInInfo("tool")), "+tool") << "a registration outlives its bundle";
    EXPECT_EQ(uuidAt(away), *std::get<0>(tool));
}

/// Where thousands of files take no minute, and no database waits for a disk.
const char* memory() { return access("/dev/shm", W_OK) == 0 ? "/dev/shm" : "/tmp"; }

struct Change {
    using Deed = std::function<void(Disk&)>;
    std::string what;
    Deed make;
    std::string answer; // the content that is found then
    Deed before = {};   // without "a"; else "a" is known
    std::shared_ptr<Disk> disk = std::make_shared<Disk>(memory());
};

TEST(RegistryOnDisks, FirstAnswerKnowsWhatChangedWhileStopped) {
    const auto put = [](const std::string& bundle) {
        writeManifest(bundle, infoOf("1"));
        writeName(bundle, "N");
        writeFile(bundle + "/program", "code");
    };
    const auto nothing = [](Disk&) {};
    const auto putHere = [&](Disk& on) { put(on.plugIn); };
    const auto putBeyond = [&](Disk& on) { put(on.two + "/PlugIns/a"); };
    const auto putBeyondApplication = [&](Disk& on) { writeApplication(on.two), putBeyond(on); };
    const auto editWithinItsTime = [](Disk& on) {
        const auto time = fs::last_write_time(on.plugIn + "/Info.vlist");
        writeManifest(on.plugIn, infoOf("2"));
        fs::last_write_time(on.plugIn + "/Info.vlist", time);
    };
    // By identifier, and by UUID or, where there was none, among all; with a watch that was kept and without.
    for (const auto& [isByIdentifier, isKept] : {std::pair(true, true), {true, false}, {false, true}, {false, false}}) {
        const std::vector<Change> changes{
            {"nothing", nothing, "1N"},
            {"deleted", [](Disk& on) { fs::remove_all(on.plugIn); }, "none"},
            {"moved", [](Disk& on) { fs::rename(on.app, on.applications + "/New.app"); }, "1N"},
            {"behind a link", [](Disk& on) { putBehindLink(on.app); }, "none"},
            {"replaced", [&](Disk& on) { fs::rename(on.plugIn, on.away), writeManifest(on.plugIn, infoOf("3")); }, "3"},
            {"edited", editWithinItsTime, "2N"},
            {"entitled", [](Disk& on) { entitle(on.plugIn + "/program"); }, "1N!", {}, std::make_shared<Disk>()},
            {"renamed", [](Disk& on) { writeName(on.plugIn, "M"); }, "1M"},
            {"application named", [](Disk& on) { writeName(on.app, "App"); }, "1NApp"},
            {"new", putHere, "1N", nothing},
            {"of another kind", putHere, "1N", [](Disk& on) { writeManifest(on.plugIn, Dictionary()); }},
            {"application once none", [](Disk& on) { writeApplication(on.two); }, "1N", putBeyond},
            {"application mended",
             [](Disk& on) {
                 on.start();
                 on.settle();
                 on.write(on.two, "no dictionary");
                 on.registry.reset();
                 writeApplication(on.two);
             },
             "1N", putBeyondApplication},
            {"first one in its application", putBeyond, "1N", [](Disk& on) { writeApplication(on.two); }},
            {"folder replaced",
             [&](Disk& on) { fs::rename(on.applications, on.away), writeApplication(on.app), putHere(on); }, "1N",
             nothing}};
        for (const auto& change : changes) {
            writeApplication(change.disk->app, {"b"});
            change.before ? change.before(*change.disk) : putHere(*change.disk);
        }
        for (const auto& change : changes) change.disk->stop(); // the files of all get old at once
        for (const auto& [what, make, answer, before, disk] : changes) {
            SCOPED_TRACE(what + (isByIdentifier ? ", by identifier" : "") + (isKept ? ", kept" : ""));
            make(*disk);
            if (!isKept) disk->manager.forget();
            processLog.clear();
            disk->start();
            EXPECT_EQ(logged(LogLevel::info, "nothing changed on disk", "cx"), isKept && what == "nothing");
            std::string found = "none";
            for (const auto& proxy : isByIdentifier ? disk->matching("a")
                                     : before       ? *disk->registry->installedPlugIns()
                                                    : Proxies{disk->registry->plugInForUUID(disk->uuid)}) {
                if (!proxy || proxy->plugInIdentifier != "a") continue;
                EXPECT_TRUE(fs::exists(proxy->bundleURL->path()));
                found = Disk::contentOf(proxy);
            }
            EXPECT_EQ(found, answer);
            disk->settle();
            EXPECT_EQ(disk->registry->knowledgeUUID() == disk->knowledge, what == "nothing");
        }
    }
}

/// The first registry has all at hand that it was told by a watch; the second one decides whether to believe it.
TEST_F(RegistryOnDisk, WatchIsBelievedOnlyIfItIsTheOneThatWasHandedOver) {
    using linux_::InstalledBundles;
    using Stage = InstalledBundles::Stage;
    writeApplication(app, {"a"});
    const linux_::Root root(scratch.path());
    const ScratchDirectory aside;
    linux_::RegistryLimits limits;
    const auto made = [&] { return std::make_unique<InstalledBundles>(root, limits, &manager); };
    const auto watched = [&] {
        auto bundles = made();
        while (bundles->stage() < Stage::watched) bundles->catchUp();
        return bundles;
    };
    const auto next = [&] { return made()->stage(); };
    const auto edit = [&] { writeManifest(plugIn, infoOf("2")); };
    const std::string subfolder = applications + "/a folder";
    fs::create_directory(subfolder);
    const auto mountThere = [&] { return mount("none", subfolder.c_str(), "tmpfs", 0, nullptr) == 0; }; // if one may
    const auto handedOver = [&] {
        linux_::SharedStrings strings;
        std::optional<std::string> problem;
        return linux_::RegistryStore(database, strings).open(problem).handedOver;
    };
    /// What happens after something was handed over, and before the next start.
    const std::vector<std::pair<std::string, Action>> cases{
        {"an edit", edit},
        {"another one that ended without handing over", [&] { (void)watched(); }},
        {"another watch", [&] { manager.name += "x"; }},
        {"none", [&] { manager.forget(); }},
        {"something else", [&] { manager.keep(manager.name, linux_::Descriptor(eventfd(0, EFD_CLOEXEC)).get()); }},
        // No watch hears of what happens above the root.
        {"other folders",
         [&] {
             fs::rename(root.directory(), aside.path() + "/root");
             fs::copy(aside.path() + "/root", root.directory(), fs::copy_options::recursive);
         }},
        {"an older copy of the database",
         [&] {
             fs::copy_file(database, aside.path() + "/copy");
             auto bundles = watched();
             edit();
             bundles->catchUp();
             bundles->handOver();
             bundles.reset();
             EXPECT_EQ(next(), Stage::verified);
             fs::copy_file(aside.path() + "/copy", database, fs::copy_options::overwrite_existing);
         }},
        {"a database that nobody can write for a while",
         [&] {
             linux_::SharedStrings strings;
             std::optional<std::string> problem;
             linux_::RegistryStore other(database, strings);
             other.open(problem);
             manager.isDeaf = true;
             (void)other.change([&] {
                 const auto bundles = watched();
                 edit();
                 bundles->catchUp();
             });
             manager.isDeaf = false;
         }},
        {"a mount",
         [&] {
             if (!mountThere()) edit();
         }},
    };
    for (const auto& [what, happen] : cases) {
        SCOPED_TRACE(what);
        watched()->handOver();
        EXPECT_EQ(next(), Stage::verified);
        EXPECT_EQ(next(), Stage::verified) << "as long as nothing is taken in";
        happen();
        auto bundles = made();
        EXPECT_EQ(bundles->stage(), Stage::stored);
        EXPECT_EQ(manager.name, "") << "nobody reads it any more";
        if (what != "an edit") continue;
        bundles->catchUp();
        EXPECT_EQ(bundles->stage(), Stage::verified);
        EXPECT_FALSE(handedOver()) << "it spoke of other rows";
    }
    umount(subfolder.c_str());
    auto bundles = watched();
    if (mountThere()) {
        bundles->handOver();
        umount(subfolder.c_str());
        EXPECT_FALSE(handedOver()) << "what lies there is not what is watched";
    }
    bundles = watched();
    const std::string alias = aside.path() + "/alias";
    fs::create_directory(alias);
    if (mount(applications.c_str(), alias.c_str(), nullptr, MS_BIND, nullptr) == 0) {
        EXPECT_TRUE(bundles->registerPlugIn(alias + "/One.app/PlugIns/a.appex", [](const auto&) {}));
        EXPECT_TRUE(bundles->needsVerifying());
        bundles->handOver();
        umount(alias.c_str());
        EXPECT_FALSE(handedOver()) << "of two paths to a directory one is heard of";
    }
    bundles.reset();
    limits.watches = 3;
    watched()->handOver();
    EXPECT_FALSE(handedOver()) << "not all is watched";
}

TEST_F(RegistryOnDisk, RegistrationByPath) {
    const std::string around = scratch / "work/Dev.app";
    const std::string outside = around + "/deep/tool.plugin";
    const std::string behindLink = scratch / "link/Dev.app/deep/tool.plugin";
    start();
    writeFile(outside + "/Info.vlist", "nonsense");
    fs::create_directory_symlink(scratch / "work", scratch / "link");
    EXPECT_EQ(add(outside), "refused ");
    writeManifest(outside, plugInInfo("tool"));
    for (const auto& path : {behindLink, scratch / "work/../work/Dev.app/deep/tool.plugin", std::string(PATH_MAX, '/')})
        EXPECT_EQ(add(path), "refused ") << path;
    EXPECT_EQ(add(outside), "+tool");
    EXPECT_EQ(add(outside), "");
    EXPECT_EQ(at(behindLink), nullptr) << "whoever asks resolves links";
    EXPECT_EQ(at(outside)->containingBundle, nullptr) << "no manifest, no application";
    EXPECT_EQ(write(around, Dictionary()), "");
    EXPECT_NE(at(outside)->containingBundle, nullptr);
    EXPECT_EQ(move(scratch / "work", away), "-tool") << "a directory far above went";
    EXPECT_EQ(registry->applicationForURL(URL::file(around)), nullptr);
    EXPECT_EQ(move(away, scratch / "work"), "+tool");
    EXPECT_EQ(drop(outside), "-tool");
    EXPECT_EQ(drop(outside), "refused ");
}

TEST_F(RegistryOnDisk, MayRegisterWhoMayReadTheManifest) {
    if (geteuid() != 0) GTEST_SKIP() << "for root's daemon";
    writeManifest(away, plugInInfo("tool"));
    for (const auto& path : {scratch.path(), away}) fs::permissions(path, fs::perms(0711));
    start();
    const auto process = linux_::LinuxPeerProcess::look(getpid());
    const auto may = [&](auto peer) { return registry->mayRegister(URL::file(away), {getpid(), 65534, 65534, peer}); };
    EXPECT_TRUE(may(process)) << "to list directories is another right";
    EXPECT_FALSE(may(decltype(process)())) << "groups unknown";
    fs::permissions(away + "/Info.vlist", fs::perms(0600));
    EXPECT_FALSE(may(process));
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
    fs::rename(plugIn, away);
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
    const std::string usable = "no reason";
    const std::vector<std::tuple<std::string, std::string, std::string>> manifests{
        {"good", with(1), usable},
        {"text", "not a property list", "Info.vlist: syntax error in line 1"},
        {"bytes", "<vlist><string>\xFF", "Info.vlist: not well-formed (invalid token) in line 1"},
        {"array", *encodeXML(Array{}), "Info.vlist: not a dictionary"},
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
        const auto line = "ignoring bundle at " + inApp(name) + ": " + reason;
        EXPECT_EQ(processLog.contains(LogLevel::error, "cx", line), reason != usable && !reason.empty()) << name;
    }

    // The same when they come one by one.
    EXPECT_EQ(move(applications + "/.Copying.app", applications + "/Copied.app"), "+copying");
    EXPECT_EQ(write(inApp("text"), plugInInfo("text")), "+text");
    EXPECT_EQ(write(inApp("text"), "broken again"), "-text");
}

TEST_F(RegistryOnDisk, NamesFollowTheLanguages) {
    writeApplication(app, {}, {{"VBBundleName", "App"}});
    writeManifest(plugIn, plugInInfo("a", {}, {{"VBBundleName", "Short"}, {"VBBundleDisplayName", "Long"}}));
    writeTable(plugIn, "pt/InfoVlist", {{"VBBundleDisplayName", "Comprido"}, {"VBBundleName", "Curto"}});
    writeTable(plugIn, "pt-BR/InfoVlist", {{"VBBundleName", "Curtinho"}, {"VBBundleDisplayName", 5}});
    writeTable(plugIn, "pt/Localizable", {{"open", "Abrir"}, {"close", "Fechar"}});
    writeTable(plugIn, "en/Localizable", {{"open", "Open"}, {"help", "Help"}});
    writeTable(app, "de/InfoVlist", {{"VBBundleName", "Anwendung"}});
    start();
    const std::string cases[][4] = {{"pt-BR", "CurtinhoApp", "Comprido", "Abrir"},
                                    {"de-AT", "ShortAnwendung", "Long", "Open"},
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

TEST_F(RegistryOnDisk, ContainersOfRewrittenIdentifiersDoNotPileUp) {
    writeApplication(app, {"data"});
    start();
    for (const char* identifier : {"first", "second"}) {
        write(plugIn, Dictionary{{"Zembra", Dictionary{{"VKExtensionIdentifier", identifier}}}});
        EXPECT_EQ(count(), 2U);
        EXPECT_FALSE(at(inApp("data.appex"))->dataContainerURL);
        const auto container = fs::path(at(plugIn)->dataContainerURL->path());
        const std::vector<fs::path> all{fs::directory_iterator(container.parent_path()), {}};
        EXPECT_EQ(all, std::vector{container});
    }
}

TEST_F(RegistryOnDisk, DamagedDatabaseIsMovedAside) {
    writeApplication(app, {"a"});
    for (const std::uintmax_t soundBytes : {0U, 4096U}) {
        start();
        registry.reset();
        const auto size = fs::file_size(database);
        fs::resize_file(database, soundBytes);
        std::ofstream(database, std::ios::binary | std::ios::app) << std::string(size - soundBytes, 'x');
        start();
        uuid = uuidAt(plugIn);
        EXPECT_TRUE(fs::remove(database + ".damaged")) << soundBytes;
        start();
        EXPECT_EQ(uuidAt(plugIn), uuid) << "the new one keeps";
    }
}

struct RegistryUnderLoad : testing::Test, Disk {
    RegistryUnderLoad() : Disk(memory()) {}
};

TEST_F(RegistryUnderLoad, ThousandsAtOnceAreEachToldOnce) {
    constexpr int many = 2000;
    int queue = 0;
    std::ifstream("/proc/sys/fs/inotify/max_queued_events") >> queue;
    if (queue > 100'000) GTEST_SKIP() << "the kernel's queue is too long to fill";
    const auto path = [&](int i) { return applications + "/" + std::to_string(i) + ".app"; };
    const auto expectToldOnce = [&](std::size_t told) {
        registry->settle();
        registry->settle(); // what happened inside a notice
        std::istringstream notices(observer->take());
        const std::vector<std::string> all{std::istream_iterator<std::string>(notices), {}};
        EXPECT_EQ(all.size(), told);
        EXPECT_EQ(std::set(all.begin(), all.end()).size(), told);
        EXPECT_EQ(count(), many);
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
    expectToldOnce(many + 1);

    // And without overflow, while the registry keeps reading and others keep asking.
    const std::jthread reader([&](const std::stop_token& stop) {
        while (!stop.stop_requested()) {
            EXPECT_LE(matching("1").size(), 1U);
            EXPECT_LE(count(), many);
        }
    });
    for (int i = 1; i < many; ++i) fs::rename(path(i), path(i + many));
    expectToldOnce(2 * (many - 1));
}

} // namespace
