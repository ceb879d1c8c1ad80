#include "Zembra/ZBPlugInCore.h"
#include "Zembra/ZBProtocol.h"
#include "Zembra/ZBSandboxExtension.h"
#include "platform/linux/Landlock.h"
#include "platform/linux/Sandbox.h"
#include "samples/host/Host.h"

#include <array>
#include <fstream>
#include <iostream>
#include <sys/prctl.h>
#include <unistd.h>

namespace host {

namespace formKey = zembra::formKey;
namespace linux_ = platform::linux_;
using platform::Dictionary;

namespace {

constexpr const char* wholeBundle = "."; // the key of the token that opens the bundle directory

/// The bundle was opened by the daemon's broker, and so is the file: no permission of this process is asked for again.
bool showFile(linux_::Sandbox& sandbox, const std::string& token, const std::string& name) {
    const auto extension = zembra::ZBSandboxExtension::initWithExtension(sandbox, token);
    extension->consume();
    if (extension->handle() < 0) {
        complain("the token opens nothing");
        return false;
    }
    const auto file = sandbox.open(extension->handle(), name);
    if (!file) {
        complain(name + ": " + file.error().text());
        return false;
    }
    std::cout << "reads " << name << ":\n" << std::flush;
    std::array<char, 4096> buffer{};
    for (ssize_t size = 0; (size = read(file->get(), buffer.data(), buffer.size())) > 0;)
        std::cout.write(buffer.data(), size);
    return true;
}

/// From here on the process opens nothing by itself, as a host that shows what strangers wrote should.
platform::Failure confineSelf() {
    static_cast<void>(prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0)); // enforcing tells when it failed
    linux_::LandlockRules rules(linux_::landlockVersion());
    if (auto failure = rules.begin(linux_::Network::none)) return failure;
    return rules.enforce();
}

int showPlugIn(Daemon& daemon, const Words& words, bool isConfined) {
    const auto form = daemon.find(words.front());
    const auto plugIn = form ? zembra::ZBPlugInCore::initWithForm(*form) : nullptr;
    if (!plugIn) return 1;
    const auto tokens = form->dictionary(formKey::extensions).value_or(Dictionary());
    std::cout << "name    " << textOf(form->string(formKey::localizedName)) << '\n'
              << "uuid    " << textOf(form->string(formKey::uuid)) << '\n'
              << "path    " << plugIn->path() << '\n'
              << "code    " << (plugIn->isData() ? "none, data only" : "an executable") << '\n'
              << "tokens  " << tokens.size() << " to read files, "
              << (form->contains(formKey::serviceExtension) ? 1 : 0) << " to look up its service\n";
    if (words.size() == 1) return 0;

    const auto token = tokens.string(wholeBundle);
    if (!token) {
        complain("no token for the bundle");
        return 1;
    }
    linux_::Sandbox sandbox(daemon.root(), linux_::SandboxRole::consumer);
    if (isConfined) {
        if (const auto failure = confineSelf()) {
            complain("cannot be confined: " + failure->text());
            return 1;
        }
        const std::string path = plugIn->path() + '/' + words[1];
        std::cout << "alone   " << (std::ifstream(path) ? "can" : "cannot") << " open it\n";
    }
    return showFile(sandbox, std::string(*token), words[1]) ? 0 : 1;
}

} // namespace

int show(Daemon& daemon, const Words& words) { return showPlugIn(daemon, words, false); }

int showConfined(Daemon& daemon, const Words& words) { return showPlugIn(daemon, words, true); }

} // namespace host
