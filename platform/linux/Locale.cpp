#include "platform/linux/Locale.h"

#include "platform/PropertyList.h"

#include <algorithm>
#include <cctype>
#include <cstdlib>
#include <filesystem>
#include <sys/inotify.h>

namespace platform::linux_ {

namespace {

constexpr std::string_view fileName = "Locale.vlist";
constexpr const char* languagesKey = "languages";
constexpr const char* lastLanguage = "en"; // every bundle is expected to speak it
constexpr std::size_t maximumFileSize = 65536;
constexpr std::size_t maximumLanguages = 32; // each costs a look for a directory in every bundle
constexpr std::size_t maximumLength = 35;    // RFC 5646, 4.4.1
constexpr std::uint32_t fileEvents = IN_CLOSE_WRITE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO;

/// Languages become names of directories, so nothing else than a tag passes.
bool isLanguage(std::string_view text) {
    return !text.empty() && text.size() <= maximumLength && text.front() != '-' && text.back() != '-' &&
           std::all_of(text.begin(), text.end(),
                       [](unsigned char c) { return c < 0x80 && (std::isalnum(c) != 0 || c == '-'); });
}

void add(std::vector<std::string>& languages, std::string_view language) {
    if (std::find(languages.begin(), languages.end(), language) == languages.end()) languages.emplace_back(language);
}

/// None when the file's content is not of this kind.
std::optional<std::vector<std::string>> languagesOfFile(std::string_view bytes) {
    const auto content = decodePropertyList(bytes);
    if (!content) return std::nullopt;
    const auto dictionary = content->dictionary();
    const auto array = dictionary ? dictionary->array(languagesKey) : std::nullopt;
    if (!array || array->size() > maximumLanguages) return std::nullopt;
    std::vector<std::string> languages;
    for (const auto& element : *array) {
        const auto language = element.string();
        if (!language || !isLanguage(*language)) return std::nullopt;
        add(languages, *language);
    }
    return languages;
}

} // namespace

Locale::Locale(const Root& root, platform::Files& files, std::vector<std::string> fallback)
    : _path(root.database() + '/' + std::string(fileName)),
      _files(files),
      _fallback(std::move(fallback)),
      _languages(_fallback),
      _watcher(root.database(), fileEvents,
               {.makeDirectory =
                    [directory = root.database()] {
                        std::error_code ignored; // shows when the directory is watched
                        std::filesystem::create_directories(directory, ignored);
                    },
                .changed =
                    [this](std::uint32_t, std::string_view name) {
                        if (name == fileName) read();
                    },
                .missed = [this] { read(); }}) {
    add(_languages, lastLanguage);
}

bool Locale::isWatched() {
    {
        const std::lock_guard lock(_mutex);
        if (_isWatched) return true;
    }
    // Watched before it is read: a change between the two is then told.
    const bool isWatched = _watcher.start();
    read();
    const std::lock_guard lock(_mutex);
    _isWatched = isWatched;
    return isWatched;
}

std::vector<std::string> Locale::languages() {
    isWatched();
    const std::lock_guard lock(_mutex);
    return _languages;
}

std::unique_ptr<LocaleObservation> Locale::observeChanges(std::shared_ptr<WorkQueue> queue,
                                                          std::function<void()> handler) {
    isWatched();
    return std::make_unique<QueuedObservation<LocaleObservation>>(
        _observers, _observers->add("", std::move(queue), std::move(handler)));
}

void Locale::read() {
    const std::lock_guard reading(_readMutex);
    std::vector<std::string> languages = _fallback;
    if (const auto bytes = _files.read(_path, maximumFileSize)) {
        auto stored = languagesOfFile(*bytes);
        if (!stored) return;
        languages = *std::move(stored);
    } else if (bytes.error().code != fileReadNoSuchFileCode) {
        return;
    }
    add(languages, lastLanguage);
    {
        const std::lock_guard lock(_mutex);
        if (languages == _languages) return;
        _languages = std::move(languages);
    }
    _observers->notifyAll();
}

std::vector<std::string> Locale::environmentLanguages() {
    for (const char* name : {"LC_ALL", "LC_MESSAGES", "LANG"}) {
        const char* value = std::getenv(name);
        if (value != nullptr && *value != '\0') return languagesOfName(value);
    }
    return {};
}

std::vector<std::string> Locale::languagesOfName(std::string_view name) {
    std::string language(name.substr(0, name.find_first_of(".@")));
    if (language == "C" || language == "POSIX") return {};
    std::replace(language.begin(), language.end(), '_', '-');
    if (!isLanguage(language)) return {};
    std::vector<std::string> languages{language};
    add(languages, std::string_view(language).substr(0, language.find('-')));
    return languages;
}

} // namespace platform::linux_
