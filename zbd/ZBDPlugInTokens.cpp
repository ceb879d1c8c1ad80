#include "Zembra/ZBLog.h"
#include "Zembra/ZBManifest.h"
#include "Zembra/ZBProtocol.h"
#include "Zembra/ZBSandboxExtension.h"
#include "zbd/ZBDPlugIn.h"

#include <system_error>

namespace zbd {

namespace log = zembra::log;
namespace manifest = zembra::manifest;
using platform::Array;
using platform::MutableDictionary;
using platform::Value;

namespace {

/// The resource that stands for the whole bundle directory.
constexpr std::string_view wholeBundle = ".";

std::string errnoText(const platform::Error& error) {
    return std::generic_category().message(static_cast<int>(error.code));
}

} // namespace

void ZBDPlugIn::augmentForm(MutableDictionary& form) const {
    currentInfo(); // takes over the registry's knowledge, which kept tokens have to match
    auto tokens = _keptTokens.get();
    if (!tokens || !tokens->knowledge || tokens->knowledge != _cxKnowledgeUUID.get() ||
        log::sandbox().isEnabled(platform::LogLevel::debug)) { // whose reader sees each token issued
        tokens = issueTokens();
        _keptTokens.set(tokens->mayBeKept ? tokens : nullptr);
    }
    if (tokens->extensions) form.set(zembra::formKey::extensions, tokens->extensions);
    if (tokens->service) form.set(zembra::formKey::serviceExtension, tokens->service);
}

std::shared_ptr<const ZBDPlugIn::Tokens> ZBDPlugIn::issueTokens() const {
    auto tokens = std::make_shared<Tokens>();
    tokens->knowledge = _cxKnowledgeUUID.get();
    Value resources = pluginKey(manifest::shared);
    if (isAppExtension()) resources = Array{Value(wholeBundle)};
    if (resources) tokens->extensions = issueResourceExtensions(resources);
    // The registry notices when a bundle directory is replaced, and then knows more; of single files within it does
    // not.
    tokens->mayBeKept = !resources || (isAppExtension() && !tokens->extensions.dictionary()->empty());
    if (isData()) return tokens;

    const Value bundleIdentifier = infoKey(manifest::bundleIdentifier);
    const auto token =
        zembra::issueServiceLookupToken(_platform.sandbox, std::string(bundleIdentifier.string().value_or("")));
    if (token) {
        tokens->service = *token;
    } else {
        tokens->mayBeKept = false; // a refusal is logged each time
        log::ops().info("failed to make mach extension for %@ in plug-in at %@: %{public}s", bundleIdentifier, path(),
                        errnoText(token.error()));
    }
    return tokens;
}

MutableDictionary ZBDPlugIn::issueResourceExtensions(const Value& resources) const {
    const Array elements = resources.string() ? Array{resources} : resources.array().value_or(Array());
    const auto bundle = *url();
    MutableDictionary tokens;
    for (const Value& element : elements) {
        const auto resource = element.string();
        if (!resource) continue;
        const auto location = *resource == wholeBundle ? bundle : bundle.appending(*resource);
        // What a manifest calls its own must lie inside its bundle, also behind symbolic links.
        const auto token = zembra::issueFileReadToken(_platform.sandbox, location, bundle.path());
        if (token) {
            tokens.set(*resource, *token);
        } else {
            log::ops().info("failed to make extension for %@ in plug-in at %@: %{public}s", location.path(),
                            bundle.path(), errnoText(token.error()));
        }
    }
    return tokens;
}

} // namespace zbd
