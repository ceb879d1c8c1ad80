#include "platform/linux/Containers.h"
#include "tests/support/ScratchDirectory.h"

#include <cerrno>
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
    const std::string own = root.users() + "/" + std::to_string(geteuid());
    const std::string directory = own + "/Containers/";
};

TEST_F(ContainersOnDisk, UserContainerIsMadePrivateAndDiscardedWhileEmpty) {
    const std::string path = directory + "com.example.a";
    EXPECT_EQ(*containers.userContainer("com.example.a"), path);
    for (const std::string& made : {own, directory, path})
        EXPECT_EQ(std::filesystem::status(made).permissions(), std::filesystem::perms(0700)) << made;
    std::filesystem::create_directory(path + "/used");
    for (const char* identifier : {"com.example.a", "missing", ".", "..", "com.example.a/used"})
        containers.discardEmpty(identifier);
    EXPECT_EQ(*containers.userContainer("com.example.a"), path) << "found again";
    EXPECT_TRUE(std::filesystem::remove(path + "/used"));
    containers.discardEmpty("com.example.a");
    EXPECT_FALSE(std::filesystem::exists(path));
}

TEST_F(ContainersOnDisk, UserContainerRefusesNamesThatAreNoNames) {
    for (const char* identifier : {"", ".", "..", "a/b", "a\n"}) EXPECT_EQ(errorOf(identifier), EINVAL) << identifier;
    EXPECT_EQ(errorOf(std::string(256, 'a')), ENAMETOOLONG);
    EXPECT_EQ(errorOf(std::string(255, 'a')), 0);
}

TEST_F(ContainersOnDisk, UserContainerRefusesWhatOthersCouldControl) {
    EXPECT_EQ(errorOf("good"), 0);
    std::filesystem::create_directory_symlink(directory + "good", directory + "link");
    EXPECT_EQ(errorOf("link"), ENOTDIR);
    chmod((directory + "good").c_str(), 0750);
    EXPECT_EQ(errorOf("good"), EACCES);
    chmod(own.c_str(), 0701);
    EXPECT_EQ(errorOf("new"), EACCES) << "a directory above is open";
    chmod(own.c_str(), 0700);
    chmod(root.users().c_str(), 0777);
    EXPECT_EQ(errorOf("new"), EACCES) << "anybody could exchange users' directories";
    chmod(root.users().c_str(), 0755);
    platform::linux_::Containers others(root, geteuid() + 1); // everything that is made here belongs to us
    EXPECT_EQ(others.userContainer("a").error().code, EPERM);
}

} // namespace
