#include "Zembra/ZBLog.h"

namespace zembra::log {

namespace {

constexpr const char* subsystem = "com.nordane.Zembra";

platform::LogHandle& channel(const char* category) {
    platform::SystemLog& log = platform::systemLog();
    if (platform::LogHandle* handle = log.createHandle(subsystem, category)) return *handle;
    log.defaultHandle().error("unable to create tracelog for category %s", category);
    return log.defaultHandle();
}

} // namespace

platform::LogHandle& ops() {
    static platform::LogHandle& handle = channel("ops");
    return handle;
}

platform::LogHandle& traffic() {
    static platform::LogHandle& handle = channel("traffic");
    return handle;
}

platform::LogHandle& extension() {
    static platform::LogHandle& handle = channel("extension");
    return handle;
}

platform::LogHandle& cx() {
    static platform::LogHandle& handle = channel("cx");
    return handle;
}

platform::LogHandle& sandbox() {
    static platform::LogHandle& handle = channel("sandbox");
    return handle;
}

} // namespace zembra::log
