#include "platform/linux/LinuxPlatform.h"
#include "platform/linux/SystemLog.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/ScratchDirectory.h"

#include <fstream>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>

// What a process is like once the platform is constructed. Each in a child, since the log is set once and for all.

namespace {

using platform::linux_::LinuxPlatform;

TEST(LinuxPlatform, FillsStandardDescriptorsThatAreClosed) {
    for (int missing = 1; missing < 8; ++missing) { // a bit for each
        const int wrong = support::resultInChild([&] {
            const int other = open("/dev/zero", O_RDWR | O_CLOEXEC); // tells those that were open from the null device
            for (int number = 0; number < 3; ++number) {
                dup2(other, number);
                if ((missing >> number & 1) != 0) close(number);
            }
            const LinuxPlatform platform;
            for (int number = 0; number < 3; ++number) {
                struct stat status{};
                if (fstat(number, &status) != 0) return 10 + number;
                if ((status.st_rdev == makedev(1, 3)) != ((missing >> number & 1) != 0)) return 20 + number;
                if (fcntl(number, F_GETFD) != 0) return 30 + number; // programs started from here need them too
            }
            return 0;
        });
        EXPECT_EQ(wrong, 0) << missing;
    }
}

TEST(LinuxPlatform, ShowsArgumentsOfLinesWithoutCategoryOnly) {
    const support::ScratchDirectory scratch;
    support::resultInChild([&] {
        dup2(open((scratch / "log").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600), STDERR_FILENO);
        setenv(platform::linux_::logEnvironmentVariable, "stderr", 1);
        const LinuxPlatform linuxPlatform;
        platform::systemLog().defaultHandle().notice("refused %@", "/A.appex");
        platform::systemLog().createHandle("com.nordane.any", "any")->notice("hidden %@", "/B.appex");
        return 0;
    });
    std::ifstream log(scratch / "log");
    const std::string lines{std::istreambuf_iterator<char>(log), {}};
    EXPECT_NE(lines.find("refused /A.appex\n"), std::string::npos) << lines;
    EXPECT_NE(lines.find("hidden "), std::string::npos) << lines;
    EXPECT_EQ(lines.find("/B.appex"), std::string::npos) << lines;
}

} // namespace
