// tavrix-plist in a pipeline, as scripts use it: "-" for standard input and output, and JSON that
// Python's json module reads with every kind of value still apart.
#include <gtest/gtest.h>
#include <sys/wait.h>

#include <cstdio>
#include <string>

#include "TestSupport.h"

namespace tavrix {
namespace {

// The shell line's standard output and exit status.
std::pair<std::string, int> shell(const std::string& line) {
    FILE* pipe = ::popen(line.c_str(), "r");
    std::string output;
    char buffer[256];
    for (std::size_t got; (got = std::fread(buffer, 1, sizeof buffer, pipe)) > 0;) {
        output.append(buffer, got);
    }
    const int status = ::pclose(pipe);
    return {output, WIFEXITED(status) ? WEXITSTATUS(status) : -1};
}

TEST(PlistTool, PipesThroughStandardStreamsAndKeepsTypesInJson) {
    test::TempDir directory;
    const std::string source = directory / "in.plist";
    test::writeText(source,
                    "<plist version=\"1.0\"><dict><key>n</key><integer>1500</integer>"
                    "<key>s</key><string>1500</string><key>r</key><real>1500</real>"
                    "<key>d</key><data>AAEC/w==</data>"
                    "<key>t</key><date>2040-02-29T23:49:17.25Z</date></dict></plist>");
    const std::string tool = "'" TAVRIX_PLIST_TOOL "'";
    // XML in, binary through a pipe, typed JSON out, read by Python; the date past 2038 keeps its
    // fraction and its text with a 32-bit time_t too.
    auto [output, status] =
        shell("bash -c \"set -o pipefail; " + tool + " --binary '" + source + "' - | " + tool +
              " --json=pretty - | /usr/bin/python3 -c 'import json, sys; v = json.load(sys.stdin); "
              "print(repr(v[\\\"n\\\"]), repr(v[\\\"s\\\"]), repr(v[\\\"r\\\"]), v[\\\"d\\\"], "
              "v[\\\"t\\\"])'\"");
    EXPECT_EQ(status, 0) << output;
    EXPECT_EQ(output,
              "1500 '1500' 1500.0 {'$data': 'AAEC/w=='} {'$date': '2040-02-29T23:49:17.25Z'}\n");

    auto [refused, refusedStatus] = shell("echo 'not a plist' | " + tool + " - 2>&1");
    EXPECT_EQ(refusedStatus, 1) << refused;
    EXPECT_EQ(refused, "tavrix-plist: standard input: it is not a complete XML property list\n");
}

}  // namespace
}  // namespace tavrix
