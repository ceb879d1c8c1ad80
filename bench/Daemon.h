#pragma once

#include "Zembra/ZBProtocol.h"
#include "bench/Load.h"
#include "bench/ServiceManager.h"
#include "platform/PropertyList.h"

#include <cstdint>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

/// The real daemon, and messages to and from it.
namespace bench {

inline std::string requestFrame(std::string_view type, const platform::Dictionary& fields = {}, std::uint64_t id = 1) {
    platform::MutableDictionary message{{zembra::key::request, type},
                                        {zembra::key::version, static_cast<std::uint64_t>(zembra::currentVersion)}};
    message.merge(fields);
    std::string frame;
    if (!qmx::appendFrame(frame, qmx::FrameType::request, id, message)) fail("the request is too long");
    return frame;
}

/// The reply as trees. It must not be an error.
inline platform::Dictionary decodedReply(std::string_view body) {
    const auto message = platform::decodeCompact(body, platform::UUIDs::allowed);
    const auto reply = message ? message->dictionary() : std::nullopt;
    if (!reply) fail("a reply that is no dictionary");
    if (const auto error = (*reply)[zembra::key::error]) fail("the daemon answered: " + error.description());
    return *reply;
}

/// What a reply carries as one value: the form that was found, or all that matched.
inline platform::Value decodedMatches(const platform::Dictionary& reply) {
    const auto encoded = reply[zembra::key::matches];
    if (!encoded.data()) fail("a reply without a form");
    const auto matches = platform::decodeCompact(*encoded.data(), platform::UUIDs::refused);
    if (!matches) fail(matches.error().text());
    return *matches;
}

inline platform::UUID uuidOf(const platform::Value& form) {
    const auto fields = form.dictionary();
    const auto text = fields ? fields->string(zembra::formKey::uuid) : std::nullopt;
    const auto uuid = text ? platform::UUID::parse(*text) : std::nullopt;
    if (!uuid) fail("a form without a UUID");
    return *uuid;
}

/// A daemon on a scratch root, which logs as in service, to nowhere.
class Daemon {
public:
    Daemon(const std::string& program, std::string root, const ServiceManager& manager = {})
        : _root(std::move(root)),
          _process({program}, environment(manager.environment()), "/dev/null", manager.kept()) {}
    ~Daemon() {
        if (_process.stop() != 0) fail("the daemon did not end well");
    }

    const std::string& root() const { return _root; }
    Process& process() { return _process; }
    std::string path() const { return _root + "/run/nordane/" + zembra::serviceName; }

    /// One request over a connection of its own.
    platform::Dictionary ask(std::string_view type, const platform::Dictionary& fields = {}) {
        const Descriptor socket = connectTo(path(), _process);
        sendAll(socket.get(), requestFrame(type, fields));
        FrameReader reader;
        return decodedReply(reader.next(socket.get()).body);
    }

    /// For requests whose replies are as long as one another. Asks each once, so that the daemon's caches are hot.
    Target targetFor(std::vector<std::string> requests) {
        const Descriptor socket = connectTo(path(), _process);
        FrameReader reader;
        std::size_t size = 0;
        for (const auto& request : requests) {
            sendAll(socket.get(), request);
            decodedReply(reader.next(socket.get()).body);
            if (size != 0 && reader.frameSize() != size) fail("the replies differ in size");
            size = reader.frameSize();
        }
        return {path(), _process, std::move(requests), size};
    }

private:
    std::vector<std::string> environment(std::vector<std::string> more) const {
        more.insert(more.end(), {"NORDANE_ROOT=" + _root, "NORDANE_LOG=stderr"});
        return more;
    }

    std::string _root;
    Process _process;
};

} // namespace bench
