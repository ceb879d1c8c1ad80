#include "Zembra/ZBLog.h"
#include "Zembra/ZBManifest.h"
#include "Zembra/ZBProtocol.h"
#include "Zembra/ZBSandboxExtension.h"
#include "zbd/ZBDPlugIn.h"

#include <algorithm>
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

void ZBDPlugIn::augmentForm(MutableDictionary& form, const KeptFormRef& kept, const FormCompletion& completion) const {
    const TokenNeeds own = kept ? TokenNeeds() : tokenNeeds();
    const TokenNeeds& needs = kept ? kept->tokens : own;
    bool hasAll = true;
    if (needs.resources) {
        const auto tokens = issueResourceTokens(needs.resources);
        const Value* present = form.find(zembra::formKey::extensions);
        if (!present || !shows(present->dictionary(), tokens.granted)) {
            form.set(zembra::formKey::extensions, dictionaryOf(tokens.granted));
        }
        hasAll = tokens.areAll;
    }
    if (needs.serviceOfBundle) hasAll = augmentWithService(form, *needs.serviceOfBundle) && hasAll;
    if (!kept) return;
    // The log tells each time of what was refused.
    const FormCompletion reached = hasAll ? completion : FormCompletion();
    if (form.isUnchangedFrom(kept->form)) return kept->lastCompletion.set(reached);
    if (!_keptForm.read([&](const auto& field) { return field == kept; })) return; // something newer is there
    KeptForm changed = *kept;
    changed.form = form.keepingEncoding();
    changed.lastCompletion.set(reached);
    keepForm(std::move(changed));
}

/// False when the service is refused.
bool ZBDPlugIn::augmentWithService(MutableDictionary& form, const Value& bundleIdentifier) const {
    const auto token =
        zembra::issueServiceLookupToken(_platform.sandbox, std::string(bundleIdentifier.string().value_or("")));
    if (!token) {
        form.remove(zembra::formKey::serviceExtension);
        log::ops().info("failed to make mach extension for %@ in plug-in at %@: %{public}s", bundleIdentifier, path(),
                        errnoText(token.error()));
    } else if (form.string(zembra::formKey::serviceExtension) != *token) {
        form.set(zembra::formKey::serviceExtension, *token);
    }
    return static_cast<bool>(token);
}

TokenNeeds ZBDPlugIn::tokenNeeds() const {
    TokenNeeds needs;
    needs.resources = isAppExtension() ? Value(Array{Value(wholeBundle)}) : pluginKey(manifest::shared);
    if (!isData()) needs.serviceOfBundle = infoKey(manifest::bundleIdentifier);
    return needs;
}

MutableDictionary ZBDPlugIn::issueResourceExtensions(const Value& resources) const {
    return dictionaryOf(issueResourceTokens(resources).granted);
}

MutableDictionary ZBDPlugIn::dictionaryOf(const std::vector<IssuedToken>& tokens) {
    MutableDictionary dictionary;
    for (const auto& [resource, text] : tokens) dictionary.set(resource, text);
    return dictionary;
}

/// False also when a resource is named twice, for then there are fewer entries than tokens.
bool ZBDPlugIn::shows(const std::optional<platform::Dictionary>& dictionary, const std::vector<IssuedToken>& tokens) {
    return dictionary && dictionary->size() == tokens.size() &&
           std::all_of(tokens.begin(), tokens.end(), [&](const IssuedToken& token) {
               return dictionary->string(*token.resource.string()) == token.text;
           });
}

ZBDPlugIn::IssuedTokens ZBDPlugIn::issueResourceTokens(const Value& resources) const {
    const Array elements = resources.string() ? Array{resources} : resources.array().value_or(Array());
    const auto bundle = *url();
    IssuedTokens tokens;
    for (const Value& element : elements) {
        const auto resource = element.string();
        if (!resource) continue;
        const std::optional<platform::URL> inside =
            *resource == wholeBundle ? std::nullopt : std::optional(bundle.appending(*resource));
        const platform::URL& location = inside ? *inside : bundle;
        // What a manifest calls its own must lie inside its bundle, also behind symbolic links.
        auto token = zembra::issueFileReadToken(_platform.sandbox, location, bundle.path());
        if (token) {
            tokens.granted.push_back({element, *std::move(token)});
        } else {
            tokens.areAll = false;
            log::ops().info("failed to make extension for %@ in plug-in at %@: %{public}s", location.path(),
                            bundle.path(), errnoText(token.error()));
        }
    }
    return tokens;
}

} // namespace zbd
