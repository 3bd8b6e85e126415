// tavrixctl: calls tavrixservicesd from the command line, watches its notifications and packs
// bundle payloads.
// Results go to stdout plainly; a failure is one line on stderr and exit status 1, a usage
// mistake exit status 2.
#include <fcntl.h>
#include <signal.h>
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
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "client/TavrixClient.h"
#include "payload/Archive.h"
#include "util/UniqueFd.h"

namespace {

using tavrix::client::ClientError;
using tavrix::client::TavrixClient;

constexpr int kFailure = 1;
constexpr int kUsage = 2;

// Posted by the daemon after it linked a changed bundle.
constexpr const char* kBundleChangedNotification = "kTVXBehaviorBundleChangedNotification";

constexpr const char* kOverallHelp =
    "usage: tavrixctl [--address ADDRESS] COMMAND [ARGUMENTS]\n"
    "\n"
    "Calls tavrixservicesd on the system bus.\n"
    "\n"
    "Commands:\n"
    "  set-id ID [--bundle FILE]  set the behavior ID, optionally with a packed bundle\n"
    "  supported                  tell whether behavior bundles are supported\n"
    "  value KEY                  print the behavior setting for KEY\n"
    "  check-update [--wait SECONDS]\n"
    "                             look for a newer behavior bundle and install it\n"
    "  client-type N              announce this client's type N\n"
    "  watch [--count N] [--timeout SECONDS]\n"
    "                             print the names of posted notifications\n"
    "  pack DIR -o FILE           pack the files below DIR into a bundle payload FILE\n"
    "                             (works offline: the daemon is not called)\n"
    "\n"
    "Options:\n"
    "  --address ADDRESS  use the message bus at this D-Bus address instead\n"
    "  --version          show the version\n"
    "  -h, --help         show this help; 'tavrixctl COMMAND --help' shows a command's\n"
    "\n"
    "Exit status: 0 on success (whatever the answer), 1 on failure, 2 on a usage mistake.\n";

struct Command {
    const char* name;
    const char* help;
};

constexpr Command kCommands[] = {
    {"set-id",
     "usage: tavrixctl set-id ID [--bundle FILE]\n"
     "\n"
     "Sets the behavior ID (the daemon stores it lower-cased). With --bundle, FILE is a\n"
     "gzip- or compress-compressed tar or cpio archive sent as the behavior bundle.\n"
     "Prints \"yes\" when the daemon accepted the ID, \"no\" when it refused it.\n"},
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
     "an update was found and its download started, else \"no\". The download and the\n"
     "installation go on in the daemon after the answer. With --wait, after a \"yes\" it waits\n"
     "up to SECONDS for the daemon to announce the installed bundle and prints the\n"
     "notification's name; exits 1 when none came in time.\n"},
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
     "of entries (symbolic links, devices) are named and left out. The daemon is not called.\n"},
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

std::vector<std::uint8_t> readWholeFile(const std::string& path) {
    tavrix::UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
    if (!fd) {
        throw Failure{"cannot read " + path + ": " + std::strerror(errno)};
    }
    std::vector<std::uint8_t> bytes;
    std::uint8_t buffer[65536];
    for (;;) {
        ssize_t got = ::read(fd.get(), buffer, sizeof buffer);
        if (got == 0) {
            return bytes;
        }
        if (got < 0) {
            if (errno == EINTR) {
                continue;
            }
            throw Failure{"cannot read " + path + ": " + std::strerror(errno)};
        }
        bytes.insert(bytes.end(), buffer, buffer + got);
    }
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
    std::error_code error;
    if (!fs::is_directory(directory, error)) {
        throw Failure{"pack: " + directory + " is not a directory"};
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

void printBoolean(bool answer) {
    std::printf("%s\n", answer ? "yes" : "no");
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

// The update is installed after the answer, on the daemon's own time; waiting shows its end.
int checkUpdate(TavrixClient& client, std::optional<std::chrono::milliseconds> wait) {
    bool announced = false;
    tavrix::client::NotificationSubscription subscription;
    if (wait) {
        // Subscribed before asking, so that a quick installation is not missed.
        subscription = client.subscribe([&](const std::string& name) {
            announced = announced || name == kBundleChangedNotification;
        });
    }
    const bool started = client.checkForTavrixBundleUpdate();
    printBoolean(started);
    if (!wait || !started) {
        return 0;
    }
    std::fflush(stdout);
    if (!client.runUntil([&] { return announced; }, *wait)) {
        char seconds[32];
        std::snprintf(seconds, sizeof seconds, "%g", static_cast<double>(wait->count()) / 1000);
        throw Failure{std::string("check-update: no new bundle was announced within ") + seconds +
                      " seconds"};
    }
    std::printf("%s\n", kBundleChangedNotification);
    return 0;
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
        std::optional<std::vector<std::uint8_t>> bundle;
        if (file) {
            bundle = readWholeFile(*file);
        }
        return [id, bundle = std::move(bundle)](TavrixClient& client) {
            printBoolean(client.setTavrixID(id, bundle));
            return 0;
        };
    }
    if (name == "supported") {
        arguments.operands({});
        return [](TavrixClient& client) {
            printBoolean(client.isTavrixBundleSupported());
            return 0;
        };
    }
    if (name == "value") {
        auto key = arguments.operands({"KEY"})[0];
        return [key](TavrixClient& client) {
            auto value = client.copyTavrixValue(key);
            std::printf("%s\n", value ? value->description().c_str() : "(no value)");
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
            printBoolean(client.setClientType(type));
            return 0;
        };
    }
    return parseWatch(arguments);
}

int run(int argc, char** argv) {
    std::vector<std::string> words(argv + 1, argv + argc);
    std::optional<std::string> address;
    std::size_t next = 0;
    // Global options come before the command.
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
        if (word == "--address") {
            if (next + 1 == words.size()) {
                throw UsageError{"--address needs a value"};
            }
            address = words[++next];
        } else if (word.rfind("--address=", 0) == 0) {
            address = word.substr(std::strlen("--address="));
        } else {
            throw UsageError{"unknown option " + word};
        }
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
        if (word == "--help") {
            std::fputs(command->help, stdout);
            return 0;
        }
    }
    if (address && address->empty()) {
        throw UsageError{"--address needs a value"};
    }
    Arguments arguments(*command, std::move(rest));
    // Packing works on local files only; it needs no bus.
    if (std::string_view(command->name) == "pack") {
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
        std::fprintf(stderr, "tavrixctl: %s\n", error.what());
        return kFailure;
    } catch (const std::exception& error) {
        std::fprintf(stderr, "tavrixctl: %s\n", error.what());
        return kFailure;
    }
}
