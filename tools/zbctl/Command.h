#pragma once

#include <string>
#include <vector>

namespace zbctl {

/// Runs a program, looked for as a shell does, and waits for its end. Signals to end go to it alone meanwhile. Answers
/// as shells do: its exit status, 128 and the number of the signal that ended it, or 127 when it cannot be run, which
/// is complained about.
int runCommand(const std::vector<std::string>& words);

} // namespace zbctl
