// tavrixctl: calls tavrixservicesd from the command line, shows its status and properties,
// watches its notifications and packs bundle payloads.
// Results go to stdout plainly or as JSON (docs/json-output.md); a failure is one line on stderr
// and exit status 1, a usage mistake exit status 2.
#include <fcntl.h>
#include <getopt.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cmath>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <functional>
#include <initializer_list>
#include <limits>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <tuple>
#include <utility>
#include <vector>

#include "PlistJson.h"
#include "TavrixctlOutput.h"
#include "client/TavrixClient.h"
#include "io/FileIO.h"
#include "io/UniqueFd.h"
#include "payload/Archive.h"
#include "publishing/BundleCheck.h"

namespace {

using nlohmann::json;
using tavrix::client::ClientError;
using tavrix::client::TavrixClient;
using tavrix::tools::JsonStyle;
namespace plist = tavrix::plist;

constexpr int kFailure = 1;
constexpr int kUsage = 2;

constexpr const char* kOverallHelp =
    "usage: tavrixctl [--address ADDRESS] [--json[=short|pretty]] [COMMAND [ARGUMENTS]]\n"
    "\n"
    "Calls tavrixservicesd on the system bus. Without a command, shows the status.\n"
    "\n"
    "Commands:\n"
    "  status                     show the daemon's state: behavior ID, linked bundle,\n"
    "                             update checks and the last payload\n"
    "  show [-p NAME...] [--value]\n"
    "                             print the daemon's properties as NAME=VALUE lines\n"
    "  set-id ID [--bundle FILE]  set the behavior ID, optionally with a packed bundle\n"
    "  supported                  tell whether behavior bundles are supported\n"
    "  value KEY                  print the behavior setting for KEY\n"
    "  check-update [--wait SECONDS]\n"
    "                             look for a newer behavior bundle and install it; print\n"
    "                             how the check went\n"
    "  client-type N              announce this client's type N\n"
    "  watch [--count N] [--timeout SECONDS]\n"
    "                             print the names of posted notifications\n"
    "  pack DIR -o FILE           pack the files below DIR into a bundle payload FILE\n"
    "                             (works offline: the daemon is not called)\n"
    "\n"
    "Options (anywhere on the line):\n"
    "  --address ADDRESS  use the message bus at this D-Bus address instead\n"
    "  --json[=STYLE]     print the answer as JSON, on one line (short, the default) or\n"
    "                     indented (pretty); every command but watch and pack\n"
    "  --version          show the version\n"
    "  -h, --help         show this help; 'tavrixctl COMMAND --help' shows a command's\n"
    "  --                 ends the options (for a negative client type)\n"
    "\n"
    "Exit status: 0 on success, 1 on failure (value: no value; set-id: the ID was refused,\n"
    "or with --bundle the bundle was not extracted; check-update: the check failed; show:\n"
    "no such property), 2 on a usage mistake. Setting the behavior ID and starting a check\n"
    "are for root and members of the \"tavrix\" group; anyone may ask the rest.\n";

// Options a command takes besides the global ones.
enum Option : int {
    kOptionAddress = 256,
    kOptionJson,
    kOptionVersion,
    kOptionBundle,
    kOptionWait,
    kOptionCount,
    kOptionTimeout,
    kOptionValue,
    kOptionHelp = 'h',
    kOptionOutput = 'o',
    kOptionProperty = 'p',
};

struct Command {
    const char* name;
    std::set<int> options;
    const char* help;
};

const Command kCommands[] = {
    {"status",
     {},
     "usage: tavrixctl status\n"
     "\n"
     "Prints the daemon's state: its version, the behavior ID, whether bundles are supported\n"
     "and why not, the linked bundle, the system and user bundle versions, the next update\n"
     "check, and the last check and payload with their outcome. Anyone may ask; nothing is\n"
     "started by asking. With --json, the status dictionary (see docs/dbus-api.md).\n"},
    {"show",
     {kOptionProperty, kOptionValue},
     "usage: tavrixctl show [-p NAME[,NAME...]]... [--value]\n"
     "\n"
     "Prints the daemon's properties (see docs/dbus-api.md), one NAME=VALUE a line: text as\n"
     "it is, booleans as yes or no, times as YYYY-MM-DDTHH:MM:SSZ (empty when there is none).\n"
     "-p shows only the named ones, in the order given; --value leaves out the names. Exits 1\n"
     "when a named property does not exist.\n"},
    {"set-id",
     {kOptionBundle},
     "usage: tavrixctl set-id ID [--bundle FILE]\n"
     "\n"
     "Sets the behavior ID (the daemon stores it lower-cased). With --bundle, FILE (\"-\" for\n"
     "standard input, a file or a finished pipe) is a gzip- or compress-compressed tar or\n"
     "cpio archive the daemon reads as the behavior bundle.\n"
     "Prints \"yes\" when the daemon accepted the ID, \"no\" when it refused it; with a\n"
     "bundle, then what became of it (\"extracted N bytes into the user bundle\", or why not),\n"
     "and exits 1 when it was not extracted.\n"},
    {"supported",
     {},
     "usage: tavrixctl supported\n"
     "\n"
     "Prints \"yes\" when behavior bundles are enabled on this device and a behavior ID is set,\n"
     "else \"no\".\n"},
    {"value",
     {},
     "usage: tavrixctl value KEY\n"
     "\n"
     "Prints the behavior setting for KEY (strings as they are, other values readably). When\n"
     "there is none, prints nothing (with --json, a null value) and exits 1.\n"},
    {"check-update",
     {kOptionWait},
     "usage: tavrixctl check-update [--wait SECONDS]\n"
     "\n"
     "Asks the daemon to look for a newer behavior bundle and install it. Prints \"yes\" when\n"
     "an update was found and its download started, else \"no\", then how the check went\n"
     "(the status view's last check): \"up to date ...\", \"installed version V\",\n"
     "\"no catalog configured\", \"catalog refused: ...\", \"catalog fetch failed: ...\",\n"
     "\"download failed: ...\" or, while it goes on, \"downloading version V\". The download\n"
     "and the installation go on in the daemon after the answer; with --wait, after a \"yes\"\n"
     "it waits up to SECONDS for the daemon to announce the check's end. Exits 0 when the\n"
     "bundle is up to date, installed or (without --wait) downloading, 1 when the check failed\n"
     "or did not end in time.\n"},
    {"client-type",
     {},
     "usage: tavrixctl client-type N\n"
     "\n"
     "Announces this client's type, a signed 32-bit number (after -- when negative). Prints\n"
     "\"yes\" when the daemon knows this connection as a client, else \"no\".\n"},
    {"watch",
     {kOptionCount, kOptionTimeout},
     "usage: tavrixctl watch [--count N] [--timeout SECONDS]\n"
     "\n"
     "Prints the name of every notification posted by the daemon, one a line, until\n"
     "interrupted (SIGINT, SIGTERM), after N notifications, or after SECONDS. Exits 1 when\n"
     "the timeout passes before N notifications arrived. \"Watching for notifications\" on\n"
     "stderr means the subscription is in place.\n"},
    {"pack",
     {kOptionOutput},
     "usage: tavrixctl pack DIR -o FILE\n"
     "\n"
     "Packs every regular file below DIR, named by its path relative to DIR, into a\n"
     "gzip-compressed tar archive for 'set-id --bundle'. Together the files may hold at most\n"
     "10000000 bytes. Each file that cannot be packed (unreadable, or over that limit) is\n"
     "named on stderr and nothing is written; otherwise FILE is replaced whole. Other kinds\n"
     "of entries (symbolic links, devices) are named and left out. DIR must be a bundle: an\n"
     "Info.plist with QZBundleIdentifier and QZBundleVersion strings and a behavior.plist,\n"
     "else nothing is packed. The daemon is not called.\n"},
};

const option kLongOptions[] = {
    {"address", required_argument, nullptr, kOptionAddress},
    {"json", optional_argument, nullptr, kOptionJson},
    {"version", no_argument, nullptr, kOptionVersion},
    {"help", no_argument, nullptr, kOptionHelp},
    {"bundle", required_argument, nullptr, kOptionBundle},
    {"wait", required_argument, nullptr, kOptionWait},
    {"count", required_argument, nullptr, kOptionCount},
    {"timeout", required_argument, nullptr, kOptionTimeout},
    {"output", required_argument, nullptr, kOptionOutput},
    {"property", required_argument, nullptr, kOptionProperty},
    {"value", no_argument, nullptr, kOptionValue},
    {nullptr, 0, nullptr, 0},
};

std::string optionName(int code) {
    for (const option& entry : kLongOptions) {
        if (entry.name != nullptr && entry.val == code) {
            return std::string("--") + entry.name;
        }
    }
    return "?";
}

// A usage mistake: the reason, reported with exit status 2.
struct UsageError {
    std::string reason;
};

// A failure that is not the bus's: the reason, reported with exit status 1.
struct Failure {
    std::string reason;
};

const Command* findCommand(std::string_view name) {
    for (const Command& command : kCommands) {
        if (name == command.name) {
            return &command;
        }
    }
    return nullptr;
}

std::optional<long long> parseInteger(const std::string& text, long long min, long long max) {
    if (text.empty()) {
        return std::nullopt;
    }
    errno = 0;
    char* end = nullptr;
    long long value = std::strtoll(text.c_str(), &end, 10);
    if (errno != 0 || *end != '\0' || value < min || value > max) {
        return std::nullopt;
    }
    return value;
}

std::optional<double> parseSeconds(const std::string& text) {
    if (text.empty()) {
        return std::nullopt;
    }
    errno = 0;
    char* end = nullptr;
    double value = std::strtod(text.c_str(), &end);
    // Up to a year, so that the conversion to milliseconds cannot overflow.
    if (errno != 0 || *end != '\0' || !std::isfinite(value) || value < 0 ||
        value > 366.0 * 24 * 3600) {
        return std::nullopt;
    }
    return value;
}

// The bundle as a descriptor the daemon takes: a regular file as it is; anything else (a pipe
// still being written, a terminal) copied whole into a memory file first, since the daemon never
// waits for a writer.
tavrix::io::UniqueFd openBundle(const std::string& path) {
    tavrix::io::UniqueFd fd(path == "-" ? ::fcntl(STDIN_FILENO, F_DUPFD_CLOEXEC, 0)
                                        : ::open(path.c_str(), O_RDONLY | O_CLOEXEC));
    struct stat info {};
    if (!fd || ::fstat(fd.get(), &info) != 0) {
        throw Failure{"cannot read " + path + ": " + std::strerror(errno)};
    }
    if (S_ISREG(info.st_mode)) {
        return fd;
    }
    tavrix::io::UniqueFd copy(::memfd_create("bundle", MFD_CLOEXEC));
    if (!copy) {
        throw Failure{std::string("cannot make a memory file: ") + std::strerror(errno)};
    }
    if (int error = tavrix::io::readChunks(fd.get(), [&copy](std::string_view chunk) {
            return tavrix::io::writeAll(copy.get(), chunk);
        })) {
        throw Failure{"cannot read " + path + ": " + std::strerror(error)};
    }
    return copy;
}

// The command line once getopt_long has read it: the options (each with its last value; -p
// with all of them) and the operands, the first of which names the command.
struct CommandLine {
    std::map<int, std::string> options;
    std::vector<std::string> properties;
    std::vector<std::string> operands;
    bool has(int code) const { return options.contains(code); }
    std::optional<std::string> value(int code) const {
        auto found = options.find(code);
        return found != options.end() ? std::optional(found->second) : std::nullopt;
    }
};

CommandLine readCommandLine(int argc, char** argv) {
    CommandLine line;
    opterr = 0;  // the messages below say more
    optind = 1;
    for (;;) {
        int index = -1;
        const int code = getopt_long(argc, argv, ":ho:p:", kLongOptions, &index);
        if (code == -1) {
            break;
        }
        if (code == '?') {
            const std::string word = argv[optind - 1];
            throw UsageError{"unknown option " + (optopt != 0 && !word.starts_with("--")
                                                      ? std::string("-") + static_cast<char>(optopt)
                                                      : word)};
        }
        if (code == ':') {
            throw UsageError{
                (optopt < 256 ? std::string("-") + static_cast<char>(optopt) : optionName(optopt)) +
                " needs a value"};
        }
        if (code == kOptionProperty) {
            std::string names = optarg;
            for (std::size_t start = 0; start <= names.size();) {
                const std::size_t comma = std::min(names.find(',', start), names.size());
                if (comma > start) {
                    line.properties.push_back(names.substr(start, comma - start));
                }
                start = comma + 1;
            }
        }
        line.options[code] = optarg != nullptr ? optarg : "";
    }
    line.operands.assign(argv + optind, argv + argc);
    return line;
}

void expectOperands(const Command& command, const CommandLine& line,
                    std::initializer_list<const char*> names) {
    if (line.operands.size() - 1 == names.size()) {
        return;
    }
    std::string expected;
    for (const char* name : names) {
        expected += std::string(" ") + name;
    }
    throw UsageError{std::string(command.name) + (names.size() == 0
                                                      ? " takes no arguments"
                                                      : " expects the arguments" + expected)};
}

std::chrono::milliseconds secondsOption(const Command& command, const CommandLine& line, int code) {
    const std::string text = *line.value(code);
    auto seconds = parseSeconds(text);
    if (!seconds) {
        throw UsageError{std::string(command.name) + ": " + optionName(code) +
                         " needs a number of seconds, not '" + text + "'"};
    }
    return std::chrono::milliseconds(std::llround(*seconds * 1000));
}

namespace fs = std::filesystem;

// A regular file to pack: where it is, and its entry name relative to the packed directory.
struct FileToPack {
    fs::path path;
    std::string name;
};

// Collects the regular files below directory (recursively), naming them relative to it. What
// cannot be read, or is neither a file nor a directory, goes to problems.
void collectFiles(const fs::path& directory, const std::string& prefix,
                  std::vector<FileToPack>& files, std::vector<std::string>& problems) {
    std::error_code error;
    fs::directory_iterator entries(directory, error);
    for (; !error && entries != fs::directory_iterator(); entries.increment(error)) {
        const fs::path& path = entries->path();
        const std::string name = prefix + path.filename().string();
        std::error_code statusError;
        fs::file_status status = entries->symlink_status(statusError);
        if (statusError) {
            problems.push_back(path.string() + ": " + statusError.message());
        } else if (fs::is_directory(status)) {
            collectFiles(path, name + "/", files, problems);
        } else if (fs::is_regular_file(status)) {
            files.push_back({path, name});
        } else {
            std::fprintf(stderr, "tavrixctl: pack: leaving out %s: not a regular file\n",
                         path.c_str());
        }
    }
    if (error) {
        problems.push_back(directory.string() + ": " + error.message());
    }
}

bool samePath(const fs::path& a, const fs::path& b) {
    std::error_code error;
    return fs::weakly_canonical(a, error) == fs::weakly_canonical(b, error) && !error;
}

int pack(const std::string& directory, const std::optional<std::string>& output) {
    using tavrix::payload::Archive;
    if (!output || output->empty()) {
        throw UsageError{"pack: -o FILE is required"};
    }
    if (auto bundle = tavrix::tools::checkBundleDirectory(directory); !bundle) {
        throw Failure{"pack: refused " + bundle.reason()};
    }

    std::vector<FileToPack> files;
    std::vector<std::string> problems;
    collectFiles(directory, "", files, problems);
    // A previous result inside the directory is not packed into the next one.
    std::erase_if(files, [&](const FileToPack& file) { return samePath(file.path, *output); });
    std::sort(files.begin(), files.end(),
              [](const FileToPack& a, const FileToPack& b) { return a.name < b.name; });

    auto archive = Archive::initWithArchiveType(tavrix::payload::kArchiveTypeGzip, *output);
    if (!archive) {
        throw Failure{"pack: cannot set up the archive writer"};
    }
    for (const FileToPack& file : files) {
        if (archive->addFile(file.path.string(), file.name)) {
            continue;
        }
        std::uint64_t size = Archive::sizeOnDiskForPath(file.path.string());
        if (archive->uncompressedSize() + size > archive->maxUncompressedSize()) {
            problems.push_back(file.path.string() + ": " + std::to_string(size) +
                               " bytes would take the bundle over the " +
                               std::to_string(archive->maxUncompressedSize()) + "-byte limit");
        } else {
            problems.push_back(file.path.string() + ": cannot be read");
        }
    }
    for (const std::string& problem : problems) {
        std::fprintf(stderr, "tavrixctl: pack: refused %s\n", problem.c_str());
    }
    if (!problems.empty()) {
        throw Failure{"pack: nothing written to " + *output};
    }
    if (archive->files().empty()) {
        throw Failure{"pack: no files below " + directory + "; nothing written to " + *output};
    }
    if (!archive->close()) {
        throw Failure{"pack: cannot finish the archive"};
    }
    if (!archive->writeToFile(*output)) {
        throw Failure{"pack: cannot write " + *output + ": " + std::strerror(errno)};
    }
    std::printf("packed %zu files (%u bytes) into %s (%zu bytes)\n", archive->files().size(),
                archive->uncompressedSize(), output->c_str(), archive->archiveData().size());
    return 0;
}

// Set from --json: answers go out as JSON in this style.
std::optional<JsonStyle> jsonStyle;

void printJson(const json& answer) {
    std::fputs(tavrix::tools::dumpJson(answer, *jsonStyle).c_str(), stdout);
}

// A yes/no answer: "yes" or "no", or {"<Name>":true} in JSON.
void printBoolean(bool answer, const char* name) {
    if (jsonStyle) {
        printJson({{name, answer}});
    } else {
        std::printf("%s\n", answer ? "yes" : "no");
    }
}

// The outcomes of a check that count as success.
bool checkSucceeded(const std::string& outcome, bool waited) {
    return outcome == "up-to-date" || outcome == "held-back" || outcome == "installed" ||
           (!waited && outcome == "downloading");
}

// What a command does once connected; answers the exit status.
using Action = std::function<int(TavrixClient&)>;

int watch(TavrixClient& client, std::optional<long long> count,
          std::optional<std::chrono::milliseconds> timeout) {
    // Blocked, the stop signals stay pending instead of ending the process, and the wait loop
    // sees them without a handler.
    sigset_t stopSignals;
    sigemptyset(&stopSignals);
    sigaddset(&stopSignals, SIGINT);
    sigaddset(&stopSignals, SIGTERM);
    if (sigprocmask(SIG_BLOCK, &stopSignals, nullptr) != 0) {
        throw Failure{std::string("cannot block signals: ") + std::strerror(errno)};
    }
    auto stopRequested = [] {
        sigset_t pending;
        sigemptyset(&pending);
        return sigpending(&pending) == 0 &&
               (sigismember(&pending, SIGINT) == 1 || sigismember(&pending, SIGTERM) == 1);
    };

    long long seen = 0;
    auto subscription = client.subscribe([&](const std::string& name) {
        ++seen;
        std::printf("%s\n", name.c_str());
        std::fflush(stdout);
    });
    std::fprintf(stderr, "Watching for notifications\n");

    auto finished = [&] { return stopRequested() || (count && seen >= *count); };
    if (!timeout) {
        // Without a timeout, wait in day-long rounds until finished.
        while (!client.runUntil(finished, std::chrono::hours(24))) {
        }
        return 0;
    }
    if (!client.runUntil(finished, *timeout) && count) {
        throw Failure{"watch timed out after " + std::to_string(seen) + " of " +
                      std::to_string(*count) + " notifications"};
    }
    return 0;
}

// The update is installed after the answer, on the daemon's own time. A check that did not start
// a download has ended: the status view's last check says how. Waiting for one that did follows

// The update is installed after the answer, on the daemon's own time. A check that did not start
// a download has ended: the status view's last check says how. Waiting for one that did follows
// the daemon's UpdateCheckFinished, subscribed before asking so that a quick end is not missed.
int checkUpdate(TavrixClient& client, std::optional<std::chrono::milliseconds> wait) {
    std::optional<std::pair<std::string, std::string>> finished;
    auto subscription =
        client.subscribeCheckFinished([&](const std::string& outcome, const std::string& reason) {
            finished.emplace(outcome, reason);
        });
    const bool started = client.checkForTavrixBundleUpdate();
    if (!jsonStyle) {
        printBoolean(started, "Started");
        std::fflush(stdout);
    }
    std::string outcome;
    std::string reason;
    if (started && wait) {
        if (!client.runUntil([&] { return finished.has_value(); }, *wait)) {
            char seconds[32];
            std::snprintf(seconds, sizeof seconds, "%g", static_cast<double>(wait->count()) / 1000);
            throw Failure{std::string("check-update: still downloading after ") + seconds +
                          " seconds"};
        }
        std::tie(outcome, reason) = *finished;
    } else {
        const plist::Dictionary status = client.status();
        auto check = status.find("LastCheck");
        const plist::Dictionary* last =
            check != status.end() ? check->second.asDictionary() : nullptr;
        auto textOf = [last](const char* key) -> std::string {
            if (last == nullptr) {
                return {};
            }
            auto found = last->find(key);
            return found != last->end() && found->second.asString() != nullptr
                       ? *found->second.asString()
                       : std::string();
        };
        outcome = textOf("Outcome");
        reason = outcome.empty() ? "no check recorded" : textOf("Reason");
    }
    if (jsonStyle) {
        printJson({{"Started", started}, {"Outcome", outcome}, {"Reason", reason}});
    } else {
        std::printf("%s\n", reason.c_str());
    }
    return checkSucceeded(outcome, started && wait.has_value()) ? 0 : kFailure;
}

// The ID is accepted whatever becomes of the payload; the payload's outcome decides the exit.
int setIDWithBundle(TavrixClient& client, const std::string& id, int fd) {
    const tavrix::client::PayloadResult result = client.setTavrixIDWithBundleFile(id, fd);
    if (jsonStyle) {
        printJson({{"Accepted", result.accepted},
                   {"Extracted", result.extracted},
                   {"Reason", result.reason}});
    } else {
        printBoolean(result.accepted, "Accepted");
        std::printf("%s\n", result.reason.c_str());
    }
    return result.extracted ? 0 : kFailure;
}

// Times travel as microseconds since 1970 (0 for none); shown as dates.
bool isTimeProperty(const std::string& name) {
    return name.ends_with("USec");
}

std::optional<plist::Date> timeOf(const plist::Value& value) {
    const plist::Integer* micros = value.asInteger();
    if (micros == nullptr || micros->unsignedValue() == 0) {
        return std::nullopt;
    }
    constexpr double kReferenceDateUnixSeconds = 978307200.0;
    return plist::Date{static_cast<double>(micros->unsignedValue()) / 1e6 -
                       kReferenceDateUnixSeconds};
}

int show(TavrixClient& client, const std::vector<std::string>& wanted, bool valuesOnly) {
    const plist::Dictionary properties = client.properties();
    std::vector<std::string> names = wanted;
    if (names.empty()) {
        for (const auto& [name, value] : properties) {
            names.push_back(name);
        }
    }
    json answer = json::object();
    int status = 0;
    for (const std::string& name : names) {
        auto found = properties.find(name);
        if (found == properties.end()) {
            std::fprintf(stderr, "tavrixctl: show: no property %s\n", name.c_str());
            status = kFailure;
            continue;
        }
        const plist::Value& value = found->second;
        std::optional<plist::Date> time =
            isTimeProperty(name) ? timeOf(value) : std::optional<plist::Date>();
        if (jsonStyle) {
            answer[name] = isTimeProperty(name)
                               ? (time ? tavrix::tools::toJson(plist::Value(*time)) : json())
                               : tavrix::tools::toJson(value);
            continue;
        }
        std::string text;
        if (isTimeProperty(name)) {
            text = time ? tavrix::tools::isoDate(*time) : "";
        } else if (const bool* flag = value.asBoolean()) {
            text = *flag ? "yes" : "no";
        } else if (const std::string* string = value.asString()) {
            text = *string;
        } else {
            text = value.description();
        }
        std::printf("%s%s\n", valuesOnly ? "" : (name + "=").c_str(), text.c_str());
    }
    if (jsonStyle) {
        printJson(answer);
    }
    return status;
}

int printStatus(TavrixClient& client) {
    const plist::Dictionary status = client.status();
    if (jsonStyle) {
        printJson(tavrix::tools::toJson(plist::Value(status)));
    } else {
        std::fputs(tavrix::tools::readableStatus(status).c_str(), stdout);
    }
    return 0;
}

int printValue(TavrixClient& client, const std::string& key) {
    auto value = client.copyTavrixValue(key);
    if (jsonStyle) {
        printJson({{"Key", key}, {"Value", value ? tavrix::tools::toJson(*value) : json()}});
    } else if (value) {
        const std::string* text = value->asString();
        std::printf("%s\n", text != nullptr ? text->c_str() : value->description().c_str());
    } else {
        std::fprintf(stderr, "tavrixctl: no value for %s\n", key.c_str());
    }
    return value ? 0 : kFailure;
}

// Checks the command's arguments (and opens its files) before anything is sent.
Action parseCommand(const Command& command, const CommandLine& line) {
    const std::string_view name = command.name;
    if (name == "set-id") {
        expectOperands(command, line, {"ID"});
        const std::string id = line.operands[1];
        auto file = line.value(kOptionBundle);
        if (!file) {
            // A refused ID fails the command, so that "set-id X && ..." stops there.
            return [id](TavrixClient& client) {
                const bool accepted = client.setTavrixID(id, std::nullopt);
                printBoolean(accepted, "Accepted");
                return accepted ? 0 : kFailure;
            };
        }
        // The daemon reads the file itself; "-" is standard input.
        auto bundle = std::make_shared<tavrix::io::UniqueFd>(openBundle(*file));
        return [id, bundle](TavrixClient& client) {
            return setIDWithBundle(client, id, bundle->get());
        };
    }
    if (name == "supported") {
        expectOperands(command, line, {});
        return [](TavrixClient& client) {
            printBoolean(client.isTavrixBundleSupported(), "Supported");
            return 0;
        };
    }
    if (name == "status") {
        expectOperands(command, line, {});
        return printStatus;
    }
    if (name == "show") {
        expectOperands(command, line, {});
        return [wanted = line.properties, valuesOnly = line.has(kOptionValue)](
                   TavrixClient& client) { return show(client, wanted, valuesOnly); };
    }
    if (name == "value") {
        expectOperands(command, line, {"KEY"});
        return [key = line.operands[1]](TavrixClient& client) { return printValue(client, key); };
    }
    if (name == "check-update") {
        expectOperands(command, line, {});
        std::optional<std::chrono::milliseconds> wait;
        if (line.has(kOptionWait)) {
            wait = secondsOption(command, line, kOptionWait);
        }
        return [wait](TavrixClient& client) { return checkUpdate(client, wait); };
    }
    if (name == "client-type") {
        expectOperands(command, line, {"N"});
        const std::string& text = line.operands[1];
        auto type = parseInteger(text, INT32_MIN, INT32_MAX);
        if (!type) {
            throw UsageError{"client-type: N must be a signed 32-bit number, not '" + text + "'"};
        }
        return [type = static_cast<std::int32_t>(*type)](TavrixClient& client) {
            printBoolean(client.setClientType(type), "Known");
            return 0;
        };
    }
    // watch
    expectOperands(command, line, {});
    std::optional<long long> count;
    if (auto text = line.value(kOptionCount)) {
        count = parseInteger(*text, 1, std::numeric_limits<long long>::max());
        if (!count) {
            throw UsageError{"watch: --count needs a positive whole number, not '" + *text + "'"};
        }
    }
    std::optional<std::chrono::milliseconds> timeout;
    if (line.has(kOptionTimeout)) {
        timeout = secondsOption(command, line, kOptionTimeout);
    }
    return [count, timeout](TavrixClient& client) { return watch(client, count, timeout); };
}

int run(int argc, char** argv) {
    CommandLine line = readCommandLine(argc, argv);
    if (line.operands.empty()) {
        if (line.has(kOptionHelp)) {
            std::fputs(kOverallHelp, stdout);
            return 0;
        }
        if (line.has(kOptionVersion)) {
            std::printf("tavrixctl %s\n", TAVRIX_VERSION);
            return 0;
        }
        line.operands.push_back("status");
    }
    const Command* command = findCommand(line.operands[0]);
    if (command == nullptr) {
        throw UsageError{"unknown command '" + line.operands[0] + "'"};
    }
    if (line.has(kOptionHelp)) {
        std::fputs(command->help, stdout);
        return 0;
    }
    for (const auto& [code, value] : line.options) {
        const bool global = code == kOptionAddress || code == kOptionJson;
        if (!global && !command->options.contains(code)) {
            throw UsageError{
                std::string(command->name) + ": unknown option " +
                (code < 256 ? std::string("-") + static_cast<char>(code) : optionName(code))};
        }
    }
    if (auto style = line.value(kOptionJson)) {
        if (*style == "" || *style == "short") {
            jsonStyle = JsonStyle::Short;
        } else if (*style == "pretty") {
            jsonStyle = JsonStyle::Pretty;
        } else {
            throw UsageError{"--json takes short or pretty, not '" + *style + "'"};
        }
    }
    const std::string_view name = command->name;
    if (jsonStyle && (name == "pack" || name == "watch")) {
        throw UsageError{std::string(name) + " has no --json output"};
    }
    // Packing works on local files only; it needs no bus.
    if (name == "pack") {
        expectOperands(*command, line, {"DIR"});
        return pack(line.operands[1], line.value(kOptionOutput));
    }
    Action action = parseCommand(*command, line);
    auto address = line.value(kOptionAddress);
    if (address && address->empty()) {
        throw UsageError{"--address needs a value"};
    }
    TavrixClient client =
        address ? TavrixClient::connectToAddress(*address) : TavrixClient::connectToSystemBus();
    return action(client);
}

}  // namespace

int main(int argc, char** argv) {
    try {
        return run(argc, argv);
    } catch (const UsageError& error) {
        std::fprintf(stderr, "tavrixctl: %s (see tavrixctl --help)\n", error.reason.c_str());
        return kUsage;
    } catch (const Failure& error) {
        std::fprintf(stderr, "tavrixctl: %s\n", error.reason.c_str());
        return kFailure;
    } catch (const ClientError& error) {
        if (error.category() == tavrix::client::ErrorCategory::AccessDenied) {
            std::fprintf(stderr,
                         "tavrixctl: refused by the bus policy (AccessDenied): only root and "
                         "members of the \"tavrix\" group may set the behavior ID or start an "
                         "update check\n");
        } else {
            std::fprintf(stderr, "tavrixctl: %s\n", error.what());
        }
        return kFailure;
    } catch (const std::exception& error) {
        std::fprintf(stderr, "tavrixctl: %s\n", error.what());
        return kFailure;
    }
}
