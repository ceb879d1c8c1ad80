#include "Zembra/ZBManifest.h"
#include "Zembra/ZBProtocol.h"
#include "samples/host/Host.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

namespace host {

namespace formKey = zembra::formKey;
using platform::Dictionary;
using platform::MutableDictionary;
using zembra::ZBDaemonClient;

namespace {

constexpr const char* launcher = "zbignite"; // on the path

/// The launched program's exit status, or 128 and the number of the signal that ended it.
int launch(const std::string& identifier, Words::const_iterator begin, Words::const_iterator end) {
    Words words{launcher, identifier};
    words.insert(words.end(), begin, end);
    std::vector<char*> arguments;
    for (auto& word : words) arguments.push_back(word.data());
    arguments.push_back(nullptr);
    pid_t pid = 0;
    if (const int error = posix_spawnp(&pid, launcher, nullptr, nullptr, arguments.data(), environ)) {
        complain(std::string(launcher) + ": " + std::strerror(error));
        return 1;
    }
    int status = 0;
    while (waitpid(pid, &status, 0) < 0 && errno == EINTR) {
    }
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

} // namespace

int run(Daemon& daemon, const Words& words) {
    const auto form = daemon.find(words.front());
    const auto uuid = form ? platform::UUID::parse(textOf(form->string(formKey::uuid))) : std::nullopt;
    if (!uuid) return 1;
    const auto mark = std::find(words.begin(), words.end(), "--");
    std::optional<MutableDictionary> environment;
    for (auto word = words.begin() + 1; word < mark; ++word) {
        const std::size_t separator = word->find('=');
        if (separator == std::string::npos) {
            complain('"' + *word + "\" is not NAME=VALUE");
            return 2;
        }
        if (!environment) environment.emplace();
        environment->set(word->substr(0, separator), word->substr(separator + 1));
    }
    const auto reply = daemon.ask([&](ZBDaemonClient& client, ZBDaemonClient::Callback callback) {
        client.readyPlugIns({{textOf(form->string(formKey::path)), *uuid}}, 0, environment, std::move(callback));
    });
    if (!reply) return 1;
    const auto info = form->dictionary(formKey::bundleInfo).value_or(Dictionary());
    return launch(textOf(info.string(zembra::manifest::bundleIdentifier)), mark == words.end() ? mark : mark + 1,
                  words.end());
}

} // namespace host
