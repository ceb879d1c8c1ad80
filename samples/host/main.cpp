// A host: finds one plug-in, shows what it learned, and reads a file inside the plug-in's bundle through the token that
// the daemon gave it.
//
//   Host UUID|PATH [FILE-IN-BUNDLE]

#include "Zembra/ZBDaemonClient.h"
#include "Zembra/ZBPlugInCore.h"
#include "Zembra/ZBProtocol.h"
#include "Zembra/ZBSandboxExtension.h"
#include "platform/linux/Descriptor.h"
#include "platform/linux/Root.h"
#include "platform/linux/Sandbox.h"
#include "platform/linux/Transport.h"
#include "platform/linux/WorkQueue.h"

#include <array>
#include <cstdio>
#include <fcntl.h>
#include <future>
#include <iostream>
#include <memory>
#include <optional>
#include <string>
#include <unistd.h>

namespace {

using namespace platform;
using linux_::Descriptor;

constexpr const char* wholeBundle = "."; // the key of the token that opens the bundle directory

ReplyOrError find(zembra::ZBDaemonClient& client, const std::string& location) {
    const auto answer = std::make_shared<std::promise<ReplyOrError>>();
    const auto callback = [answer](const ReplyOrError& reply) { answer->set_value(reply); };
    if (const auto uuid = UUID::parse(location))
        client.findPlugInByUUID(*uuid, callback);
    else
        client.findPlugInByPathURL(URL::file(location), callback);
    return answer->get_future().get();
}

std::string textOf(std::optional<std::string_view> text) { return std::string(text.value_or("(none)")); }

/// The bundle was opened by the daemon's broker: no permission of this process is asked for again.
bool showFile(linux_::Sandbox& sandbox, const std::string& token, const std::string& name) {
    const auto extension = zembra::ZBSandboxExtension::initWithExtension(sandbox, token);
    extension->consume();
    const int bundle = extension->handle() < 0 ? -1 : sandbox.descriptor(extension->handle());
    const Descriptor file(bundle < 0 ? -1 : openat(bundle, name.c_str(), O_RDONLY | O_CLOEXEC));
    if (file.get() < 0) {
        std::cerr << "Host: cannot read " << name << " through the token\n";
        return false;
    }
    std::cout << "reads " << name << ":\n" << std::flush;
    std::array<char, 4096> buffer{};
    for (ssize_t size = 0; (size = read(file.get(), buffer.data(), buffer.size())) > 0;)
        std::cout.write(buffer.data(), size);
    return true;
}

} // namespace

int main(int argc, char** argv) {
    if (argc < 2 || argc > 3) {
        std::cerr << "usage: Host UUID|PATH [FILE-IN-BUNDLE]\n";
        return 2;
    }
    const auto root = linux_::Root::ofProcess();
    linux_::WorkQueues queues;
    linux_::Transport transport(root);
    const auto client = zembra::ZBDaemonClient::initWithServiceName(transport, queues, std::nullopt);

    const auto answer = find(*client, argv[1]);
    if (const auto error = zembra::ZBDaemonClient::errorInReply(answer)) {
        std::cerr << "Host: error " << error->code << ": " << error->text() << '\n';
        return 1;
    }
    const auto form = client->convertFromQMX(std::get<Dictionary>(answer)[zembra::key::matches]).dictionary();
    const auto plugIn = form ? zembra::ZBPlugInCore::initWithForm(*form) : nullptr;
    if (!plugIn) {
        std::cerr << "Host: the reply describes no plug-in\n";
        return 1;
    }
    const auto tokens = form->dictionary(zembra::formKey::extensions).value_or(Dictionary());
    std::cout << "name    " << textOf(form->string(zembra::formKey::localizedName)) << '\n'
              << "uuid    " << textOf(form->string(zembra::formKey::uuid)) << '\n'
              << "path    " << plugIn->path() << '\n'
              << "code    " << (plugIn->isData() ? "none, data only" : "an executable") << '\n'
              << "tokens  " << tokens.size() << " to read files, "
              << (form->contains(zembra::formKey::serviceExtension) ? 1 : 0) << " to look up its service\n";
    if (argc == 2) return 0;

    const auto token = tokens.string(wholeBundle);
    if (!token) {
        std::cerr << "Host: no token for the bundle\n";
        return 1;
    }
    linux_::Sandbox sandbox(root, linux_::SandboxRole::consumer);
    return showFile(sandbox, std::string(*token), argv[2]) ? 0 : 1;
}
