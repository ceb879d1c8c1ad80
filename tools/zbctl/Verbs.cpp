#include "tools/zbctl/Verbs.h"

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
using platform::ReplyOrError;
using platform::Result;
using platform::Value;
using zembra::ZBDaemonClient;

namespace {

/// The protocol has strings of UTF-8 only; a name that is none cannot be asked for.
std::optional<std::string> absolutePath(const std::string& path) {
    if (path.empty() || platform::linux_::firstBadByte(path)) {
        complain("\"" + path + "\" is not a path in UTF-8");
        return std::nullopt;
    }
    std::error_code error;
    const auto absolute = std::filesystem::absolute(path, error);
    if (error) {
        complain(path + ": " + error.message());
        return std::nullopt;
    }
    return absolute.string();
}

/// For requests whose success has no content.
ExitStatus finish(const Common& common, const ReplyOrError& answer) {
    const ExitStatus status = report(answer);
    if (status == ExitStatus::success && common.json) printJson(std::cout, std::get<Dictionary>(answer));
    return status;
}

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

ExitStatus changeRegistration(const Common& common, Registration registration, const std::vector<std::string>& paths) {
    std::vector<std::string> absolutePaths;
    for (const auto& path : paths) {
        auto absolute = absolutePath(path);
        if (!absolute) return ExitStatus::usage;
        absolutePaths.push_back(*std::move(absolute));
    }
    const auto operation =
        registration == Registration::add ? &ZBDaemonClient::addPlugIns : &ZBDaemonClient::removePlugIns;
    Session session(common.service);
    return finish(common, session.ask([&](ZBDaemonClient& client, ZBDaemonClient::Callback callback) {
        (client.*operation)(absolutePaths, std::move(callback));
    }));
}

ExitStatus bulk(const Common& common, std::uint64_t flags) {
    Session session(common.service);
    return finish(common, session.ask([&](ZBDaemonClient& client, ZBDaemonClient::Callback callback) {
        client.bulkPlugins(flags, std::move(callback));
    }));
}

ExitStatus find(const Common& common, const Location& location) {
    std::optional<platform::UUID> uuid;
    std::optional<platform::URL> url;
    if (location.uuid) {
        uuid = platform::UUID::parse(*location.uuid);
        if (!uuid) complain('"' + *location.uuid + "\" is not a UUID");
    } else if (location.url) {
        url = platform::URL::parse(*location.url);
        if (!url) complain('"' + *location.url + "\" is not a URL");
    } else if (const auto path = absolutePath(location.path.value_or(""))) {
        url = platform::URL::file(*path);
    }
    if (!uuid && !url) return ExitStatus::usage;
    Session session(common.service);
    const auto answer = session.ask([&](ZBDaemonClient& client, ZBDaemonClient::Callback callback) {
        if (uuid)
            client.findPlugInByUUID(*uuid, std::move(callback));
        else
            client.findPlugInByPathURL(*url, std::move(callback));
    });
    if (const ExitStatus status = report(answer); status != ExitStatus::success) return status;

    const Value matches = std::get<Dictionary>(answer)[zembra::key::matches];
    const auto form = session.client().convertFromQMX(matches).dictionary();
    if (!form) {
        complain("the reply describes no plug-in"); // "matches" is absent or not decodable
        return ExitStatus::failure;
    }
    if (common.json)
        printJson(std::cout, *form);
    else
        printForm(std::cout, *form);
    return ExitStatus::success;
}

ExitStatus raw(const Common& common, const std::string& file) {
    const auto content = contentOf(file);
    if (!content) {
        complain(content.error().text());
        return ExitStatus::usage;
    }
    auto value = valueOf(*content);
    if (value) value = expandMarkers(*value);
    if (!value) {
        complain(file + ": " + value.error().text());
        return ExitStatus::usage;
    }
    const auto request = value->dictionary();
    if (!request) {
        complain(file + ": a request is a dictionary");
        return ExitStatus::usage;
    }

    Session session(common.service);
    const auto answer = session.ask(
        [&](ZBDaemonClient& client, ZBDaemonClient::Callback callback) { client.send(*request, std::move(callback)); });
    const ExitStatus status = report(answer);
    if (status == ExitStatus::noDaemon) return status;

    auto reply = platform::MutableDictionary::copyOf(std::get<Dictionary>(answer));
    if (const Value matches = session.client().convertFromQMX(reply[zembra::key::matches]))
        reply.set(zembra::key::matches, matches);
    if (common.json)
        printJson(std::cout, reply);
    else
        printTree(std::cout, reply);
    return status;
}

} // namespace zbctl
