#include "Zembra/ZBSandboxExtension.h"

#include "Zembra/ZBLog.h"
#include "Zembra/ZBProtocol.h"

namespace zembra {

namespace {

/// What stands in messages for a token: it is worth what it names to whoever reads it, also where logs show what is
/// private.
constexpr const char* hiddenToken = "<token>";

} // namespace

platform::Result<std::string> issueFileReadToken(platform::Sandbox& sandbox, const platform::URL& url,
                                                 const std::string& within) {
    auto token =
        sandbox.issueFile(platform::sandboxReadExtensionClass, url.path(), platform::SandboxFlag::canonical, within);
    if (token) log::sandbox().debug("issued file extension for %s -> %s", url.path(), hiddenToken);
    return token;
}

platform::Result<std::string> issueServiceLookupToken(platform::Sandbox& sandbox, const std::string& service) {
    auto token = sandbox.issueService(serviceExtensionClass, service);
    if (token) log::sandbox().debug("issued mach extension for %s -> %s", service, hiddenToken);
    return token;
}

std::shared_ptr<ZBSandboxExtension> ZBSandboxExtension::initWithExtension(platform::Sandbox& sandbox,
                                                                          std::string token) {
    return std::shared_ptr<ZBSandboxExtension>(new ZBSandboxExtension(sandbox, std::move(token)));
}

ZBSandboxExtension::ZBSandboxExtension(platform::Sandbox& sandbox, std::string token)
    : _sandbox(sandbox), _token(std::move(token)) {}

ZBSandboxExtension::~ZBSandboxExtension() { expel(); }

void ZBSandboxExtension::consume() {
    if (_handle != -1) return;
    const std::string token = _token.get();
    int errorNumber = 0;
    _handle = _sandbox.consume(token, errorNumber);
    if (_handle != -1) {
        log::sandbox().debug("consuming extension %s -> %ld", hiddenToken, _handle);
    } else {
        log::sandbox().notice("failed to consume extension %s - errno=%d", hiddenToken, errorNumber);
    }
}

void ZBSandboxExtension::expel() {
    if (_handle == -1) return;
    int errorNumber = 0;
    if (_sandbox.release(_handle, errorNumber) == 0) {
        log::sandbox().debug("releasing extension %ld", _handle);
    } else {
        log::sandbox().notice("failed to release extension %ld - errno=%d", _handle, errorNumber);
    }
    _handle = -1;
}

} // namespace zembra
