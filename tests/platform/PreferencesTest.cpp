#include "platform/linux/Preferences.h"
#include "platform/linux/UserDirectory.h"
#include "tests/support/BundleTree.h"
#include "tests/support/ScratchDirectory.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

namespace {

using platform::Dictionary;
using platform::Value;

TEST(Preferences, SynchronizeTakesOverWhatIsStoredByTheUser) {
    const support::ScratchDirectory scratch;
    const platform::linux_::Root root(scratch.path());
    const std::string domain = "com.example.prefs";
    (void)openUserDirectory(root.users(), geteuid(), {"Preferences"}, platform::linux_::MissingDirectory::made);
    char host[256] = "";
    gethostname(host, sizeof host);
    const std::string file =
        root.users() + "/" + std::to_string(geteuid()) + "/Preferences/" + domain + "." + host + ".vlist";
    const auto store = [&](const Value& content) {
        support::writeFile(file, *platform::encodeXML(content));
        chmod(file.c_str(), 0600);
    };
    platform::linux_::Preferences preferences(root);
    preferences.addDomain(domain);
    EXPECT_TRUE(preferences.synchronize(domain)) << "nothing was ever stored";
    std::vector<std::pair<const char*, std::function<void()>>> cases{
        {"writable by others", [&] { chmod(file.c_str(), 0622); }},
        {"too large", [&] { store(Dictionary{{"key", std::string(1U << 20U, 'x')}}); }},
        {"no dictionary", [&] { store(platform::Array{"key"}); }},
        {"a link", [&] { support::putBehindLink(file); }},
    };
    if (geteuid() == 0) cases.emplace_back("foreign", [&] { (void)!chown(file.c_str(), 12345, 12345); });
    for (const auto& [what, deviate] : cases) {
        std::filesystem::remove(file);
        store(Dictionary{{"key", what}});
        EXPECT_TRUE(preferences.synchronize(domain)) << what;
        deviate();
        for (int time = 0; time < 2; ++time) EXPECT_FALSE(preferences.synchronize(domain)) << what;
        EXPECT_EQ(preferences.value(domain, "key"), Value(what)) << "as before";
    }
}

} // namespace
