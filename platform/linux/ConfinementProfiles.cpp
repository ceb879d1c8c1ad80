#include "platform/linux/ConfinementProfiles.h"

#include "platform/linux/SystemCallFilter.h"
#include "platform/linux/SystemError.h"

#include <algorithm>
#include <cerrno>
#include <sys/prctl.h>

namespace platform::linux_ {

namespace {

constexpr ConfinementProfile profiles[] = {
    {"keyboard", Network::none, false},           {"plugin", Network::client, false},
    {"network-filter", Network::server, false},   {"peekviewd", Network::none, true},
    {"peekview-preview", Network::none, true},    {"peekview-thumbnail", Network::none, true},
    {"sketchpad-devtools", Network::none, false}, {"message-filter", Network::none, false},
};

struct Place {
    const char* place;
    unsigned rights;
};

/// What programs need to run at all.
constexpr Place runTimePlaces[] = {
    {"/usr/lib", readFiles},
    {"/usr/lib64", readFiles},
    {"/usr/local/lib", readFiles},
    {"/lib", readFiles},
    {"/lib64", readFiles},
    // The loaders, which the kernel executes for every program; nothing else in those directories is for executing.
    {"/lib64/ld-linux-x86-64.so.2", readFiles | executeFiles},
    {"/lib/ld-linux-aarch64.so.1", readFiles | executeFiles},
    {"/lib/ld-linux-armhf.so.3", readFiles | executeFiles},
    {"/lib/ld-linux-riscv64-lp64d.so.1", readFiles | executeFiles},
    {"/lib64/ld64.so.2", readFiles | executeFiles},
    {"/lib/ld64.so.1", readFiles | executeFiles},
    {"/etc/ld.so.cache", readFiles},
    {"/etc/localtime", readFiles},
    {"/usr/share/zoneinfo", readFiles},
    {"/usr/share/locale", readFiles},
    {"/dev/null", readFiles | writeFiles},
    {"/dev/zero", readFiles | writeFiles},
    {"/dev/full", readFiles | writeFiles},
    {"/dev/random", readFiles},
    {"/dev/urandom", readFiles},
    {"/proc/self", readFiles},
    {"/sys/devices/system/cpu", readFiles},
};

/// Looking up names of hosts, and whom to trust.
constexpr Place networkPlaces[] = {
    {"/etc/resolv.conf", readFiles},     {"/etc/hosts", readFiles},
    {"/etc/host.conf", readFiles},       {"/etc/nsswitch.conf", readFiles},
    {"/etc/gai.conf", readFiles},        {"/etc/services", readFiles},
    {"/etc/protocols", readFiles},       {"/etc/ssl/certs", readFiles},
    {"/etc/ssl/openssl.cnf", readFiles}, {"/usr/share/ca-certificates", readFiles},
};

constexpr Place documentPlaces[] = {
    {"/usr/share/fonts", readFiles},      {"/usr/local/share/fonts", readFiles}, {"/etc/fonts", readFiles},
    {"/usr/share/fontconfig", readFiles}, {"/var/cache/fontconfig", readFiles},  {"/usr/share/mime", readFiles},
};

template <class Places> Failure allowAll(LandlockRules& rules, const Places& places) {
    for (const auto& place : places) {
        if (auto failure = rules.allow(place.place, place.rights)) return failure;
    }
    return std::nullopt;
}

Failure confineFiles(const ConfinementProfile& profile, std::span<const OwnPlace> own, int version) {
    LandlockRules rules(version);
    if (auto failure = rules.begin(profile.network)) return failure;
    if (auto failure = allowAll(rules, own)) return failure;
    if (auto failure = allowAll(rules, runTimePlaces)) return failure;
    if (profile.network != Network::none) {
        if (auto failure = allowAll(rules, networkPlaces)) return failure;
    }
    if (profile.showsDocuments) {
        if (auto failure = allowAll(rules, documentPlaces)) return failure;
    }
    return rules.enforce();
}

} // namespace

const ConfinementProfile* findConfinementProfile(std::string_view name) {
    const auto* found = std::ranges::find(profiles, name, &ConfinementProfile::name);
    return found == std::end(profiles) ? nullptr : found;
}

Failure confine(const ConfinementProfile& profile, std::span<const OwnPlace> own, int landlock) {
    if (::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) != 0) return systemError(errno, "no new privileges");
    if (landlock > 0) {
        if (auto failure = confineFiles(profile, own, landlock)) return failure;
    }
    return filterSystemCalls(profile.network, landlock);
}

} // namespace platform::linux_
