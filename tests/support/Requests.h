#pragma once

#include "tests/support/FakeDaemon.h"

#include <gtest/gtest.h>

namespace support {

/// A daemon, and what a host of pid 77 asks it about the plug-ins of applications.
struct Requests : testing::Test {
    using enum platform::LogLevel;
    static constexpr const char* application = "/Applications/A.app";
    FakeDaemon daemon;
    FakePlatform& fake = daemon.fake;
    const platform::Dictionary succeeded;

    /// UUIDs sort by their number, so that answers have an order that a test can state.
    static std::string idOf(int number) { return "00000000-0000-0000-0000-000000000" + std::to_string(100 + number); }
    static platform::UUID uuid(int number) { return *platform::UUID::parse(idOf(number)); }
    static std::string pathOf(int number, const std::string& within = application) {
        return within + "/PlugIns/" + std::to_string(number) + ".plugin";
    }
    /// A plug-in with code in an application, called by its number. `extension` adds to what it declares.
    FakePlugIn described(int number, const platform::Dictionary& extension = {},
                         const std::string& within = application) {
        platform::MutableDictionary declared{
            {"VKExtensionProtocol", "Proto"},
            {"VKExtensionAttributes", platform::Dictionary{{"VKExtensionVersion", "1.0"}}}};
        declared.merge(extension);
        return {.path = pathOf(number, within),
                .info = manifestOf("com.example." + std::to_string(number), declared),
                .uuid = uuid(number),
                .containingBundle = fake.registry.installApplication({platform::URL::file(within), "a", "A"}),
                .onSystemPartition = within.starts_with("/System")};
    }
    void install(const std::vector<FakePlugIn>& plugIns) {
        for (const FakePlugIn& plugIn : plugIns) {
            fake.bundles.add(plugIn.path, plugIn.info, plugIn.path + "/run");
            fake.files.addDirectory(plugIn.path);
            fake.registry.install(plugIn);
        }
    }
    void installThree() { install({described(3), described(1), described(2)}); }
    /// The daemon's record of one that is installed.
    zbd::ZBDPlugInRef record(int number) const { return daemon.server->findPlugIn(uuid(number)); }
    platform::UUID hold(int number) {
        const auto made = zbd::ZBDPlugInHold::initWithPlugIns(fake.transport, {record(number)}, nullptr);
        daemon.server->addHold(made);
        return made->uuid();
    }
    void grant(const platform::Dictionary& entitlements) { fake.codeSigning.entitlements[77] = entitlements; }
    std::size_t posts() const { return fake.notifications.posts().size(); }
    static void expectLogged(platform::LogLevel level, const std::string& message, const char* category = "ops") {
        EXPECT_TRUE(processLog.contains(level, category, message)) << message;
    }
};

} // namespace support
