#include "samples/host/Host.h"

#include <algorithm>
#include <array>
#include <iostream>

namespace {

struct Verb {
    const char* name;
    std::size_t minimum; // of words behind it
    std::size_t maximum;
    int (*run)(host::Daemon& daemon, const host::Words& words);
};
constexpr std::size_t any = 1000;
constexpr std::array verbs{
    Verb{"show", 1, 2, host::show},
    Verb{"show-confined", 2, 2, host::showConfined},
    Verb{"discover", 1, 1, host::discover},
    Verb{"run", 1, any, host::run},
};

constexpr const char* usage = "usage: Host show UUID|PATH [FILE-IN-BUNDLE]\n"
                              "       Host show-confined UUID|PATH FILE-IN-BUNDLE\n"
                              "       Host discover EXTENSION-POINT\n"
                              "       Host run UUID|PATH [NAME=VALUE...] [-- ARGUMENT...]\n";

} // namespace

int main(int argc, char** argv) {
    host::Words words(argv + 1, argv + argc);
    const auto* verb = std::find_if(verbs.begin(), verbs.end(),
                                    [&](const Verb& known) { return !words.empty() && words.front() == known.name; });
    if (verb == verbs.end() || words.size() - 1 < verb->minimum || words.size() - 1 > verb->maximum) {
        std::cerr << usage;
        return 2;
    }
    words.erase(words.begin());
    host::Daemon daemon;
    return verb->run(daemon, words);
}
