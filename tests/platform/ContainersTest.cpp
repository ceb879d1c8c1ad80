#include "platform/linux/Containers.h"
#include "tests/support/ScratchDirectory.h"

#include <cerrno>
#include <gtest/gtest.h>
#include <sys/stat.h>

namespace {

namespace fs = std::filesystem;

struct ContainersOnDisk : testing::Test {
    std::int64_t errorOf(const std::string& identifier) {
        const auto container = containers.userContainer(identifier);
        return container ? 0 : container.error().code;
    }

    support::ScratchDirectory scratch;
    platform::linux_::Root root{scratch.path()};
    platform::linux_::Containers containers{root};
    const std::string own = root.users() + "/" + std::to_string(geteuid());
    const std::string path = own + "/Containers/com.example.a";
};

TEST_F(ContainersOnDisk, UserContainerIsMadePrivateAndDiscardedWhileEmpty) {
    EXPECT_EQ(*containers.userContainer("com.example.a"), path);
    fs::create_directory(path + "/used");
    for (const char* identifier : {"com.example.a", "missing", ".", "..", "com.example.a/used"})
        containers.discardEmpty(identifier);
    EXPECT_TRUE(fs::remove(path + "/used")) << "it stayed";
    containers.discardEmpty("com.example.a");
    EXPECT_FALSE(fs::exists(path));
}

TEST_F(ContainersOnDisk, UserContainerRefusesWhatOthersCouldControl) {
    for (const char* identifier : {"", "..", "a/b"}) EXPECT_EQ(errorOf(identifier), EINVAL) << identifier;
    EXPECT_EQ(errorOf("com.example.a"), 0);
    fs::create_directory_symlink(path, own + "/Containers/link");
    EXPECT_EQ(errorOf("link"), ENOTDIR);
    for (const auto& [name, opened, closed] :
         {std::tuple(path, 0750U, 0700U), {own, 0701U, 0700U}, {root.users(), 0777U, 0755U}}) {
        chmod(name.c_str(), opened);
        EXPECT_EQ(errorOf("com.example.a"), EACCES) << name;
        chmod(name.c_str(), closed);
    }
    platform::linux_::Containers others(root, geteuid() + 1); // everything that is made here belongs to us
    EXPECT_EQ(others.userContainer("a").error().code, EPERM);
}

} // namespace
