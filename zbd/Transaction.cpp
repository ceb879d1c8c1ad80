#include "zbd/Transaction.h"

#include "Zembra/ZBLog.h"
#include "platform/Format.h"
#include "platform/TracePoints.h"
#include "zbd/ZBDQmxClient.h"
#include "zbd/ZBDServer.h"

#include <algorithm>
#include <array>
#include <optional>
#include <utility>

namespace zbd {

namespace log = zembra::log;
namespace key = zembra::key;
namespace code = zembra::code;
namespace requestType = zembra::requestType;
using platform::Value;

namespace {

constexpr std::size_t maximumPath = 1024; // bytes of a resolved path with its NUL; longer ones count as unresolved

struct RequestType {
    std::string_view name;
    void (Transaction::*handler)();
    bool isBrief = false;
};

constexpr std::array requestTypes{
    RequestType{requestType::add, &Transaction::addPlugIns},
    RequestType{requestType::remove, &Transaction::removePlugIns},
    RequestType{requestType::bulk, &Transaction::bulkPlugIns, true},
    RequestType{requestType::match, &Transaction::matchPlugIns},
    RequestType{requestType::ready, &Transaction::readyPlugIns},
    RequestType{requestType::access, &Transaction::accessPlugIns},
    RequestType{requestType::annotate, &Transaction::annotatePlugIns},
    RequestType{requestType::bulkAnnotate, &Transaction::bulkAnnotatePlugIns},
    RequestType{requestType::lock, &Transaction::lockDownPlugIns},
    RequestType{requestType::find, &Transaction::findPlugIn, true},
};

const RequestType* typeNamed(std::string_view name) {
    const auto found = std::find_if(requestTypes.begin(), requestTypes.end(),
                                    [&](const RequestType& type) { return type.name == name; });
    return found == requestTypes.end() ? nullptr : &*found;
}

} // namespace

Transaction::Transaction(const platform::ReceivedMessage& message, std::shared_ptr<ZBDQmxClient> client)
    : _client(std::move(client)), _request(*message.content.dictionary()), _reply(platform::createReply(message)) {}

std::shared_ptr<Transaction> Transaction::initWithRequest(const platform::ReceivedMessage& message,
                                                          std::shared_ptr<ZBDQmxClient> client) {
    return std::shared_ptr<Transaction>(new Transaction(message, std::move(client)));
}

const std::shared_ptr<ZBDServer>& Transaction::server() const { return _client->server(); }

std::shared_ptr<platform::Connection> Transaction::connection() const { return _client->connection(); }

bool Transaction::isBrief() const {
    const auto type = _request.string(key::request);
    const RequestType* known = type ? typeNamed(*type) : nullptr;
    if (known == nullptr || !known->isBrief || _request[key::paths]) return false;
    // A record that has to be made first takes files, and perhaps a look at the disk.
    const auto uuid = _request.uuid(key::uuids);
    return !uuid || server()->hasRecord(*uuid);
}

void Transaction::dispatch() {
    const auto type = _request.string(key::request);
    _version = _request.uint64(key::version).value_or(0);
    if (!zembra::isSupportedVersion(_version)) {
        return fail(code::version,
                    platform::format("unsupported protocol version %d (current %d)", _version, zembra::currentVersion));
    }
    if (!_client->acceptWork()) return;

    const std::optional<std::string> typeText(type);
    log::ops().debug("client %d requested %{public}s", _client->pid(), typeText);
    platform::trace::request(_client->pid(), typeText ? typeText->c_str() : nullptr);
    if (!type) return fail(code::malformed, "invalid request format (missing type)");
    if (const RequestType* known = typeNamed(*type)) return (this->*known->handler)();
    fail(code::malformed, "unrecognized request");
}

void Transaction::done() {
    saveChanges();
    if (platform::trace::requestOutputEnabled()) {
        platform::trace::requestOutput(_client->pid(), Value(_reply.content).description().c_str());
    }
    if (const auto peer = connection()) peer->send(_reply);
}

void Transaction::fail(std::uint64_t errorCode, std::string_view message) {
    reply().set(key::errorcode, errorCode);
    reply().set(key::error, message);
    done();
}

void Transaction::fail(std::uint64_t errorCode, const platform::Error& error) {
    const bool own = error.domain == zembra::errorDomain;
    fail(own ? static_cast<std::uint64_t>(error.code) : errorCode, error.text());
}

bool Transaction::marshalPaths(const PathCallback& callback) {
    const auto paths = _request.array(key::paths);
    if (!paths) {
        fail(code::malformed, "invalid request format");
        return false;
    }
    for (const Value& element : *paths) {
        const auto text = element.string();
        if (!text) {
            fail(code::malformed, "invalid request format");
            return false;
        }
        const std::string path(*text);
        if (!path.starts_with('/')) {
            fail(code::badPath, platform::format("absolute path required: %s", path));
            return false;
        }
        const auto resolved = realPath(path);
        if (!callback(resolved.value_or(path), resolved.has_value())) return false;
    }
    return true;
}

bool Transaction::processPaths(const PathCallback& callback) {
    const bool isComplete = marshalPaths(callback);
    if (isComplete) done();
    return isComplete;
}

/// The path as the client's user may see it; none for what does not exist, and for what that user cannot reach.
std::optional<std::string> Transaction::realPath(const std::string& path) const {
    const auto resolved = server()->platform().files.realPath(path, maximumPath, _client->auditToken());
    return resolved ? std::optional(*resolved) : std::nullopt;
}

bool Transaction::processUuidList(const PlugInCallback& callback) {
    const auto list = uuidList();
    if (!list) return false;
    for (std::size_t i = 0; i < list->uuids.size(); ++i) {
        const auto plugIn = plugInOfList(*list, i);
        if (!plugIn || !callback(plugIn)) return false;
    }
    return true;
}

/// None when it has answered that there is no such list.
std::optional<Transaction::UuidList> Transaction::uuidList() {
    const auto uuids = _request.array(key::uuids);
    if (!uuids) {
        fail(code::malformed, "invalid request format (uuid)");
        return std::nullopt;
    }
    UuidList list{*uuids, std::nullopt};
    if (const Value value = _request[key::paths]) {
        list.paths = value.array();
        if (!list.paths) {
            log::traffic().notice("Paths present but not an array (ignoring values)");
        } else if (list.paths->size() != uuids->size()) {
            log::traffic().notice("Paths present but has different count than UUIDs (ignoring)");
            list.paths.reset();
        }
    }
    return list;
}

/// Null when it has answered that there is no such plug-in.
ZBDPlugInRef Transaction::plugInOfList(const UuidList& list, std::size_t index) {
    const Value& element = list.uuids[index];
    if (element.kind() != platform::Kind::uuid) {
        fail(code::malformed, "invalid request (bad uuid array)");
        return nullptr;
    }
    const auto uuid = element.uuid();
    if (!uuid) {
        fail(code::malformed, "invalid request (uuid allocation failure)");
        return nullptr;
    }
    auto plugIn = server()->findPlugIn(*uuid);
    if (!plugIn && list.paths) {
        log::traffic().info("Failed to find plugin by %{uuid_t}.16P", *uuid);
        if (const auto path = (*list.paths)[index].string()) {
            log::traffic().info("Looking for plugin %{uuid_t}.16P by path %s", *uuid, *path);
            plugIn = server()->findPlugInAtPath(platform::URL::file(*path));
        }
    }
    if (!plugIn) fail(code::malformed, "no such plugin (uuid not found)");
    return plugIn;
}

} // namespace zbd
