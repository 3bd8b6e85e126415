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

// A bundle directory with an Info.plist giving an identifier and version (no Info.plist when the
// version is empty), a base carrier file and the given files (relative path -> content).
inline void makeBundle(const std::string& directory, const std::string& version,
                       const std::vector<std::pair<std::string, std::string>>& files) {
    std::filesystem::create_directories(directory);
    if (!version.empty()) {
        writeText(directory + "/Info.plist",
                  "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\"><dict>"
                  "<key>QZBundleIdentifier</key><string>com.zandor.tavrix.test</string>"
                  "<key>QZBundleVersion</key><string>" +
                      version + "</string></dict></plist>\n");
    }
    writeText(directory + "/behavior.plist", "<plist version=\"1.0\"><dict/></plist>\n");
    for (const auto& [path, content] : files) {
        writeText(directory + "/" + path, content);
    }
}

}  // namespace tavrix::test
