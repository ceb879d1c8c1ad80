#pragma once

#include <cstdint>

/// Static trace points of the provider "zbd". They cost a load and a branch while no tracer is attached. Texts are
/// read by the tracer during the call only. Any thread.
namespace platform::trace {

void clientNew(int pid) noexcept;
void clientDone(int pid) noexcept;

/// Whoever has to make a text for a trace point makes it only when the point is enabled.
bool requestInputEnabled() noexcept;
void requestInput(int pid, const char* message) noexcept;
/// `type` may be null.
void request(int pid, const char* type) noexcept;
bool requestOutputEnabled() noexcept;
void requestOutput(int pid, const char* reply) noexcept;

void pluginAdd(const char* path) noexcept;
void pluginRemove(const char* path, bool isResolved) noexcept;
bool pluginReadyEnabled() noexcept;
void pluginReady(const char* uuidText) noexcept;
/// `count` of the plug-ins that the database returned, before any filter.
void discoverRaw(unsigned count) noexcept;
void dbLoad(const char* domain, std::uint64_t code) noexcept;

} // namespace platform::trace
