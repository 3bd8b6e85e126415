// Runs another program to its end, for the tests that act as other users through setpriv.
#pragma once

#include <string>
#include <vector>

namespace tavrix::integration {

struct CommandResult {
    // The exit status, 128 + the signal number when killed, -1 when it could not be started.
    int status = -1;
    // stdout and stderr together.
    std::string output;
};

// argv[0] is a path; the program inherits the test's environment.
CommandResult runCommand(const std::vector<std::string>& argv);

}  // namespace tavrix::integration
