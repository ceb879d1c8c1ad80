#include "platform/linux/Containers.h"
#include "tests/support/ContainersFake.h"
#include "tests/support/ScratchDirectory.h"

#include <cerrno>
#include <filesystem>
#include <gtest/gtest.h>
#include <sys/stat.h>

namespace {

class ContainersOnDisk : public testing::Test {
protected:
    std::int64_t errorOf(const std::string& identifier) {
        const auto container = containers.userContainer(identifier);
        return container ? 0 : container.error().code;
    }

    support::ScratchDirectory scratch;
    platform::linux_::Root root{scratch.path()};
    platform::linux_::Containers containers{root};
    std::string own = root.users() + "/" + std::to_string(geteuid());
};

TEST_F(ContainersOnDisk, UserContainerIsMadePrivateAndDiscardedWhileEmpty) {
    const auto path = containers.userContainer("com.example.a");
    ASSERT_TRUE(path);
    EXPECT_EQ(*path, own + "/Containers/com.example.a");
    for (const std::string& directory : {own, own + "/Containers", *path}) {
        struct stat status{};
        ASSERT_EQ(stat(directory.c_str(), &status), 0);
        EXPECT_EQ(status.st_mode & 07777U, 0700U) << directory;
    }
    std::filesystem::create_directory(*path + "/used");
    for (const char* identifier : {"com.example.a", "missing", ".", "..", "com.example.a/used"})
        containers.discardEmpty(identifier);
    EXPECT_EQ(*containers.userContainer("com.example.a"), *path) << "found again";
    EXPECT_TRUE(std::filesystem::remove(*path + "/used"));
    containers.discardEmpty("com.example.a");
    EXPECT_FALSE(std::filesystem::exists(*path));
}

TEST_F(ContainersOnDisk, UserContainerRefusesNamesThatAreNoNames) {
    const std::pair<std::string, int> cases[] = {{"", EINVAL},
                                                 {".", EINVAL},
                                                 {"..", EINVAL},
                                                 {"a/b", EINVAL},
                                                 {"a\n", EINVAL},
                                                 {std::string(1, '\0'), EINVAL},
                                                 {std::string(256, 'a'), ENAMETOOLONG},
                                                 {std::string(255, 'a'), 0}};
    for (const auto& [identifier, error] : cases) EXPECT_EQ(errorOf(identifier), error) << identifier;
}

TEST_F(ContainersOnDisk, UserContainerRefusesWhatOthersCouldControl) {
    ASSERT_EQ(errorOf("good"), 0);
    const std::string directory = own + "/Containers/";
    std::filesystem::create_directory_symlink(directory + "good", directory + "link");
    EXPECT_EQ(errorOf("link"), ENOTDIR);
    ASSERT_EQ(mkfifo((directory + "fifo").c_str(), 0700), 0);
    EXPECT_EQ(errorOf("fifo"), ENOTDIR);
    ASSERT_EQ(chmod((directory + "good").c_str(), 0750), 0);
    EXPECT_EQ(errorOf("good"), EACCES);
    ASSERT_EQ(chmod(own.c_str(), 0701), 0);
    EXPECT_EQ(errorOf("new"), EACCES) << "a directory above is open";
    ASSERT_EQ(chmod(own.c_str(), 0700), 0);
    ASSERT_EQ(chmod(root.users().c_str(), 0777), 0);
    EXPECT_EQ(errorOf("new"), EACCES) << "anybody could exchange users' directories";
    ASSERT_EQ(chmod(root.users().c_str(), 0755), 0);
    platform::linux_::Containers others(root, geteuid() + 1); // everything that is made here belongs to us
    EXPECT_EQ(others.userContainer("a").error().code, EPERM);
}

TEST(FakeContainers, UserContainerRefusesUntilAllowed) {
    support::FakeContainers containers;
    EXPECT_EQ(containers.userContainer("a").error().code, EACCES);
    containers.allow("a", "/a");
    EXPECT_EQ(*containers.userContainer("a"), "/a");
    containers.failure = ENOSPC;
    EXPECT_EQ(containers.userContainer("a").error().code, ENOSPC);
}

} // namespace
