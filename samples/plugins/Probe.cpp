// Tells what its environment is and which of the files named in its arguments it can read. Counts as busy from then
// until its standard input ends.

#include "platform/linux/BusyAssertion.h"
#include "platform/linux/Root.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <iostream>
#include <unistd.h>

namespace {

constexpr const char* bundleIdentifier = "org.example.lab.probe"; // as in the manifest

void tellOfFile(const char* path) {
    const int file = open(path, O_RDONLY | O_CLOEXEC);
    std::cout << (file < 0 ? "cannot" : "can") << " read " << path << (file < 0 ? ": " : "")
              << (file < 0 ? std::strerror(errno) : "") << '\n';
    if (file >= 0) close(file);
}

} // namespace

int main(int argc, char** argv) {
    for (char** variable = environ; *variable != nullptr; ++variable) std::cout << *variable << '\n';
    for (int i = 1; i < argc; ++i) tellOfFile(argv[i]);
    const platform::linux_::BusyAssertion busy(platform::linux_::Root::ofProcess(), bundleIdentifier);
    std::cout << (busy.failure() ? "not busy: " + busy.failure()->text() : "busy") << '\n' << std::flush;
    for (char c = 0; std::cin.get(c);) {
    }
    return 0;
}
