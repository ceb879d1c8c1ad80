#include "Zembra/ZBBundle.h"
#include "Zembra/ZBManifest.h"
#include "Zembra/ZBPlugInCore.h"
#include "Zembra/ZBProtocol.h"
#include "Zembra/ZBUtilities.h"
#include "platform/Registry.h"
#include "platform/linux/Bundles.h"
#include "platform/linux/DirectoryFiles.h"
#include "platform/linux/Entitlements.h"
#include "platform/linux/Files.h"
#include "platform/linux/SDKFiles.h"
#include "tools/zbctl/Input.h"
#include "tools/zbctl/Output.h"
#include "tools/zbctl/Verbs.h"

#include <filesystem>
#include <iostream>

namespace zbctl {

namespace formKey = zembra::formKey;
namespace manifest = zembra::manifest;
using platform::Dictionary;
using platform::MutableDictionary;
using platform::PlugInProxyRef;
using platform::URL;
using platform::UUID;
using platform::Value;
using zembra::ZBBundle;
using zembra::ZBPlugInCore;

namespace {

/// Knows the SDK dictionaries and no plug-in: all that a bundle which nobody has registered needs of a registry.
class SDKRegistry final : public platform::Registry {
public:
    explicit SDKRegistry(platform::linux_::Root root) : _root(std::move(root)) {}

    std::optional<Dictionary> sdkDictionary(const std::string& extensionPoint) override {
        return platform::linux_::readSDKFile(_root, extensionPoint);
    }

    void addObserver(std::weak_ptr<platform::RegistryObserver>) override {}
    platform::PlugInProxies installedPlugIns() override { return nullptr; }
    platform::PlugInProxies plugInsMatching(const Dictionary&, const Filter&) override { return nullptr; }
    PlugInProxyRef plugInForUUID(const UUID&) override { return nullptr; }
    PlugInProxyRef plugInForURL(const URL&) override { return nullptr; }
    std::shared_ptr<const platform::ApplicationRecord> applicationForURL(const URL&) override { return nullptr; }
    std::vector<PlugInProxyRef> plugInsOfApplication(const platform::ApplicationRecord&) override { return {}; }
    bool registerPlugIn(const URL&) override { return false; }
    bool unregisterPlugIn(const URL&) override { return false; }
    bool mayRegister(const URL&, const platform::AuditToken&) override { return false; }
    void clearSchemaCaches() override {}
    std::optional<UUID> knowledgeUUID() override { return std::nullopt; }
    std::uint64_t knowledgeSequenceNumber() override { return 0; }
    std::map<std::string, std::string> localizedStrings(const platform::PlugInProxy&, const std::set<std::string>&,
                                                        const std::string&) override {
        return {};
    }

private:
    const platform::linux_::Root _root;
};

/// What was found out about one bundle.
struct Findings {
    platform::Failure own;    // the first configuration error of the manifest as it stands
    platform::Failure merged; // the same with the extension point's SDK dictionary below it
    Value sdk;                // the extension point, when it has one
    MutableDictionary form;
};

/// The nearest application around the bundle.
std::optional<URL> applicationAround(platform::Bundles& bundles, const std::string& bundlePath) {
    for (std::filesystem::path path = bundlePath; path.has_relative_path(); path = path.parent_path()) {
        if (path.extension() == ".app" && ZBBundle::initWithPath(bundles, path)->infoDictionary())
            return URL::file(path.string());
    }
    return std::nullopt;
}

/// The record as the daemon would make it; null for a manifest without plug-in dictionary or identifier.
std::shared_ptr<ZBPlugInCore> recordOf(platform::Bundles& bundles, const std::string& path, const Dictionary& info) {
    const auto declared = info.dictionary(manifest::extension).value_or(Dictionary());
    const Value ownIdentifier = declared[manifest::identifier];
    const Value identifier = ownIdentifier.string() ? ownIdentifier : info[manifest::bundleIdentifier];
    auto record = ZBPlugInCore::initWithName(identifier, URL::file(path), info, declared, std::nullopt);
    if (!record) return nullptr;
    const Value name = info[manifest::bundleName];
    const Value displayName = info[manifest::bundleDisplayName];
    record->setOriginalIdentifier(identifier);
    record->setLocalizedName(displayName ? displayName : name);
    record->setLocalizedShortName(name);
    record->setHubProtocolVersion(
        static_cast<std::uint64_t>(declared[manifest::hubProtocolVersion].integerValue().value_or(2)));
    record->setContainingUrl(applicationAround(bundles, path));
    record->setOnSystemVolume(platform::linux_::isAtOrBelow(path, platform::linux_::Root::ofProcess().system()));
    const auto executable =
        ZBBundle::initWithPath(bundles, path)->stringProperty(platform::BundleProperty::executablePath);
    if (executable) {
        const auto entitlements = platform::linux_::readEntitlements(*executable);
        if (entitlements && *entitlements) record->setEntitlements(**entitlements);
    }
    return record;
}

Findings examine(ZBPlugInCore& record) {
    Findings findings;
    findings.own = record.diagnose();
    if (!findings.own && !record.containingUrl() && !record.onSystemVolume())
        findings.own = zembra::errorWithCode(zembra::code::configuration, "neither in an application nor in System");
    findings.sdk = record.sdkSpec();
    SDKRegistry registry(platform::linux_::Root::ofProcess());
    record.resolveSDK(registry);
    findings.merged = record.diagnose();
    findings.form = record.exportForm(nullptr);
    // Known to the daemon alone.
    for (const auto key : {formKey::uuid, formKey::lastModified, formKey::annotations}) findings.form.remove(key);
    return findings;
}

void print(const Findings& findings) {
    const auto text = [](const platform::Failure& error) { return error ? error->text() : "no error"; };
    printTree(std::cout, Dictionary{{"configuration", text(findings.own)}, {"with its SDK", text(findings.merged)}});
    printForm(std::cout, findings.form);
}

Dictionary json(const Findings& findings) {
    MutableDictionary shown{{"form", findings.form}};
    if (findings.sdk) shown.set("sdk", findings.sdk);
    if (findings.own) shown.set("error", findings.own->text());
    if (findings.merged) shown.set("errorWithSDK", findings.merged->text());
    return shown;
}

ExitStatus inspect(const Invocation& invocation, const std::string& bundlePath) {
    const auto given = absolutePath(bundlePath);
    if (!given) return ExitStatus::usage;
    platform::linux_::Files files(platform::linux_::Root::ofProcess());
    platform::linux_::Bundles bundles(files);
    constexpr std::size_t longestPath = 4096;
    const auto path = files.realPath(*given, longestPath);
    const auto info = path ? ZBBundle::initWithPath(bundles, *path)->infoDictionary() : std::nullopt;
    if (!info) {
        complain(*given + ": no bundle with a readable Info.vlist");
        return ExitStatus::failure;
    }
    const auto record = recordOf(bundles, *path, *info);
    if (!record) {
        complain(*given + ": the manifest has no VKExtension dictionary or no identifier, so it is no plug-in");
        return ExitStatus::failure;
    }
    const Findings findings = examine(*record);
    if (invocation.json)
        printJson(std::cout, json(findings));
    else
        print(findings);
    return findings.own ? ExitStatus::failure : ExitStatus::success;
}

} // namespace

void addInspect(CLI::App& app, Invocation& invocation) {
    auto* verb = app.add_subcommand("inspect", "Show what a plug-in bundle would be, without the daemon");
    const auto path = std::make_shared<std::string>();
    verb->add_option("BUNDLE", *path, "The bundle's path")->required();
    verb->footer("Configuration errors come first: of the manifest as it stands, which is what the daemon judges, and\n"
                 "with the SDK dictionary of its extension point merged below it. The form is that of the merged one.\n"
                 "Exit status 1 when the daemon would refuse the bundle.");
    verb->callback([=, &invocation] { invocation.status = inspect(invocation, *path); });
}

} // namespace zbctl
