// Runs the real publishing tool, so catalog tests use fixtures made the way publishers make them.
#pragma once

#include <fcntl.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "TestSupport.h"

namespace tavrix::test {

struct ToolRun {
    // The exit status, or -1 when the tool did not exit normally.
    int status = -1;
    std::string errors;
};

inline ToolRun runTool(const char* tool, const std::vector<std::string>& arguments) {
    TempDir outputs;
    std::string errorsPath = outputs / "stderr";
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, STDOUT_FILENO, "/dev/null", O_WRONLY, 0);
    posix_spawn_file_actions_addopen(&actions, STDERR_FILENO, errorsPath.c_str(),
                                     O_WRONLY | O_CREAT | O_TRUNC, 0600);
    std::vector<std::string> command{tool};
    command.insert(command.end(), arguments.begin(), arguments.end());
    std::vector<char*> argv;
    for (std::string& argument : command) {
        argv.push_back(argument.data());
    }
    argv.push_back(nullptr);
    pid_t pid = -1;
    int spawned = posix_spawn(&pid, tool, &actions, nullptr, argv.data(), environ);
    posix_spawn_file_actions_destroy(&actions);
    ToolRun run;
    int wait = 0;
    if (spawned == 0 && ::waitpid(pid, &wait, 0) == pid && WIFEXITED(wait)) {
        run.status = WEXITSTATUS(wait);
    }
    run.errors = readText(errorsPath);
    return run;
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
