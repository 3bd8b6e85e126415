// tavrixctl: calls tavrixservicesd from the command line, watches its notifications and packs
// bundle payloads.
// Results go to stdout plainly; a failure is one line on stderr and exit status 1, a usage
// mistake exit status 2.
#include <fcntl.h>
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
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <tuple>
#include <utility>
#include <vector>

#include "TavrixctlOutput.h"
#include "client/TavrixClient.h"
#include "io/FileIO.h"
#include "io/UniqueFd.h"
#include "payload/Archive.h"
#include "publishing/BundleCheck.h"

namespace {

using tavrix::client::ClientError;
using tavrix::client::TavrixClient;
namespace plist = tavrix::plist;

constexpr int kFailure = 1;
constexpr int kUsage = 2;

constexpr const char* kOverallHelp =
    "usage: tavrixctl [--address ADDRESS] [--json] COMMAND [ARGUMENTS]\n"
    "\n"
    "Calls tavrixservicesd on the system bus.\n"
    "\n"
    "Commands:\n"
    "  status                     show the daemon's state: behavior ID, linked bundle,\n"
    "                             update checks and the last payload\n"
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
    "  --json             print the answer as one line of JSON (status, supported, value,\n"
    "                     check-update, set-id, client-type)\n"
    "  --version          show the version\n"
    "  -h, --help         show this help; 'tavrixctl COMMAND --help' shows a command's\n"
    "\n"
    "Exit status: 0 on success (whatever the answer), 1 on failure (check-update: also when\n"
    "the check failed), 2 on a usage mistake. Setting the behavior ID and starting a check\n"
    "are for root and members of the \"tavrix\" group; anyone may ask the rest.\n";

struct Command {
    const char* name;
    const char* help;
};

constexpr Command kCommands[] = {
    {"set-id",
     "usage: tavrixctl set-id ID [--bundle FILE]\n"
     "\n"
     "Sets the behavior ID (the daemon stores it lower-cased). With --bundle, FILE (\"-\" for\n"
     "standard input, a file or a finished pipe) is a gzip- or compress-compressed tar or\n"
     "cpio archive the daemon reads as the behavior bundle.\n"
     "Prints \"yes\" when the daemon accepted the ID, \"no\" when it refused it; with a\n"
     "bundle, then what became of it (\"extracted N bytes into the user bundle\", or why not),\n"
     "and exits 1 when it was not extracted.\n"},
    {"supported",
     "usage: tavrixctl supported\n"
     "\n"
     "Prints \"yes\" when behavior bundles are enabled on this device and a behavior ID is set,\n"
     "else \"no\".\n"},
    {"value",
     "usage: tavrixctl value KEY\n"
     "\n"
     "Prints the behavior setting for KEY (strings as they are, other values readably), or\n"
     "\"(no value)\" when there is none.\n"},
    {"check-update",
     "usage: tavrixctl check-update [--wait SECONDS]\n"
     "\n"
     "Asks the daemon to look for a newer behavior bundle and install it. Prints \"yes\" when\n"
     "an update was found and its download started, else \"no\", then how the check went\n"
     "(the status view's last check): \"up to date ...\", \"installed version V\",\n"
     "\"no catalog configured\", \"catalog refused: ...\", \"catalog fetch failed: ...\",\n"
     "\"download failed: ...\" or, while it goes on, \"downloading version V\". The download\n"
     "and the installation go on in the daemon after the answer; with --wait, after a \"yes\"\n"
     "it waits up to SECONDS for them to end. Exits 0 when the bundle is up to date, installed\n"
     "or (without --wait) downloading, 1 when the check failed or did not end in time.\n"},
    {"status",
     "usage: tavrixctl status\n"
     "\n"
     "Prints the daemon's state: its version, the behavior ID, whether bundles are supported\n"
     "and why not, the linked bundle, the system and user bundle versions, the next update\n"
     "check, and the last check and payload with their outcome. Anyone may ask; nothing is\n"
     "started by asking. With --json, the view as one JSON object (see docs/dbus-api.md).\n"},
    {"client-type",
     "usage: tavrixctl client-type N\n"
     "\n"
     "Announces this client's type, a signed 32-bit number. Prints \"yes\" when the daemon\n"
     "knows this connection as a client, else \"no\".\n"},
    {"watch",
     "usage: tavrixctl watch [--count N] [--timeout SECONDS]\n"
     "\n"
     "Prints the name of every notification posted by the daemon, one a line, until\n"
     "interrupted (SIGINT, SIGTERM), after N notifications, or after SECONDS. Exits 1 when\n"
     "the timeout passes before N notifications arrived. \"Watching for notifications\" on\n"
     "stderr means the subscription is in place.\n"},
    {"pack",
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

// The arguments of one command, with the command's own options taken out.
class Arguments {
  public:
    Arguments(const Command& command, std::vector<std::string> words)
        : command_(command), words_(std::move(words)) {}

    // The value of option (given as "--option VALUE" or "--option=VALUE"), removed from the
    // words.
    std::optional<std::string> takeOption(const std::string& option) {
        for (auto it = words_.begin(); it != words_.end(); ++it) {
            if (*it == option) {
                if (it + 1 == words_.end()) {
                    throw UsageError{std::string(command_.name) + ": " + option + " needs a value"};
                }
                std::string value = *(it + 1);
                words_.erase(it, it + 2);
                return value;
            }
            if (it->rfind(option + "=", 0) == 0) {
                std::string value = it->substr(option.size() + 1);
                words_.erase(it);
                return value;
            }
        }
        return std::nullopt;
    }

    // The remaining words, which must be exactly the named operands.
    std::vector<std::string> operands(std::initializer_list<const char*> names) const {
        for (const std::string& word : words_) {
            // A negative number is an operand, anything else with a dash a mistaken option.
            if (word.size() > 1 && word[0] == '-' && !parseInteger(word, INT64_MIN, INT64_MAX)) {
                throw UsageError{std::string(command_.name) + ": unknown option " + word};
            }
        }
        if (words_.size() != names.size()) {
            std::string expected;
            for (const char* name : names) {
                expected += std::string(" ") + name;
            }
            throw UsageError{
                std::string(command_.name) +
                (names.size() == 0 ? " takes no arguments" : " expects the arguments" + expected)};
        }
        return words_;
    }

  private:
    const Command& command_;
    std::vector<std::string> words_;
};

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

int pack(Arguments& arguments) {
    using tavrix::payload::Archive;
    auto output = arguments.takeOption("-o");
    if (!output) {
        output = arguments.takeOption("--output");
    }
    const std::string directory = arguments.operands({"DIR"})[0];
    if (!output || output->empty()) {
        throw UsageError{"pack: -o FILE is required"};
    }
    std::string notABundle;
    if (!tavrix::tools::checkBundleDirectory(directory, notABundle)) {
        throw Failure{"pack: refused " + notABundle};
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

// Set from --json: answers go out as one line of JSON.
bool jsonOutput = false;

// A yes/no answer: "yes" or "no", or {"<name>":true} in JSON.
void printBoolean(bool answer, const char* name) {
    if (jsonOutput) {
        std::printf("{\"%s\":%s}\n", name, answer ? "true" : "false");
    } else {
        std::printf("%s\n", answer ? "yes" : "no");
    }
}

constexpr const char* kAccessDenied = "org.freedesktop.DBus.Error.AccessDenied";

// The outcomes of a check that count as success.
bool checkSucceeded(const std::string& outcome, bool waited) {
    return outcome == "up-to-date" || outcome == "installed" ||
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
// the daemon's UpdateCheckFinished, subscribed before asking so that a quick end is not missed.
int checkUpdate(TavrixClient& client, std::optional<std::chrono::milliseconds> wait) {
    std::optional<std::pair<std::string, std::string>> finished;
    auto subscription =
        client.subscribeCheckFinished([&](const std::string& outcome, const std::string& reason) {
            finished.emplace(outcome, reason);
        });
    const bool started = client.checkForTavrixBundleUpdate();
    std::string outcome;
    std::string reason;
    if (started && wait) {
        if (!jsonOutput) {
            printBoolean(started, "started");
            std::fflush(stdout);
        }
        if (!client.runUntil([&] { return finished.has_value(); }, *wait)) {
            char seconds[32];
            std::snprintf(seconds, sizeof seconds, "%g", static_cast<double>(wait->count()) / 1000);
            throw Failure{std::string("check-update: still downloading after ") + seconds +
                          " seconds"};
        }
        std::tie(outcome, reason) = *finished;
    } else {
        if (!jsonOutput) {
            printBoolean(started, "started");
        }
        plist::Dictionary status = client.status();
        auto check = status.find("LastCheck");
        const plist::Dictionary* last =
            check != status.end() ? check->second.asDictionary() : nullptr;
        auto textOf = [last](const char* key) {
            auto found = last != nullptr ? last->find(key) : plist::Dictionary::const_iterator();
            return last != nullptr && found != last->end() && found->second.asString() != nullptr
                       ? *found->second.asString()
                       : std::string();
        };
        outcome = textOf("Outcome");
        reason = outcome.empty() ? "no check recorded" : textOf("Reason");
    }
    if (jsonOutput) {
        plist::Dictionary answer{{"started", plist::Value(started)},
                                 {"outcome", plist::Value(outcome)},
                                 {"reason", plist::Value(reason)}};
        std::printf("%s\n", tavrix::tools::toJson(plist::Value(std::move(answer))).c_str());
    } else {
        std::printf("%s\n", reason.c_str());
    }
    return checkSucceeded(outcome, started && wait.has_value()) ? 0 : kFailure;
}

// The ID is accepted whatever becomes of the payload; the payload's outcome decides the exit.
int setIDWithBundle(TavrixClient& client, const std::string& id, int fd) {
    const tavrix::client::PayloadResult result = client.setTavrixIDWithBundleFile(id, fd);
    if (jsonOutput) {
        plist::Dictionary answer{{"accepted", plist::Value(result.accepted)},
                                 {"extracted", plist::Value(result.extracted)},
                                 {"reason", plist::Value(result.reason)}};
        std::printf("%s\n", tavrix::tools::toJson(plist::Value(std::move(answer))).c_str());
    } else {
        printBoolean(result.accepted, "accepted");
        std::printf("%s\n", result.reason.c_str());
    }
    return result.extracted ? 0 : kFailure;
}

Action parseWatch(Arguments& arguments) {
    std::optional<long long> count;
    if (auto text = arguments.takeOption("--count")) {
        count = parseInteger(*text, 1, std::numeric_limits<long long>::max());
        if (!count) {
            throw UsageError{"watch: --count needs a positive whole number, not '" + *text + "'"};
        }
    }
    std::optional<std::chrono::milliseconds> timeout;
    if (auto text = arguments.takeOption("--timeout")) {
        auto seconds = parseSeconds(*text);
        if (!seconds) {
            throw UsageError{"watch: --timeout needs a number of seconds, not '" + *text + "'"};
        }
        timeout = std::chrono::milliseconds(std::llround(*seconds * 1000));
    }
    arguments.operands({});
    return [count, timeout](TavrixClient& client) { return watch(client, count, timeout); };
}

// Checks the command's arguments (and reads its files) before anything is sent.
Action parseCommand(const Command& command, Arguments& arguments) {
    const std::string_view name = command.name;
    if (name == "set-id") {
        auto file = arguments.takeOption("--bundle");
        auto id = arguments.operands({"ID"})[0];
        if (!file) {
            return [id](TavrixClient& client) {
                printBoolean(client.setTavrixID(id, std::nullopt), "accepted");
                return 0;
            };
        }
        // The daemon reads the file itself; "-" is standard input.
        auto bundle = std::make_shared<tavrix::io::UniqueFd>(openBundle(*file));
        return [id, bundle](TavrixClient& client) {
            return setIDWithBundle(client, id, bundle->get());
        };
    }
    if (name == "supported") {
        arguments.operands({});
        return [](TavrixClient& client) {
            printBoolean(client.isTavrixBundleSupported(), "supported");
            return 0;
        };
    }
    if (name == "status") {
        arguments.operands({});
        return [](TavrixClient& client) {
            const plist::Dictionary status = client.status();
            if (jsonOutput) {
                std::printf("%s\n", tavrix::tools::toJson(plist::Value(status)).c_str());
            } else {
                std::fputs(tavrix::tools::readableStatus(status).c_str(), stdout);
            }
            return 0;
        };
    }
    if (name == "value") {
        auto key = arguments.operands({"KEY"})[0];
        return [key](TavrixClient& client) {
            auto value = client.copyTavrixValue(key);
            if (jsonOutput) {
                std::printf("{\"key\":%s,\"value\":%s}\n",
                            tavrix::tools::toJson(plist::Value(key)).c_str(),
                            value ? tavrix::tools::toJson(*value).c_str() : "null");
            } else {
                std::printf("%s\n", value ? value->description().c_str() : "(no value)");
            }
            return 0;
        };
    }
    if (name == "check-update") {
        std::optional<std::chrono::milliseconds> wait;
        if (auto text = arguments.takeOption("--wait")) {
            auto seconds = parseSeconds(*text);
            if (!seconds) {
                throw UsageError{"check-update: --wait needs a number of seconds, not '" + *text +
                                 "'"};
            }
            wait = std::chrono::milliseconds(std::llround(*seconds * 1000));
        }
        arguments.operands({});
        return [wait](TavrixClient& client) { return checkUpdate(client, wait); };
    }
    if (name == "client-type") {
        auto text = arguments.operands({"N"})[0];
        auto type = parseInteger(text, INT32_MIN, INT32_MAX);
        if (!type) {
            throw UsageError{"client-type: N must be a signed 32-bit number, not '" + text + "'"};
        }
        return [type = static_cast<std::int32_t>(*type)](TavrixClient& client) {
            printBoolean(client.setClientType(type), "known");
            return 0;
        };
    }
    return parseWatch(arguments);
}

// Takes the global options out of words, wherever they are.
std::optional<std::string> takeGlobalOptions(std::vector<std::string>& words) {
    std::optional<std::string> address;
    for (std::size_t i = 0; i < words.size();) {
        if (words[i] == "--json") {
            jsonOutput = true;
            words.erase(words.begin() + static_cast<std::ptrdiff_t>(i));
        } else if (words[i] == "--address") {
            if (i + 1 == words.size()) {
                throw UsageError{"--address needs a value"};
            }
            address = words[i + 1];
            words.erase(words.begin() + static_cast<std::ptrdiff_t>(i),
                        words.begin() + static_cast<std::ptrdiff_t>(i) + 2);
        } else if (words[i].rfind("--address=", 0) == 0) {
            address = words[i].substr(std::strlen("--address="));
            words.erase(words.begin() + static_cast<std::ptrdiff_t>(i));
        } else {
            ++i;
        }
    }
    if (address && address->empty()) {
        throw UsageError{"--address needs a value"};
    }
    return address;
}

int run(int argc, char** argv) {
    std::vector<std::string> words(argv + 1, argv + argc);
    std::optional<std::string> address = takeGlobalOptions(words);
    std::size_t next = 0;
    for (; next < words.size() && words[next].rfind("-", 0) == 0; ++next) {
        const std::string& word = words[next];
        if (word == "--help" || word == "-h") {
            std::fputs(kOverallHelp, stdout);
            return 0;
        }
        if (word == "--version") {
            std::printf("tavrixctl %s\n", TAVRIX_VERSION);
            return 0;
        }
        throw UsageError{"unknown option " + word};
    }
    if (next == words.size()) {
        throw UsageError{"no command given"};
    }
    const Command* command = findCommand(words[next]);
    if (command == nullptr) {
        throw UsageError{"unknown command '" + words[next] + "'"};
    }
    std::vector<std::string> rest(words.begin() + static_cast<std::ptrdiff_t>(next) + 1,
                                  words.end());
    for (const std::string& word : rest) {
        if (word == "--help" || word == "-h") {
            std::fputs(command->help, stdout);
            return 0;
        }
    }
    const std::string_view name = command->name;
    if (jsonOutput && (name == "pack" || name == "watch")) {
        throw UsageError{std::string(name) + " has no --json output"};
    }
    Arguments arguments(*command, std::move(rest));
    // Packing works on local files only; it needs no bus.
    if (name == "pack") {
        return pack(arguments);
    }
    Action action = parseCommand(*command, arguments);
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
        if (std::strstr(error.what(), kAccessDenied) != nullptr) {
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
