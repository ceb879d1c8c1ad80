#include "Zembra/ZBDaemonClient.h"

#include "Zembra/ZBLog.h"
#include "Zembra/ZBProtocol.h"
#include "Zembra/ZBUtilities.h"

namespace zembra {

using platform::Array;
using platform::ConnectionEvent;
using platform::Dictionary;
using platform::Failure;
using platform::MutableDictionary;
using platform::ReplyOrError;
using platform::TransportError;
using platform::UUID;
using platform::Value;

namespace {

bool hasPropertyListEncoding(std::uint64_t version) { return version == currentVersion; }

std::string descriptionOf(const ConnectionEvent& event) {
    if (const auto* error = std::get_if<TransportError>(&event)) return error->description;
    return std::get<platform::ReceivedMessage>(event).content.description();
}

Value shown(const ReplyOrError& reply) {
    if (const auto* error = std::get_if<TransportError>(&reply)) return error->description;
    return std::get<Dictionary>(reply);
}

} // namespace

std::shared_ptr<ZBDaemonClient> ZBDaemonClient::initWithServiceName(platform::Transport& transport,
                                                                    platform::WorkQueues& queues,
                                                                    const std::optional<std::string>& name) {
    return std::shared_ptr<ZBDaemonClient>(new ZBDaemonClient(transport, queues, name ? *name : serviceName));
}

ZBDaemonClient::ZBDaemonClient(platform::Transport& transport, platform::WorkQueues& queues, const std::string& name)
    : _replyQueue(queues.makeSerial("zbd_client")),
      _zbd(transport.connect(name, _replyQueue)),
      _protocolVersion(currentVersion) {
    _zbd->setEventHandler([](const ConnectionEvent& event) {
        log::ops().error("Communications error: %{public}@", descriptionOf(event));
    });
    _zbd->resume();
}

ZBDaemonClient::~ZBDaemonClient() {
    _zbd->setEventHandler([](const ConnectionEvent&) {}); // the end is no error when it is the client's own doing
    _zbd->cancel();
}

Failure ZBDaemonClient::errorInReply(const ReplyOrError& reply) {
    if (const auto* error = std::get_if<TransportError>(&reply)) {
        return errorWithCode(code::malformed, error->description);
    }
    const auto& message = std::get<Dictionary>(reply);
    const auto code = static_cast<std::int64_t>(message.uint64(key::errorcode).value_or(0));
    const auto text = message.string(key::error);
    if (code == 0) {
        if (text) fatalInternalError(platform::format("zbd reported error without a code: %s", *text));
        return std::nullopt;
    }
    return errorWithCode(code, text ? std::string(*text) : "unknown error returned by Zembra subsystem");
}

std::optional<Value> ZBDaemonClient::convertToQMX(const Value& value, std::uint64_t version) {
    if (!hasPropertyListEncoding(version)) return std::nullopt;
    return platform::compactData(value);
}

Value ZBDaemonClient::convertFromQMX(const Value& value) const {
    const auto bytes = value.data();
    if (!bytes || !hasPropertyListEncoding(static_cast<std::uint64_t>(_protocolVersion))) return {};
    auto decoded = platform::decodeCompact(*bytes, platform::UUIDs::refused);
    return decoded ? *std::move(decoded) : Value();
}

MutableDictionary ZBDaemonClient::request(std::string_view type) const {
    return {{key::request, type}, {key::version, static_cast<std::uint64_t>(_protocolVersion)}};
}

MutableDictionary ZBDaemonClient::request(std::string_view type, const std::vector<std::string>& paths) const {
    MutableDictionary message = request(type);
    message.set(key::paths, Array::of(paths));
    return message;
}

void ZBDaemonClient::set(MutableDictionary& message, const PlugIns& plugIns) {
    std::vector<Value> uuids;
    std::vector<Value> paths;
    for (const auto& [path, uuid] : plugIns) {
        uuids.emplace_back(uuid);
        paths.emplace_back(path);
    }
    message.set(key::uuids, Array(std::move(uuids)));
    message.set(key::paths, Array(std::move(paths)));
}

void ZBDaemonClient::set(MutableDictionary& message, const std::vector<UUID>& uuids) {
    message.set(key::uuids, Array::of(uuids));
}

void ZBDaemonClient::send(const Dictionary& message, Callback callback) {
    log::traffic().debug("request: %@", Value(message));
    _zbd->sendWithReply(message, _replyQueue, [callback = std::move(callback)](const ReplyOrError& reply) {
        log::traffic().debug("reply: %@", shown(reply));
        callback(reply);
    });
}

void ZBDaemonClient::addPlugIns(const std::vector<std::string>& paths, Callback callback) {
    send(request(requestType::add, paths), std::move(callback));
}

void ZBDaemonClient::removePlugIns(const std::vector<std::string>& paths, Callback callback) {
    send(request(requestType::remove, paths), std::move(callback));
}

void ZBDaemonClient::bulkPlugins(std::uint64_t flags, Callback callback) {
    MutableDictionary message = request(requestType::bulk);
    message.set(key::flags, flags);
    send(message, std::move(callback));
}

void ZBDaemonClient::readyPlugIns(const PlugIns& plugIns, std::uint64_t flags,
                                  const std::optional<Dictionary>& environment, Callback callback) {
    MutableDictionary message = request(requestType::ready);
    message.set(key::flags, flags);
    if (environment) message.set(key::environment, *environment);
    set(message, plugIns);
    send(message, std::move(callback));
}

void ZBDaemonClient::accessPlugIns(const PlugIns& plugIns, std::uint64_t flags, Callback callback) {
    MutableDictionary message = request(requestType::access);
    message.set(key::flags, flags);
    set(message, plugIns);
    send(message, std::move(callback));
}

void ZBDaemonClient::findPlugInByUUID(const UUID& uuid, Callback callback) {
    log::ops().notice("findPlugInByUUID %{public}@", uuid.text());
    MutableDictionary message = request(requestType::find);
    message.set(key::uuids, uuid);
    send(message, std::move(callback));
}

void ZBDaemonClient::findPlugInByPathURL(const platform::URL& url, Callback callback) {
    log::ops().notice("findPlugInByPathURL %{public}@", url.absoluteString());
    MutableDictionary message = request(requestType::find);
    message.set(key::paths, url.absoluteString());
    send(message, std::move(callback));
}

void ZBDaemonClient::matchPlugIns(const std::optional<Dictionary>& rules, std::uint64_t flags, Callback callback) {
    MutableDictionary message = request(requestType::match);
    if (rules) message.set(key::rules, *rules);
    message.set(key::flags, flags);
    send(message, std::move(callback));
}

void ZBDaemonClient::setPluginAnnotations(const std::vector<UUID>& uuids, const Dictionary& annotations,
                                          Callback callback) {
    MutableDictionary message = request(requestType::annotate);
    set(message, uuids);
    message.set(key::annotations, annotations);
    send(message, std::move(callback));
}

void ZBDaemonClient::bulkSetPluginAnnotations(const Dictionary& annotations, Callback callback) {
    MutableDictionary message = request(requestType::bulkAnnotate);
    message.set(key::annotations, annotations);
    send(message, std::move(callback));
}

void ZBDaemonClient::holdPlugins(const std::vector<std::string>& paths, std::uint64_t flags, Callback callback) {
    MutableDictionary message = request(requestType::lock, paths);
    message.set(key::flags, flags);
    send(message, std::move(callback));
}

void ZBDaemonClient::releaseHold(const UUID& token, Callback callback) {
    MutableDictionary message = request(requestType::lock);
    set(message, std::vector<UUID>{token});
    send(message, std::move(callback));
}

} // namespace zembra
