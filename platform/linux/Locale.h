#pragma once

#include "platform/Files.h"
#include "platform/Locale.h"
#include "platform/linux/DirectoryWatcher.h"
#include "platform/linux/QueuedObservers.h"
#include "platform/linux/Root.h"

#include <memory>
#include <mutex>
#include <string>
#include <vector>

namespace platform::linux_ {

/// The languages of the property list `<root>/var/db/Locale.vlist`, a dictionary with the array "languages"; without
/// that file those of the environment. The file is watched from the first question on. A file that is no such property
/// list changes nothing. Callable from any thread.
class Locale final : public platform::Locale {
public:
    /// `fallback` are the languages without a file.
    Locale(const Root& root, platform::Files& files, std::vector<std::string> fallback = environmentLanguages());

    /// Kept in memory: costs a lock once the file is watched.
    std::vector<std::string> languages() override;
    std::unique_ptr<LocaleObservation> observeChanges(std::shared_ptr<WorkQueue> queue,
                                                      std::function<void()> handler) override;

    /// The languages of this process's environment, as `languagesOfName` reads the first of LC_ALL, LC_MESSAGES and
    /// LANG that is set.
    static std::vector<std::string> environmentLanguages();
    /// A locale name as languages: "pt_BR.UTF-8" gives "pt-BR" and "pt"; "C" and what is no locale name give none.
    static std::vector<std::string> languagesOfName(std::string_view name);

private:
    bool isWatched();
    void read();

    const std::string _path;
    platform::Files& _files;
    const std::vector<std::string> _fallback;
    const std::shared_ptr<QueuedObservers> _observers = std::make_shared<QueuedObservers>();

    std::mutex _readMutex; // so that of two readers the later one's result stays
    std::mutex _mutex;
    std::vector<std::string> _languages;
    bool _isWatched = false;

    DirectoryWatcher _watcher; // last, so that its thread ends first
};

} // namespace platform::linux_
