#include "platform/linux/Registry.h"

#include "platform/SystemLog.h"
#include "platform/linux/ActingAsPeer.h"
#include "platform/linux/BundleScanner.h"
#include "platform/linux/Descriptor.h"
#include "platform/linux/DirectoryFiles.h"
#include "platform/linux/InstalledBundles.h"
#include "platform/linux/ProcPath.h"
#include "platform/linux/RegistryQuery.h"
#include "platform/linux/RegistrySnapshot.h"
#include "platform/linux/SDKFiles.h"
#include "platform/linux/ServiceThread.h"
#include "platform/linux/StringTables.h"

#include <algorithm>
#include <atomic>
#include <condition_variable>
#include <cstdlib>
#include <fcntl.h>
#include <filesystem>
#include <functional>
#include <future>
#include <linux/openat2.h>
#include <mutex>
#include <poll.h>
#include <sys/eventfd.h>
#include <thread>
#include <unistd.h>

namespace platform::linux_ {

namespace {

using Stage = InstalledBundles::Stage;

/// Candidates of one query that are looked at for it alone. Of more the registry's thread soon knows, too.
constexpr std::size_t maximumLooks = 500;

/// Milliseconds before each look at the disk in which hosts are answered from what is known already, and need not share
/// the processor with the look. Whoever needs that one ends the delay.
constexpr int startDelay = 100;

/// Answers kept for those who ask again. Hosts choose the questions.
constexpr std::size_t maximumAnswers = 16;
constexpr std::size_t maximumKeptQuestion = 4096; // bytes

bool isWorthKeeping(const std::vector<EqualityTest>& tests) {
    std::size_t size = 0;
    for (const auto& test : tests) {
        for (const auto& value : test.values) size += value.size() + 1;
    }
    return size <= maximumKeptQuestion;
}

constexpr const char* placeholderKey = "VBBundleIsPlaceholder";

/// The path with its symbolic links resolved; none for what does not exist.
std::optional<std::string> canonical(const std::string& path) {
    std::error_code error;
    auto resolved = std::filesystem::canonical(path, error);
    return error ? std::nullopt : std::optional(resolved.string());
}

Root withoutLinks(const Root& root) { return Root(canonical(root.at("/")).value_or(root.directory())); }

std::optional<std::string> text(const Dictionary& dictionary, std::string_view key) {
    const auto view = dictionary.string(key);
    return view ? std::optional<std::string>(*view) : std::nullopt;
}

/// The languages in which names are looked for, best first; the generation counts their changes.
struct Languages {
    std::vector<std::string> preferred;
    std::vector<std::string> order;
    std::uint64_t generation = 0;
};

/// The names of a bundle in the user's languages.
class LocalizedNames {
public:
    LocalizedNames(const std::string& path, const BundleFacts& facts, const Languages& languages)
        : _info(facts.info->dictionary()),
          _tables(path, infoTable, facts.hasResources ? languages.order : std::vector<std::string>()) {}

    std::optional<std::string> shortName() const { return string("VBBundleName"); }
    std::optional<std::string> name() const {
        auto displayName = string("VBBundleDisplayName");
        return displayName ? displayName : shortName();
    }

private:
    std::optional<std::string> string(std::string_view key) const {
        auto localized = _tables.string(key);
        return localized ? localized : text(_info, key);
    }

    const Dictionary _info;
    const StringTables _tables;
};

} // namespace

class Registry::Implementation {
public:
    Implementation(const Root& root, platform::Locale& locale, platform::Containers& containers,
                   const RegistryLimits& limits, DescriptorStore* descriptors)
        : _root(withoutLinks(root)),
          _locale(locale),
          _containers(containers),
          _bundles(_root, limits, descriptors),
          _wake(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {
        show(std::make_shared<RegistrySnapshot>(_bundles.installed(), _bundles.knowledge()));
        _thread = startServiceThread("registry", [this] {
            run();
            _bundles.handOver();
            _ended.set_value();
        });
        if (_thread) return;
        while (_bundles.stage() < Stage::watched) publish(_bundles.catchUp());
    }

    ~Implementation() {
        stop({});
        if (_thread) _thread->join();
    }

    void stop(std::chrono::milliseconds patience) {
        {
            const std::lock_guard lock(_mutex);
            _isStopping = true;
        }
        wake();
        // Until everything is watched there is nothing to wait for.
        if (_thread && _stage.load() == Stage::watched) _end.wait_for(patience);
    }

    void addObserver(std::weak_ptr<RegistryObserver> observer) {
        const std::lock_guard lock(_mutex);
        std::erase_if(_observers, [](const auto& known) { return known.expired(); });
        _observers.push_back(std::move(observer));
    }

    std::shared_ptr<const RegistrySnapshot> snapshot() const {
        const std::lock_guard lock(_mutex);
        return _snapshot;
    }

    /// Asked many times for each answer, so it takes no share in the snapshot.
    UUID knowledgeUUID() const {
        const std::lock_guard lock(_mutex);
        return _snapshot->knowledge().uuid;
    }

    /// The snapshot for an answer, once the disk was looked at. What is not watched is verified soon after somebody
    /// asked.
    std::shared_ptr<const RegistrySnapshot> snapshotForAnswer() {
        awaitStage(Stage::verified);
        if (_needsVerifying.load(std::memory_order_relaxed) && !_isVerifyWanted.exchange(true)) wake();
        return snapshot();
    }

    /// The plug-in that `find` finds in the snapshot for an answer. While the disk is not looked at yet, one that was
    /// known before the start and is unchanged need not wait for that.
    template <class F> InstalledPlugInRef lookUp(F&& find) {
        if (_stage.load(std::memory_order_acquire) < Stage::verified) {
            const auto plugIn = find(*snapshot());
            if (plugIn && _bundles.isUnchanged(*plugIn)) return plugIn;
        }
        return find(*snapshotForAnswer());
    }

    /// The plug-ins that may match. Once every manifest was looked at, it is known which these are; while the rest of
    /// the bundles is not, theirs are looked at here.
    std::vector<InstalledPlugInRef> matching(const std::vector<EqualityTest>& tests) {
        if (!tests.empty() && _stage.load(std::memory_order_acquire) < Stage::verified) {
            want(Stage::glanced);
            auto plugIns = snapshot()->matching(tests); // meanwhile the other thread looks
            awaitStage(Stage::glanced);
            const auto isUnchanged = [&](const auto& plugIn) { return _bundles.isUnchanged(*plugIn); };
            // Up to this stage there is one snapshot only.
            if (_stage.load(std::memory_order_acquire) == Stage::glanced && plugIns.size() <= maximumLooks &&
                std::ranges::all_of(plugIns, isUnchanged))
                return plugIns;
        }
        return snapshotForAnswer()->matching(tests);
    }

    std::shared_ptr<const Languages> languages() {
        auto preferred = _locale.languages();
        std::list<Answer> outdated; // goes after the lock
        const std::lock_guard lock(_madeMutex);
        if (!_languages || _languages->preferred != preferred) {
            outdated.swap(_answers);
            auto order = searchOrder(preferred);
            _languages = std::make_shared<const Languages>(
                Languages{std::move(preferred), std::move(order), _languages ? _languages->generation + 1 : 1});
        }
        return _languages;
    }

    void clearSchemaCaches() {
        std::list<Answer> outdated;
        const std::lock_guard lock(_madeMutex);
        outdated.swap(_answers);
        if (!_languages) return;
        auto renewed = std::make_shared<Languages>(*_languages);
        ++renewed->generation;
        _languages = std::move(renewed);
    }

    PlugInProxyRef proxy(const InstalledPlugInRef& plugIn, const Languages& languages) {
        if (!plugIn) return nullptr;
        if (auto made = madeOf(plugIn->proxy, languages)) return made;
        auto proxy = describe(*plugIn, languages);
        if (!isDataOnly(*proxy->infoDictionary) && proxy->plugInIdentifier) {
            auto container = _containers.userContainer(*proxy->plugInIdentifier);
            noteContainer(*plugIn);
            // Not kept without its container: what prevents that may pass.
            if (!container) return proxy;
            proxy->dataContainerURL = URL::file(*container);
        }
        return keep(plugIn->proxy, std::move(proxy), languages);
    }

    std::vector<PlugInProxyRef> proxies(const std::vector<InstalledPlugInRef>& plugIns) {
        return proxies(plugIns, *languages());
    }
    std::vector<PlugInProxyRef> proxies(const std::vector<InstalledPlugInRef>& plugIns, const Languages& languages) {
        std::vector<PlugInProxyRef> answer;
        answer.reserve(plugIns.size());
        for (const auto& plugIn : plugIns) answer.push_back(proxy(plugIn, languages));
        return answer;
    }

    /// The proxies of all plug-ins that may match; the same list again as long as nothing has changed.
    PlugInProxies answer(const std::vector<EqualityTest>& tests) {
        const auto current = languages();
        if (_stage.load(std::memory_order_acquire) < Stage::verified) {
            return std::make_shared<const std::vector<PlugInProxyRef>>(proxies(matching(tests), *current));
        }
        const auto snapshot = snapshotForAnswer();
        if (auto known = knownAnswer(tests, snapshot, *current)) return known;
        const auto plugIns = snapshot->matching(tests);
        auto made = std::make_shared<const std::vector<PlugInProxyRef>>(proxies(plugIns, *current));
        keepAnswer(plugIns, {tests, snapshot, current->generation, made});
        return made;
    }

    std::shared_ptr<const ApplicationRecord> record(const InstalledApplicationRef& application,
                                                    const Languages& languages) {
        if (!application) return nullptr;
        if (auto made = madeOf(application->record, languages)) return made;
        const Dictionary& info = application->facts->info->dictionary();
        auto record = std::make_shared<ApplicationRecord>(ApplicationRecord{
            .bundleURL = URL::file(application->path),
            .bundleIdentifier = text(info, "VBBundleIdentifier"),
            .localizedName = LocalizedNames(application->path, *application->facts, languages).name(),
            .isApplication = true,
            .isPlaceholder = info[placeholderKey].booleanValue().value_or(false),
        });
        return keep(application->record, std::move(record), languages);
    }

    /// Runs `action` on the registry's thread, after everything that happened on disk until now, and its notices.
    void perform(const std::function<void()>& action) {
        if (!_thread) {
            const std::lock_guard lock(_threadlessMutex);
            publish(_bundles.catchUp());
            action();
            return;
        }
        if (std::this_thread::get_id() == _thread->get_id()) {
            systemLog().defaultHandle().error("the registry was told to wait for a notice inside that notice");
            std::abort();
        }
        std::promise<void> done;
        {
            const std::lock_guard lock(_mutex);
            _actions.push_back([&] {
                action();
                done.set_value();
            });
        }
        want(Stage::watched);
        done.get_future().wait();
    }

    bool registerPlugIn(const std::string& path) {
        return change([&](const auto& tell) { return _bundles.registerPlugIn(path, tell); });
    }
    bool unregisterPlugIn(const std::string& path) {
        return change([&](const auto& tell) { return _bundles.unregisterPlugIn(path, tell); });
    }
    void settle() {
        perform([&] {
            if (_bundles.needsVerifying()) publish(_bundles.verify());
        });
    }

    const Root& root() const { return _root; }

private:
    template <class F> bool change(F&& action) {
        bool answer = false;
        perform([&] { answer = action([&](const auto& change) { publish(change); }); });
        return answer;
    }

    /// The thread is to go on to `stage` without delay.
    void want(Stage stage) {
        Stage wanted = _wanted.load();
        while (wanted < stage && !_wanted.compare_exchange_weak(wanted, stage)) {
        }
        wake();
    }

    void awaitStage(Stage stage) {
        if (_stage.load(std::memory_order_acquire) >= stage) return;
        want(stage);
        std::unique_lock lock(_mutex);
        _stageReached.wait(lock, [&] { return _stage.load(std::memory_order_relaxed) >= stage; });
    }

    bool isStopping() const {
        const std::lock_guard lock(_mutex);
        return _isStopping;
    }

    void wake() const {
        const std::uint64_t one = 1;
        // Fails only when the counter is full, and then the thread is awake.
        (void)!write(_wake.get(), &one, sizeof one);
    }

    /// Returns after `timeout` milliseconds, or when something happened on disk. Negative for no time-out.
    void awaitWake(int timeout) {
        pollfd waiting[] = {{_wake.get(), POLLIN, 0}, {_bundles.descriptor(), POLLIN, 0}};
        // What a kept watch has to tell is only heard when everything is watched.
        (void)poll(waiting, _bundles.stage() < Stage::watched ? 1 : 2, timeout);
        std::uint64_t count = 0;
        (void)!read(_wake.get(), &count, sizeof count);
    }

    void run() {
        while (_bundles.stage() < Stage::watched && !isStopping()) {
            if (_wanted.load() <= _bundles.stage()) awaitWake(startDelay);
            if (!isStopping()) publish(_bundles.catchUp());
            awaitWake(0); // takes the wakes for what was done; `_wanted`, which is set before, tells of others
        }
        // A look now would serve nobody, and what was handed over still holds for the next registry.
        if (_bundles.stage() < Stage::watched) return;
        wake(); // for actions that ended a delay
        while (true) {
            awaitWake(-1);
            std::vector<std::function<void()>> actions;
            bool isStopping = false;
            {
                const std::lock_guard lock(_mutex);
                actions.swap(_actions);
                isStopping = _isStopping;
            }
            publish(_bundles.catchUp());
            if (_isVerifyWanted.exchange(false)) publish(_bundles.verify());
            for (const auto& action : actions) action();
            if (isStopping) return;
        }
    }

    using Observers = std::vector<std::shared_ptr<RegistryObserver>>;

    /// From now on answers come from `snapshot`. Answers the observers that hear of it: those who came before.
    Observers show(std::shared_ptr<const RegistrySnapshot> snapshot) {
        _needsVerifying.store(_bundles.needsVerifying(), std::memory_order_relaxed);
        Observers observers;
        std::list<Answer> outdated; // they would keep what is gone
        {
            const std::lock_guard lock(_madeMutex);
            const std::lock_guard inner(_mutex);
            _snapshot.swap(snapshot);
            outdated.swap(_answers);
        }
        const std::lock_guard lock(_mutex);
        releaseAnswers();
        for (const auto& weak : _observers) {
            if (auto observer = weak.lock()) observers.push_back(std::move(observer));
        }
        return observers;
    }

    /// Before any notice, for observers ask, or wait for others who do. With the lock held.
    void releaseAnswers() {
        const Stage stage = _bundles.stage();
        if (_stage.exchange(stage) != stage) _stageReached.notify_all();
    }

    void publish(const InstalledBundles::Change& change) {
        _needsVerifying.store(_bundles.needsVerifying(), std::memory_order_relaxed);
        if (!change.isChanged) {
            const std::lock_guard lock(_mutex);
            return releaseAnswers();
        }
        const auto& [uuid, sequence] = _bundles.knowledge();
        // At the start nobody was told of what went while the registry was not running.
        const bool isStart = _stage.load(std::memory_order_relaxed) < Stage::verified;
        if (!change.removed.empty() && !change.installed.empty() && !isStart) {
            // What takes the place of another one is seen only after that one's end was told: the two may share a UUID.
            const auto observers = show(std::make_shared<RegistrySnapshot>(_bundles.installed(change.installed),
                                                                           Knowledge{UUID::random(), sequence - 1}));
            tellRemoved(observers, change.removed);
        }
        const auto observers = show(std::make_shared<RegistrySnapshot>(_bundles.installed(), _bundles.knowledge()));
        if (change.installed.empty() || isStart) tellRemoved(observers, change.removed);
        // Whoever made something of the old content has to hear that it is gone: an entitlement that was withdrawn must
        // not live on in a record.
        tellRemoved(observers, change.replaced);
        tellInstalled(observers, change.installed);
        tellInstalled(observers, change.renewed);
        if (!change.removed.empty()) discardContainers(change.removed);
    }

    /// After a container was made. That of a plug-in that went meanwhile nobody will discard with the plug-in.
    void noteContainer(const InstalledPlugIn& plugIn) {
        const auto current = snapshot()->plugIn(plugIn.uuid);
        if (current && current->identifier == plugIn.identifier) return;
        const std::lock_guard lock(_madeMutex);
        _containersLeft.insert(*plugIn.identifier);
    }

    /// The containers of plug-ins that went without leaving anything in them go too: a bundle whose identifier is
    /// rewritten again and again would leave a directory for each. Those made meanwhile go the next time.
    void discardContainers(const PlugIns& removed) {
        std::set<std::string> unused;
        {
            const std::lock_guard lock(_madeMutex);
            unused.swap(_containersLeft);
        }
        for (const auto& [path, plugIn] : removed) {
            if (plugIn->identifier) unused.insert(*plugIn->identifier);
        }
        for (const auto& [path, plugIn] : _bundles.plugIns()) {
            if (plugIn->identifier) unused.erase(*plugIn->identifier);
        }
        for (const auto& identifier : unused) _containers.discardEmpty(identifier);
    }

    void tellRemoved(const Observers& observers, const PlugIns& plugIns) {
        if (observers.empty() || plugIns.empty()) return;
        const auto notice = noticeOf(plugIns);
        for (const auto& observer : observers) observer->pluginsWillUninstall(notice);
    }

    void tellInstalled(const Observers& observers, const PlugIns& plugIns) {
        if (observers.empty() || plugIns.empty()) return;
        const auto notice = noticeOf(plugIns);
        for (const auto& observer : observers) observer->pluginsDidInstall(notice);
    }

    /// A list of proxies, and what it was an answer to.
    struct Answer {
        std::vector<EqualityTest> tests;
        std::weak_ptr<const RegistrySnapshot> snapshot;
        std::uint64_t languages;
        PlugInProxies proxies;
    };

    PlugInProxies knownAnswer(const std::vector<EqualityTest>& tests,
                              const std::shared_ptr<const RegistrySnapshot>& snapshot, const Languages& languages) {
        const std::lock_guard lock(_madeMutex);
        const auto known = std::ranges::find_if(_answers, [&](const Answer& answer) {
            return answer.languages == languages.generation && answer.tests == tests &&
                   answer.snapshot.lock() == snapshot;
        });
        if (known == _answers.end()) return nullptr;
        _answers.splice(_answers.begin(), _answers, known);
        return known->proxies;
    }

    void keepAnswer(const std::vector<InstalledPlugInRef>& plugIns, Answer answer) {
        if (!isWorthKeeping(answer.tests)) return;
        const std::lock_guard lock(_madeMutex);
        // Those who ask now do not ask what is gone.
        if (answer.languages != _languages->generation || answer.snapshot.lock() != snapshot()) return;
        // A proxy that was not kept is to be made anew for each answer.
        for (std::size_t i = 0; i < plugIns.size(); ++i) {
            if (plugIns[i]->proxy.object != (*answer.proxies)[i]) return;
        }
        _answers.push_front(std::move(answer));
        if (_answers.size() > maximumAnswers) _answers.pop_back();
    }

    /// Nobody needs the container of a plug-in that is only told of, so none is made.
    std::vector<PlugInProxyRef> noticeOf(const PlugIns& plugIns) {
        const auto current = languages();
        std::vector<PlugInProxyRef> notice;
        for (const auto& [path, plugIn] : plugIns) {
            PlugInProxyRef made = madeOf(plugIn->proxy, *current);
            notice.push_back(made ? std::move(made) : describe(*plugIn, *current));
        }
        return notice;
    }

    template <class T> std::shared_ptr<const T> madeOf(const Made<T>& made, const Languages& languages) const {
        const std::lock_guard lock(_madeMutex);
        return made.generation == languages.generation ? made.object : nullptr;
    }

    /// Files are read without the lock, so another thread may have been first: all get the same object.
    template <class T>
    std::shared_ptr<const T> keep(Made<T>& made, std::shared_ptr<T> object, const Languages& languages) const {
        const std::lock_guard lock(_madeMutex);
        if (!made.object || made.generation < languages.generation) made = {std::move(object), languages.generation};
        return made.object;
    }

    static bool isDataOnly(const Dictionary& info) {
        const auto extension = info.dictionary("VKExtension");
        return extension && extension->string("VKExtensionProtocol") == "#Data";
    }

    std::shared_ptr<PlugInProxy> describe(const InstalledPlugIn& plugIn, const Languages& languages) {
        const BundleFacts& facts = *plugIn.facts;
        const Dictionary& info = facts.info->dictionary();
        const LocalizedNames names(plugIn.path, facts, languages);
        auto proxy = std::make_shared<PlugInProxy>();
        proxy->uuid = plugIn.uuid;
        proxy->bundleURL = URL::file(plugIn.path);
        proxy->plugInIdentifier = plugIn.identifier;
        proxy->originalIdentifier = plugIn.originalIdentifier;
        proxy->bundleIdentifier = text(info, "VBBundleIdentifier");
        proxy->bundleVersion = text(info, "VBBundleVersion");
        proxy->plugInDictionary = plugInDictionary(info);
        proxy->infoDictionary = info;
        if (facts.entitlements) proxy->entitlements = facts.entitlements->dictionary();
        proxy->registrationDate = plugIn.registered;
        proxy->onSystemPartition = isAtOrBelow(plugIn.path, _root.system());
        proxy->localizedName = names.name();
        proxy->localizedShortName = names.shortName();
        proxy->containingBundle = record(plugIn.application, languages);
        return proxy;
    }

    const Root _root;
    platform::Locale& _locale;
    platform::Containers& _containers;
    InstalledBundles _bundles; // the thread's own, once that runs

    mutable std::mutex _mutex; // nothing else is locked and nobody called while it is held
    std::shared_ptr<const RegistrySnapshot> _snapshot;
    std::vector<std::weak_ptr<RegistryObserver>> _observers;
    std::vector<std::function<void()>> _actions;
    bool _isStopping = false;
    std::atomic<Stage> _stage = Stage::stored; // how far the snapshot tells what is on disk
    std::condition_variable _stageReached;
    std::atomic<Stage> _wanted = Stage::stored; // how far somebody waits for

    mutable std::mutex _madeMutex; // for everything that was made of records; only `_mutex` is locked inside it
    std::shared_ptr<const Languages> _languages;
    std::list<Answer> _answers;            // the last used one first
    std::set<std::string> _containersLeft; // identifiers of plug-ins that are gone

    std::atomic<bool> _needsVerifying = false;
    std::atomic<bool> _isVerifyWanted = false;
    const Descriptor _wake;
    std::mutex _threadlessMutex;
    std::promise<void> _ended;
    const std::future<void> _end = _ended.get_future();
    std::optional<std::thread> _thread; // none when the system had no thread left: then nothing is noticed by itself
};

Registry::Registry(const Root& root, platform::Locale& locale, platform::Containers& containers, RegistryLimits limits,
                   DescriptorStore* descriptors)
    : _implementation(std::make_unique<Implementation>(root, locale, containers, limits, descriptors)) {}

Registry::~Registry() = default;

void Registry::addObserver(std::weak_ptr<RegistryObserver> observer) {
    _implementation->addObserver(std::move(observer));
}

PlugInProxies Registry::installedPlugIns() { return _implementation->answer({}); }

PlugInProxies Registry::plugInsMatching(const Dictionary& query, const Filter& filter) {
    const auto tests = equalityTests(query);
    if (!filter) return _implementation->answer(tests);
    auto plugIns = _implementation->matching(tests);
    std::erase_if(plugIns, [&](const auto& plugIn) {
        const auto& stored = plugIn->facts->entitlements;
        const auto entitlements = stored ? std::optional(stored->dictionary()) : std::nullopt;
        return !filter(plugIn->identifier.value_or(std::string()), entitlements);
    });
    return std::make_shared<const std::vector<PlugInProxyRef>>(_implementation->proxies(plugIns));
}

PlugInProxyRef Registry::plugInForUUID(const UUID& uuid) {
    const auto plugIn = _implementation->lookUp([&](const RegistrySnapshot& known) { return known.plugIn(uuid); });
    return plugIn ? _implementation->proxy(plugIn, *_implementation->languages()) : nullptr;
}

PlugInProxyRef Registry::plugInForURL(const URL& url) {
    if (!url.isFile()) return nullptr;
    const auto plugIn =
        _implementation->lookUp([&](const RegistrySnapshot& known) { return known.plugInAt(url.path()); });
    return plugIn ? _implementation->proxy(plugIn, *_implementation->languages()) : nullptr;
}

std::shared_ptr<const ApplicationRecord> Registry::applicationForURL(const URL& url) {
    const auto application = url.isFile() ? _implementation->snapshotForAnswer()->applicationAt(url.path()) : nullptr;
    return application ? _implementation->record(application, *_implementation->languages()) : nullptr;
}

std::vector<PlugInProxyRef> Registry::plugInsOfApplication(const ApplicationRecord& application) {
    return _implementation->proxies(_implementation->snapshotForAnswer()->plugInsOf(application.bundleURL.path()));
}

bool Registry::mayRegister(const URL& url, const AuditToken& peer) {
    if (!url.isFile()) return false;
    if (geteuid() != 0) return true; // it reads nothing but what its own user may read
    const ActingAsPeer acting(rightsOfPeer(peer));
    if (!acting.isReady()) return false;
    const Descriptor manifest = openReference(url.path() + "/" + manifestName, RESOLVE_NO_SYMLINKS);
    return manifest && faccessat(AT_FDCWD, procPath(manifest.get()).c_str(), R_OK, AT_EACCESS) == 0;
}

bool Registry::registerPlugIn(const URL& url) {
    // One bundle under two names would be two plug-ins. A link that comes into the way from now on is not followed.
    return url.isFile() && canonical(url.path()) == url.path() && _implementation->registerPlugIn(url.path());
}

bool Registry::unregisterPlugIn(const URL& url) {
    return url.isFile() && _implementation->unregisterPlugIn(url.path());
}

void Registry::clearSchemaCaches() { _implementation->clearSchemaCaches(); }

std::optional<UUID> Registry::knowledgeUUID() { return _implementation->knowledgeUUID(); }

std::uint64_t Registry::knowledgeSequenceNumber() { return _implementation->snapshot()->knowledge().sequence; }

std::map<std::string, std::string>
Registry::localizedStrings(const PlugInProxy& proxy, const std::set<std::string>& keys, const std::string& table) {
    std::map<std::string, std::string> answer;
    if (!proxy.bundleURL || !proxy.bundleURL->isFile() || keys.empty()) return answer;
    const StringTables tables(proxy.bundleURL->path(), table, _implementation->languages()->order);
    for (const auto& key : keys) {
        if (auto string = tables.string(key)) answer.emplace(key, *std::move(string));
    }
    return answer;
}

std::optional<Dictionary> Registry::sdkDictionary(const std::string& extensionPoint) {
    return readSDKFile(_implementation->root(), extensionPoint);
}

void Registry::settle() { _implementation->settle(); }

void Registry::stop(std::chrono::milliseconds patience) { _implementation->stop(patience); }

} // namespace platform::linux_
