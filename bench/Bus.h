#pragma once

#include "bench/Socket.h"

#include <fstream>
#include <memory>
#include <string>
#include <systemd/sd-bus.h>
#include <unistd.h>
#include <vector>

/// The second reference: a method call through a message bus daemon of its own, which returns as many bytes.
namespace bench {

inline constexpr const char* busName = "org.example.Bench";
inline constexpr const char* busPath = "/bench";

struct BusCloser {
    void operator()(sd_bus* bus) const { sd_bus_flush_close_unref(bus); }
};
using Bus = std::unique_ptr<sd_bus, BusCloser>;

inline Bus openBus(const std::string& address) {
    sd_bus* opened = nullptr;
    if (sd_bus_new(&opened) < 0) fail("sd_bus_new");
    Bus bus(opened);
    if (sd_bus_set_address(bus.get(), address.c_str()) < 0 || sd_bus_set_bus_client(bus.get(), 1) < 0 ||
        sd_bus_start(bus.get()) < 0)
        return nullptr;
    return bus;
}

inline int answerBusCall(sd_bus_message* call, void* context, sd_bus_error*) {
    const auto& bytes = *static_cast<const std::vector<char>*>(context);
    sd_bus_message* reply = nullptr;
    int result = sd_bus_message_new_method_return(call, &reply);
    if (result >= 0) result = sd_bus_message_append_array(reply, 'y', bytes.data(), bytes.size());
    if (result >= 0) result = sd_bus_send(nullptr, reply, nullptr);
    sd_bus_message_unref(reply);
    return result;
}

/// The process that owns the bus name.
[[noreturn]] inline void runBusService(const std::string& address, std::size_t replySize) {
    static const sd_bus_vtable methods[] = {
        SD_BUS_VTABLE_START(0),
        SD_BUS_METHOD("Find", "s", "ay", answerBusCall, SD_BUS_VTABLE_UNPRIVILEGED),
        SD_BUS_VTABLE_END,
    };
    std::vector<char> bytes(replySize, 'x');
    Bus bus;
    while (!(bus = openBus(address))) usleep(1000); // the bus daemon may only be about to listen
    if (sd_bus_add_object_vtable(bus.get(), nullptr, busPath, busName, methods, &bytes) < 0 ||
        sd_bus_request_name(bus.get(), busName, 0) < 0)
        fail("no bus service");
    while (true) {
        const int result = sd_bus_process(bus.get(), nullptr);
        if (result < 0) std::exit(0);
        if (result == 0) sd_bus_wait(bus.get(), UINT64_MAX);
    }
}

/// One call. False when it was not answered as expected.
inline bool callBus(sd_bus* bus, std::size_t replySize) {
    constexpr const char* argument = "0B7E3A52-6D3C-4B53-9C41-8F1C77D0A6E1"; // any text as long as a UUID
    sd_bus_message* reply = nullptr;
    const void* bytes = nullptr;
    std::size_t size = 0;
    const bool isAnswered =
        sd_bus_call_method(bus, busName, busPath, busName, "Find", nullptr, &reply, "s", argument) >= 0 &&
        sd_bus_message_read_array(reply, 'y', &bytes, &size) >= 0 && size == replySize;
    sd_bus_message_unref(reply);
    return isAnswered;
}

/// A bus daemon, the service on it, and a client.
class BusReference {
public:
    /// `self` is this program, which knows the role "bus".
    BusReference(const std::string& self, const std::string& directory, std::size_t replySize)
        : _replySize(replySize),
          _address("unix:path=" + directory + "/bus"),
          _daemon({"dbus-daemon", "--nofork", "--config-file=" + writeConfiguration(directory)}, {}),
          _service({self, "bus", _address, std::to_string(replySize)}, {}) {
        // The daemon and the service take a moment each; without the program there is none to wait for.
        while (_daemon.isRunning() && _service.isRunning()) {
            if (!_client) _client = openBus(_address);
            if (_client && callBus(_client.get(), _replySize)) return;
            usleep(1000);
        }
        _client.reset();
    }

    bool isAvailable() const { return _client != nullptr; }

    double roundTrip(double seconds) {
        return meanMicroseconds(seconds, [&] {
            if (!callBus(_client.get(), _replySize)) fail("the bus call failed");
        });
    }

private:
    std::string writeConfiguration(const std::string& directory) const {
        std::string path = directory + "/bus.conf";
        std::ofstream(path) << "<busconfig><type>session</type><listen>" << _address
                            << "</listen><auth>EXTERNAL</auth><policy context='default'>"
                               "<allow send_destination='*' eavesdrop='true'/><allow eavesdrop='true'/><allow own='*'/>"
                               "</policy></busconfig>";
        return path;
    }

    std::size_t _replySize;
    std::string _address;
    Process _daemon;
    Process _service;
    Bus _client;
};

} // namespace bench
