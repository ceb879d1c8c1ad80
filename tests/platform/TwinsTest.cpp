// The same questions to the services of Linux and to their twins in memory: tests of the daemon are worth what the
// twins are like. Registry, transport, work queues, run loop, bundles and types have suites of their own.
#include "platform/linux/ActivationRules.h"
#include "platform/linux/BusyAssertion.h"
#include "platform/linux/CodeSigning.h"
#include "platform/linux/Containers.h"
#include "platform/linux/Files.h"
#include "platform/linux/Locale.h"
#include "platform/linux/Notifications.h"
#include "platform/linux/PeerProcess.h"
#include "platform/linux/Preferences.h"
#include "platform/linux/PrivacyConsent.h"
#include "platform/linux/ProcessAssertions.h"
#include "platform/linux/Processes.h"
#include "platform/linux/Sandbox.h"
#include "platform/linux/ServiceManager.h"
#include "platform/linux/UserDirectory.h"
#include "platform/linux/WorkQueue.h"
#include "tests/support/BundleTree.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/FakePlatform.h"
#include "tests/support/Mailbox.h"
#include "tests/support/ScratchDirectory.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

namespace {

using namespace platform;
namespace fs = std::filesystem;

constexpr const char* name = "com.example.name";
constexpr const char* busyName = "com.example.busy";

struct Memory : support::FakePlatform {
    Memory() {
        files.addDirectory(directory);
        files.allowPeers(geteuid());
        containers.allow(name, directory + "/container");
        processes.paths[getpid()] = fs::canonical("/proc/self/exe");
        sandbox.services.insert(name);
        processAssertions.addBusy(busyName);
        serviceManager.allow();
    }
    void makeFile(const std::string& path) {
        files.files[path] = "bytes";
        sandbox.allowFile(path);
    }
    void store(const Value& value) { preferences.store(name, "key", value); }
    void grant() { privacyConsent.decide(name, "network", true); }
    void speak(const std::string& language) { locale.setLanguages({language, "en"}); }

    std::string directory = "/directory";
    AuditToken self{getpid(), geteuid(), getegid(), nullptr};
};

struct Linux {
    Linux() {
        umask(022); // what a group could write is not believed
        (void)openUserDirectory(root.users(), geteuid(), {"Preferences"}, linux_::MissingDirectory::made);
        fs::create_directory(directory);
        waitpid(busy, nullptr, WUNTRACED);
    }
    ~Linux() {
        kill(busy, SIGKILL);
        waitpid(busy, nullptr, 0);
    }
    static void makeFile(const std::string& path) { support::writeFile(path, "bytes"); }
    void store(const Value& value) const {
        char host[256] = "";
        gethostname(host, sizeof host);
        const std::string user = root.users() + "/" + std::to_string(geteuid());
        support::writeFile(user + "/Preferences/" + name + "." + host + ".vlist",
                           *encodeXML(Dictionary{{"key", value}}));
    }
    void grant() const {
        support::writeFile(root.database() + "/PrivacyConsent.vlist",
                           *encodeXML(Dictionary{{name, Dictionary{{"network", true}}}}));
    }
    void speak(const std::string& language) const {
        support::writeFile(root.database() + "/Locale.vlist",
                           *encodeXML(Dictionary{{"languages", Array{Value(language)}}}));
    }

    support::ScratchDirectory scratch;
    linux_::Root root{scratch.path()};
    const pid_t busy = support::startChild([this] { // before there are threads
        const linux_::BusyAssertion assertion(root, busyName);
        return raise(SIGSTOP);
    });
    std::string directory = scratch / "directory";
    AuditToken self{getpid(), geteuid(), getegid(), linux_::LinuxPeerProcess::look(getpid())};
    linux_::Files files{root};
    linux_::Preferences preferences{root};
    linux_::Containers containers{root};
    linux_::PrivacyConsent privacyConsent{root};
    linux_::ProcessAssertions processAssertions{root};
    linux_::Processes processes;
    linux_::CodeSigning codeSigning;
    linux_::Notifications notifications{root};
    linux_::Locale locale{root, files, {"en"}};
    linux_::Interfaces interfaces;
    linux_::ActivationRules activationRules;
    linux_::Sandbox sandbox{root, linux_::SandboxRole::issuer};
    linux_::ServiceManager serviceManager{root, files};
};

template <class World> struct Twins : testing::Test {
    World world;
    linux_::WorkQueues queues;
    std::shared_ptr<WorkQueue> queue = queues.makeSerial("test", QualityOfService::standard);
    support::Mailbox<int> calls;
};
using Worlds = testing::Types<Memory, Linux>;
TYPED_TEST_SUITE(Twins, Worlds);

} // namespace

TYPED_TEST(Twins, FilesAreReplacedSetAsideAndResolved) {
    Files& files = this->world.files;
    const std::string path = this->world.directory + "/file";
    EXPECT_EQ(files.read(path, 9).error().code, fileReadNoSuchFileCode);
    EXPECT_TRUE(files.writeAtomically(this->world.directory + "/none/file", "x"));
    for (const char* bytes : {"old", "new"}) {
        EXPECT_FALSE(files.writeAtomically(path, bytes));
        EXPECT_EQ(*files.read(path, 3), bytes);
    }
    EXPECT_EQ(files.read(path, 2).error().code, fileReadTooLargeCode);
    EXPECT_EQ(*files.realPath(path, path.size() + 1, this->world.self), path);
    EXPECT_FALSE(files.realPath(path, path.size()));
    EXPECT_FALSE(files.setAside(path, ".old"));
    EXPECT_EQ(files.setAside(path, ".old")->code, fileReadNoSuchFileCode);
    EXPECT_EQ(*files.read(path + ".old", 3), "new");
    EXPECT_EQ(*this->world.containers.userContainer(name), *this->world.containers.userContainer(name));
}

TYPED_TEST(Twins, WhatTheUserDecidedIsToldWhenAskedForAnew) {
    Preferences& preferences = this->world.preferences;
    EXPECT_FALSE(preferences.synchronize(name)) << "not before it is added";
    preferences.addDomain(name);
    this->world.store("value");
    EXPECT_FALSE(preferences.value(name, "key"));
    EXPECT_TRUE(preferences.synchronize(name));
    EXPECT_EQ(preferences.value(name, "key"), Value("value"));

    const support::ScratchDirectory place;
    const Dictionary manifest{{"VBBundleIdentifier", name}};
    support::writeManifest(place.path(), manifest);
    support::FakeBundles bundles;
    const auto& bundle = bundles.add(place.path(), manifest);
    PrivacyConsent& consent = this->world.privacyConsent;
    EXPECT_TRUE(consent.informationForBundle(bundle)->empty());
    this->world.grant();
    consent.flushBundleCaches(bundle);
    const auto records = *consent.informationForBundle(bundle);
    ASSERT_EQ(records.size(), 1U);
    EXPECT_TRUE(records.front().service == "network" && records.front().granted == true);
    EXPECT_FALSE(this->world.activationRules.evaluate("rule", Dictionary{{"item", 1}}));
}

TYPED_TEST(Twins, ProcessesAreKnownByPidAndToken) {
    Processes& processes = this->world.processes;
    const std::string own = fs::canonical("/proc/self/exe");
    EXPECT_EQ(*processes.executablePath(getpid(), own.size() + 1), own);
    EXPECT_EQ(*processes.executablePath(this->world.self, own.size() + 1), own);
    EXPECT_EQ(processes.executablePath(getpid(), own.size()).error().code, ENAMETOOLONG);
    EXPECT_EQ(processes.executablePath(INT_MAX, 4096).error().code, ESRCH);
    const auto task = this->world.codeSigning.taskFromAuditToken(this->world.self);
    const EntitlementValue entitlement = this->world.codeSigning.copyEntitlement(task, name);
    EXPECT_FALSE(entitlement.value);
    EXPECT_FALSE(entitlement.error);

    EXPECT_TRUE(this->world.processAssertions.busyExtensionInstances({name}).empty());
    const auto instances = this->world.processAssertions.busyExtensionInstances({name, busyName});
    ASSERT_EQ(instances.size(), 1U);
    EXPECT_EQ(instances.front().string(instanceBundleIdentifierKey), busyName);
}

TYPED_TEST(Twins, ObserversHearOnTheirQueueUntilTheyEnd) {
    const auto hear = [this] {
        this->queue->assertCurrent();
        this->calls.put(1);
    };
    auto posts = this->world.notifications.observe(name, this->queue, hear);
    this->world.notifications.post("com.example.other");
    this->world.notifications.post(name);
    EXPECT_EQ(this->calls.take(), 1);
    posts.reset();
    auto changes = this->world.locale.observeChanges(this->queue, hear);
    this->world.notifications.post(name);
    this->world.speak("de");
    EXPECT_EQ(this->calls.take(), 1);
    EXPECT_EQ(this->world.locale.languages(), (std::vector<std::string>{"de", "en"}));
    changes.reset();
    this->queue->sync([] {});
    EXPECT_EQ(this->calls.size(), 0U);
}

TYPED_TEST(Twins, NamesBelongToTheFirstWhoRegisteredThem) {
    Interfaces& interfaces = this->world.interfaces;
    EXPECT_FALSE(interfaces.find(name));
    const auto first = interfaces.create(name);
    const auto second = interfaces.create(name);
    EXPECT_TRUE(interfaces.registerInterface(first) == first && interfaces.registerInterface(second) == first);
    EXPECT_TRUE(!interfaces.create(name) && interfaces.find(name) == first);
}

TYPED_TEST(Twins, TokensAreForWhatExistsInsideAndHandlesAreReleasedOnce) {
    Sandbox& sandbox = this->world.sandbox;
    const std::string& directory = this->world.directory;
    this->world.makeFile(directory + "/file");
    const auto issue = [&](const std::string& path, const std::string& within) {
        return sandbox.issueFile(sandboxReadExtensionClass, path, SandboxFlag::canonical, within);
    };
    EXPECT_TRUE(issue(directory + "/file", directory));
    EXPECT_FALSE(issue(directory + "/file", directory + "/other"));
    EXPECT_FALSE(issue(directory + "/none", directory));
    EXPECT_TRUE(sandbox.issueService("class", name));
    int number = 0;
    EXPECT_EQ(sandbox.consume("no token", number), -1);
    EXPECT_NE(number, 0);
    EXPECT_NE(sandbox.release(7, number), 0);
    EXPECT_EQ(number, EINVAL);
}

TYPED_TEST(Twins, RemovalsAreAnsweredOnceOnTheGivenQueue) {
    for (const char* version : {"1", "2"}) {
        this->world.serviceManager.removeExternalService(name, version, this->queue, [this](int result) {
            this->queue->assertCurrent();
            this->calls.put(result);
        });
    }
    EXPECT_EQ(this->calls.take(), serviceHasNoInstances);
    EXPECT_EQ(this->calls.take(), serviceHasNoInstances);
    this->queue->sync([] {});
    EXPECT_EQ(this->calls.size(), 0U);
}
