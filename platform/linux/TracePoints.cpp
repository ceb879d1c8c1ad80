#include "platform/TracePoints.h"

// Each point gets a counter that tracers raise while they listen.
// NOLINTNEXTLINE(bugprone-reserved-identifier,cert-dcl37-c,cert-dcl51-cpp): the name that sys/sdt.h asks for
#define _SDT_HAS_SEMAPHORES 1
#include <sys/sdt.h>

// The kernel writes the counters behind the compiler's back. The name and the section are what tracers look for.
#define ZBD_TRACE_POINT(name)                                                                                          \
    extern "C" {                                                                                                       \
    extern volatile unsigned short zbd_##name##_semaphore;                                                             \
    __attribute__((section(".probes"))) volatile unsigned short zbd_##name##_semaphore = 0;                            \
    }

// A double underscore is how a probe name spells the hyphen: client__new is "client-new".
ZBD_TRACE_POINT(client__new)
ZBD_TRACE_POINT(client__done)
ZBD_TRACE_POINT(request__input)
ZBD_TRACE_POINT(request)
ZBD_TRACE_POINT(request__output)
ZBD_TRACE_POINT(plugin__add)
ZBD_TRACE_POINT(plugin__remove)
ZBD_TRACE_POINT(plugin__ready)
ZBD_TRACE_POINT(discover__raw)
ZBD_TRACE_POINT(db__load)

namespace platform::trace {

void clientNew(int pid) noexcept {
    if (zbd_client__new_semaphore != 0) [[unlikely]]
        STAP_PROBE1(zbd, client__new, pid);
}

void clientDone(int pid) noexcept {
    if (zbd_client__done_semaphore != 0) [[unlikely]]
        STAP_PROBE1(zbd, client__done, pid);
}

bool requestInputEnabled() noexcept { return zbd_request__input_semaphore != 0; }

void requestInput(int pid, const char* message) noexcept {
    if (requestInputEnabled()) [[unlikely]]
        STAP_PROBE2(zbd, request__input, pid, message);
}

void request(int pid, const char* type) noexcept {
    if (zbd_request_semaphore != 0) [[unlikely]]
        STAP_PROBE2(zbd, request, pid, type);
}

bool requestOutputEnabled() noexcept { return zbd_request__output_semaphore != 0; }

void requestOutput(int pid, const char* reply) noexcept {
    if (requestOutputEnabled()) [[unlikely]]
        STAP_PROBE2(zbd, request__output, pid, reply);
}

void pluginAdd(const char* path) noexcept {
    if (zbd_plugin__add_semaphore != 0) [[unlikely]]
        STAP_PROBE1(zbd, plugin__add, path);
}

void pluginRemove(const char* path, bool isResolved) noexcept {
    if (zbd_plugin__remove_semaphore != 0) [[unlikely]]
        STAP_PROBE2(zbd, plugin__remove, path, isResolved);
}

bool pluginReadyEnabled() noexcept { return zbd_plugin__ready_semaphore != 0; }

void pluginReady(const char* uuidText) noexcept {
    if (pluginReadyEnabled()) [[unlikely]]
        STAP_PROBE1(zbd, plugin__ready, uuidText);
}

void discoverRaw(unsigned count) noexcept {
    if (zbd_discover__raw_semaphore != 0) [[unlikely]]
        STAP_PROBE1(zbd, discover__raw, count);
}

void dbLoad(const char* domain, std::uint64_t code) noexcept {
    if (zbd_db__load_semaphore != 0) [[unlikely]]
        STAP_PROBE2(zbd, db__load, domain, code);
}

} // namespace platform::trace
