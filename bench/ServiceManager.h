#pragma once

#include "bench/Process.h"
#include "bench/Socket.h"

#include <cstddef>
#include <poll.h>
#include <string>
#include <string_view>
#include <sys/socket.h>
#include <utility>
#include <vector>

/// What systemd does for a service with FileDescriptorStoreMax=1: keeps its descriptor from one process to the next.
namespace bench {

class ServiceManager {
public:
    /// Keeps nothing.
    ServiceManager() = default;
    explicit ServiceManager(std::string path) : _path(std::move(path)), _socket(socket(AF_UNIX, SOCK_DGRAM, 0)) {
        const sockaddr_un address = addressOf(_path);
        if (bind(_socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) failSystem("bind");
    }

    std::vector<std::string> environment() const {
        if (!_socket) return {};
        return {"NOTIFY_SOCKET=" + _path};
    }
    Passed kept() const { return {_name, _descriptor.get()}; }

    /// Returns when the service has given something to keep, in place of what is kept.
    void receive(Process& service) {
        std::string text;
        while (!text.starts_with(begin)) text = next(service);
        _name = text.substr(begin.size());
    }

private:
    static constexpr std::string_view begin = "FDSTORE=1\nFDNAME=";

    /// Another notification. Takes the descriptor that comes with it.
    std::string next(Process& service) {
        pollfd waiting{_socket.get(), POLLIN, 0};
        while (poll(&waiting, 1, 100) <= 0) {
            if (!service.isRunning()) fail("the service ended");
        }
        std::string text(4096, '\0');
        alignas(cmsghdr) std::string control(CMSG_SPACE(sizeof(int)), '\0');
        iovec bytes{text.data(), text.size()};
        msghdr message{};
        message.msg_iov = &bytes;
        message.msg_iovlen = 1;
        message.msg_control = control.data();
        message.msg_controllen = control.size();
        const ssize_t size = recvmsg(_socket.get(), &message, MSG_CMSG_CLOEXEC);
        if (size < 0) failSystem("recvmsg");
        if (const cmsghdr* rights = CMSG_FIRSTHDR(&message)) {
            int descriptor = -1;
            std::memcpy(&descriptor, CMSG_DATA(rights), sizeof descriptor);
            _descriptor.reset(descriptor);
        }
        return text.substr(0, static_cast<std::size_t>(size));
    }

    const std::string _path;
    const Descriptor _socket;
    std::string _name;
    Descriptor _descriptor;
};

} // namespace bench
