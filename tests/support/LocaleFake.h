#pragma once

#include "platform/Locale.h"
#include "platform/linux/QueuedObservers.h"

namespace support {

/// The languages that the test sets; "en" alone at first. Callable from any thread.
class FakeLocale final : public platform::Locale {
public:
    /// Takes the list as it is. Observers hear of it when it differs from the last.
    void setLanguages(std::vector<std::string> languages) {
        {
            const std::lock_guard lock(_mutex);
            if (languages == _languages) return;
            _languages = std::move(languages);
        }
        _observers->notifyAll();
    }

    std::vector<std::string> languages() override {
        const std::lock_guard lock(_mutex);
        return _languages;
    }
    std::unique_ptr<platform::LocaleObservation> observeChanges(std::shared_ptr<platform::WorkQueue> queue,
                                                                std::function<void()> handler) override {
        return std::make_unique<platform::linux_::QueuedObservation<platform::LocaleObservation>>(
            _observers, _observers->add("", std::move(queue), std::move(handler)));
    }

private:
    const std::shared_ptr<platform::linux_::QueuedObservers> _observers =
        std::make_shared<platform::linux_::QueuedObservers>();
    std::mutex _mutex;
    std::vector<std::string> _languages{"en"};
};

} // namespace support
