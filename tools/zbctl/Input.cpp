#include "tools/zbctl/Input.h"

#include "Zembra/ZBProtocol.h"
#include "platform/linux/Files.h"
#include "platform/linux/Utf8.h"
#include "tools/zbctl/Json.h"
#include "tools/zbctl/Output.h"

#include <filesystem>
#include <iostream>
#include <iterator>

namespace zbctl {

using platform::Dictionary;
using platform::Result;
using platform::UUID;
using platform::Value;
using zembra::ZBDaemonClient;

namespace {

Result<std::string> contentOf(const std::string& file) {
    constexpr std::size_t largestMessage = std::size_t{64} << 20U; // as the transport has it
    if (file == "-") return std::string(std::istreambuf_iterator<char>(std::cin), {});
    return platform::linux_::Files(platform::linux_::Root::ofProcess()).read(file, largestMessage);
}

/// JSON begins with a brace; neither encoding of a property list does.
Result<Value> valueOf(const std::string& content) {
    const std::size_t start = content.find_first_not_of(" \t\r\n");
    if (start == std::string::npos || content[start] != '{') return platform::decodePropertyList(content);
    const auto json = parseJson(content);
    if (!json) return json.error();
    return fromJson(*json);
}

} // namespace

std::optional<std::string> absolutePath(const std::string& path) {
    if (path.empty() || platform::linux_::firstBadByte(path)) {
        complain('"' + path + "\" is not a path in UTF-8");
        return std::nullopt;
    }
    std::error_code error;
    const auto absolute = std::filesystem::absolute(path, error);
    if (error) {
        complain(path + ": " + error.message());
        return std::nullopt;
    }
    // The daemon knows bundles by their real paths; what is gone by now may still be known by the one that it had.
    const auto real = std::filesystem::canonical(absolute, error);
    return (error ? absolute : real).string();
}

std::optional<std::vector<std::string>> absolutePaths(const std::vector<std::string>& paths) {
    std::vector<std::string> absolute;
    for (const auto& path : paths) {
        auto one = absolutePath(path);
        if (!one) return std::nullopt;
        absolute.push_back(*std::move(one));
    }
    return absolute;
}

std::optional<UUID> uuidOf(const std::string& text) {
    auto uuid = UUID::parse(text);
    if (!uuid) complain('"' + text + "\" is not a UUID");
    return uuid;
}

std::optional<Dictionary> dictionaryOf(const std::string& file) {
    const auto content = contentOf(file);
    if (!content) {
        complain(content.error().text());
        return std::nullopt;
    }
    auto value = valueOf(*content);
    if (value) value = expandMarkers(*value);
    if (!value) {
        complain(file + ": " + value.error().text());
        return std::nullopt;
    }
    auto dictionary = value->dictionary();
    if (!dictionary) complain(file + ": not a dictionary");
    return dictionary;
}

std::optional<Setting> settingOf(const std::string& text) {
    // One without a key, or one that would be sent as another text than was given, helps nobody.
    if (text.empty() || text.front() == '=' || platform::linux_::firstBadByte(text)) {
        complain('"' + text + "\" is not KEY or KEY=VALUE in UTF-8");
        return std::nullopt;
    }
    const std::size_t separator = text.find('=');
    const std::string value = separator == std::string::npos ? "true" : text.substr(separator + 1);
    return Setting{text.substr(0, separator),
                   value == "true" || value == "false" ? Value(value == "true") : Value(value)};
}

std::variant<std::vector<UUID>, ExitStatus> uuidsOf(Session& session, const std::vector<std::string>& plugIns) {
    std::vector<UUID> uuids;
    for (const auto& plugIn : plugIns) {
        if (const auto uuid = UUID::parse(plugIn)) {
            uuids.push_back(*uuid);
            continue;
        }
        const auto path = absolutePath(plugIn);
        if (!path) return ExitStatus::usage;
        const auto answer = session.ask([&](ZBDaemonClient& client, ZBDaemonClient::Callback callback) {
            client.findPlugInByPathURL(platform::URL::file(*path), std::move(callback));
        });
        if (const ExitStatus status = report(answer, *path); status != ExitStatus::success) return status;
        const auto form = session.matches(answer).dictionary();
        const auto text = form ? form->string(zembra::formKey::uuid) : std::nullopt;
        const auto uuid = text ? UUID::parse(*text) : std::nullopt;
        if (!uuid) {
            complain(*path + ": the reply describes no plug-in");
            return ExitStatus::failure;
        }
        uuids.push_back(*uuid);
    }
    return uuids;
}

} // namespace zbctl
