// tavrix-plist: prints a property-list file readably, or converts it between XML and binary.
//   tavrix-plist FILE               print the value
//   tavrix-plist --xml FILE OUT     write FILE as XML to OUT
//   tavrix-plist --binary FILE OUT  write FILE as a binary property list to OUT
#include <cstdio>
#include <cstring>
#include <string>

#include "plist/PropertyListFormat.h"

namespace {

constexpr const char* kUsage =
    "usage: tavrix-plist FILE\n"
    "       tavrix-plist --xml|--binary FILE OUT\n";

constexpr const char* kHelp =
    "\n"
    "Prints a property-list file (XML or binary) readably, or converts it.\n"
    "\n"
    "  --xml FILE OUT     write FILE as an XML property list to OUT\n"
    "  --binary FILE OUT  write FILE as a binary property list to OUT\n"
    "  --version          show the version\n"
    "  -h, --help         show this help\n";

int usage() {
    std::fputs(kUsage, stderr);
    return 2;
}

}  // namespace

int main(int argc, char** argv) {
    using namespace tavrix::plist;
    if (argc == 2 && (std::strcmp(argv[1], "--help") == 0 || std::strcmp(argv[1], "-h") == 0)) {
        std::printf("%s%s", kUsage, kHelp);
        return 0;
    }
    if (argc == 2 && std::strcmp(argv[1], "--version") == 0) {
        std::printf("tavrix-plist %s\n", TAVRIX_VERSION);
        return 0;
    }
    if (argc == 2) {
        Refusal refusal;
        auto value = readFile(argv[1], &refusal);
        if (!value) {
            std::fprintf(stderr, "tavrix-plist: %s: %s\n", argv[1], refusal.reason.c_str());
            return 1;
        }
        std::printf("%s\n", value->description().c_str());
        return 0;
    }
    if (argc == 4 &&
        (std::strcmp(argv[1], "--xml") == 0 || std::strcmp(argv[1], "--binary") == 0)) {
        Refusal refusal;
        auto value = readFile(argv[2], &refusal);
        if (!value) {
            std::fprintf(stderr, "tavrix-plist: %s: %s\n", argv[2], refusal.reason.c_str());
            return 1;
        }
        Format format = argv[1][2] == 'x' ? Format::Xml : Format::Binary;
        if (!writeFile(argv[3], *value, format)) {
            std::fprintf(stderr, "tavrix-plist: cannot write %s\n", argv[3]);
            return 1;
        }
        return 0;
    }
    return usage();
}
