// Runs the real publishing tool, so catalog tests use fixtures made the way publishers make them.
#pragma once

#include <sys/wait.h>

#include <cstdlib>
#include <string>
#include <vector>

#include "TestSupport.h"

namespace tavrix::test {

struct ToolRun {
    // The exit status (128 + the signal's number when the tool was killed).
    int status = -1;
    std::string errors;
    std::string output;
};

inline ToolRun runTool(const char* tool, const std::vector<std::string>& arguments) {
    // Each word single-quoted for the shell, a quote inside written as '\''.
    auto quoted = [](const std::string& word) {
        std::string out = "'";
        for (char c : word) {
            out += c == '\'' ? std::string("'\\''") : std::string(1, c);
        }
        return out + "'";
    };
    TempDir outputs;
    std::string command = quoted(tool);
    for (const std::string& argument : arguments) {
        command += " " + quoted(argument);
    }
    const int wait = std::system(
        (command + " >" + quoted(outputs / "stdout") + " 2>" + quoted(outputs / "stderr")).c_str());
    return {wait != -1 && WIFEXITED(wait) ? WEXITSTATUS(wait) : -1, readText(outputs / "stderr"),
            readText(outputs / "stdout")};
}

inline ToolRun runCatalogTool(const std::vector<std::string>& arguments) {
    return runTool(TAVRIX_CATALOG_TOOL, arguments);
}

}  // namespace tavrix::test
