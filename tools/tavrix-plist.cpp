// tavrix-plist: prints a property list readably or as typed JSON, or converts it between XML and
// binary. "-" is standard input or output.
//   tavrix-plist [--json[=short|pretty]] FILE   print the value
//   tavrix-plist --xml|--binary FILE OUT        write FILE in that format to OUT
#include <getopt.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <optional>
#include <string>

#include "PlistJson.h"
#include "io/FileIO.h"
#include "plist/PropertyListFormat.h"

namespace {

using namespace tavrix::plist;
using tavrix::tools::JsonStyle;

constexpr const char* kUsage =
    "usage: tavrix-plist [--json[=short|pretty]] FILE\n"
    "       tavrix-plist --xml|--binary FILE OUT\n";

constexpr const char* kHelp =
    "\n"
    "Prints a property list (XML or binary) readably, or converts it. FILE or OUT \"-\" is\n"
    "standard input or output.\n"
    "\n"
    "  --json[=STYLE]     print the value as typed JSON (docs/json-output.md), on one line\n"
    "                     (short, the default) or indented (pretty)\n"
    "  --xml FILE OUT     write FILE as an XML property list to OUT\n"
    "  --binary FILE OUT  write FILE as a binary property list to OUT\n"
    "  --version          show the version\n"
    "  -h, --help         show this help\n";

enum Option : int { kOptionJson = 256, kOptionXml, kOptionBinary, kOptionVersion };

const option kLongOptions[] = {
    {"json", optional_argument, nullptr, kOptionJson},
    {"xml", no_argument, nullptr, kOptionXml},
    {"binary", no_argument, nullptr, kOptionBinary},
    {"version", no_argument, nullptr, kOptionVersion},
    {"help", no_argument, nullptr, 'h'},
    {nullptr, 0, nullptr, 0},
};

int usage(const std::string& mistake) {
    std::fprintf(stderr, "tavrix-plist: %s\n%s", mistake.c_str(), kUsage);
    return 2;
}

// The value in path, or standard input for "-", with the same bounds either way.
std::optional<Value> readValue(const std::string& path) {
    auto read = [&]() -> tavrix::Result<Value> {
        if (path != "-") {
            return readFile(path);
        }
        std::string bytes;
        if (int error = tavrix::io::readAll(STDIN_FILENO, bytes, kMaxPropertyListBytes)) {
            return tavrix::Failure{
                error == EFBIG ? "it is larger than the limit" : std::strerror(error), error};
        }
        return parse(bytes);
    };
    tavrix::Result<Value> value = read();
    if (!value) {
        std::fprintf(stderr, "tavrix-plist: %s: %s\n",
                     path == "-" ? "standard input" : path.c_str(), value.reason().c_str());
        return std::nullopt;
    }
    return std::move(*value);
}

bool writeValue(const std::string& path, const Value& value, Format format) {
    if (path == "-") {
        tavrix::Result<std::string> bytes = serialize(value, format);
        if (!bytes) {
            std::fprintf(stderr, "tavrix-plist: %s\n", bytes.reason().c_str());
            return false;
        }
        return tavrix::io::writeAll(STDOUT_FILENO, *bytes) == 0;
    }
    return writeFile(path, value, format);
}

}  // namespace

int main(int argc, char** argv) {
    std::optional<Format> convertTo;
    std::optional<JsonStyle> json;
    opterr = 0;
    for (int code; (code = getopt_long(argc, argv, "h", kLongOptions, nullptr)) != -1;) {
        switch (code) {
            case 'h':
                std::printf("%s%s", kUsage, kHelp);
                return 0;
            case kOptionVersion:
                std::printf("tavrix-plist %s\n", TAVRIX_VERSION);
                return 0;
            case kOptionXml:
            case kOptionBinary:
                convertTo = code == kOptionXml ? Format::Xml : Format::Binary;
                break;
            case kOptionJson: {
                const std::string style = optarg != nullptr ? optarg : "";
                if (style != "" && style != "short" && style != "pretty") {
                    return usage("--json takes short or pretty, not '" + style + "'");
                }
                json = style == "pretty" ? JsonStyle::Pretty : JsonStyle::Short;
                break;
            }
            default:
                return usage(std::string("unknown option ") + argv[optind - 1]);
        }
    }
    const int operands = argc - optind;
    if (convertTo ? json || operands != 2 : operands != 1) {
        return usage(convertTo ? "--xml and --binary take FILE and OUT" : "one FILE is expected");
    }
    auto value = readValue(argv[optind]);
    if (!value) {
        return 1;
    }
    if (convertTo) {
        if (!writeValue(argv[optind + 1], *value, *convertTo)) {
            std::fprintf(stderr, "tavrix-plist: cannot write %s\n", argv[optind + 1]);
            return 1;
        }
        return 0;
    }
    const std::string text = json ? tavrix::tools::dumpJson(tavrix::tools::toJson(*value), *json)
                                  : value->description() + "\n";
    return tavrix::io::writeAll(STDOUT_FILENO, text) == 0 ? 0 : 1;
}
