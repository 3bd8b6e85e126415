#include "BusFixture.h"

#include <signal.h>
#include <unistd.h>

#include <algorithm>
#include <iostream>
#include <sstream>
#include <stdexcept>

#include "plist/PropertyListFormat.h"

namespace tavrix::integration {

namespace fs = std::filesystem;

DeviceRoot::DeviceRoot() {
    test::writeText(path("/etc/passwd"),
                    "root:x:0:0:root:/root:/bin/sh\nmobile:x:" + std::to_string(::getuid()) + ":" +
                        std::to_string(::getgid()) +
                        ":Mobile User:/var/mobile:/usr/sbin/nologin\n");
    fs::create_directories(path("/var/mobile/Library/Preferences"));
    fs::create_directories(runtimeDirectory());
    writeDeviceInfo();
}

void DeviceRoot::writeDeviceInfo(bool cellularRadio, const std::string& serialNumber) {
    writePropertyList("/etc/tavrix/DeviceInfo.plist", {{"contains-cellular-radio", cellularRadio},
                                                       {"wi-fi", true},
                                                       {"DeviceClass", "Tablet"},
                                                       {"ProductType", "Tablet7,1"},
                                                       {"ProductVersion", "9.1"},
                                                       {"BuildVersion", "13B100"},
                                                       {"ReleaseType", "User"},
                                                       {"HWModelStr", "T71AP"},
                                                       {"SerialNumber", serialNumber}});
}

void DeviceRoot::writePropertyList(std::string_view absolutePath, const plist::Dictionary& values) {
    fs::path target = path(absolutePath);
    fs::create_directories(target.parent_path());
    fs::path temporary = target;
    temporary += ".new";
    if (!plist::writeFile(temporary.string(), plist::Value(values))) {
        throw std::runtime_error("cannot write " + temporary.string());
    }
    fs::rename(temporary, target);
}

BusWatcher::BusWatcher(const std::string& address) : bus_(test::connectToBus(address)) {
    // The bus is new: nobody owns the name yet.
    for (auto [match, handler] :
         {std::pair{"type='signal',sender='org.freedesktop.DBus',interface='org.freedesktop.DBus',"
                    "member='NameOwnerChanged',arg0='com.zandor.tavrixservicesd'",
                    &onNameOwnerChanged},
          std::pair{"type='signal',interface='com.zandor.NotificationCenter',member='Posted'",
                    &onPosted},
          std::pair{"type='signal',path='/com/zandor/tavrixservicesd'", &onStatusSignal}}) {
        sd_bus_slot* made = nullptr;
        test::check(sd_bus_add_match(bus_.get(), &made, match, handler, this), "sd_bus_add_match");
        slots_.emplace_back(made);
    }
}

bool BusWatcher::waitUntil(const std::function<bool()>& done, std::chrono::milliseconds timeout) {
    int processed = 0;
    return pollUntil(
        [&] {
            while ((processed = sd_bus_process(bus_.get(), nullptr)) > 0) {
            }
            return done();
        },
        timeout,
        [&](std::chrono::microseconds left) {
            return processed >= 0 && sd_bus_wait(bus_.get(), left.count()) >= 0;
        });
}

int BusWatcher::onNameOwnerChanged(sd_bus_message* message, void* self, sd_bus_error*) {
    auto* watcher = static_cast<BusWatcher*>(self);
    const char* name = nullptr;
    const char* oldOwner = nullptr;
    const char* newOwner = nullptr;
    if (sd_bus_message_read(message, "sss", &name, &oldOwner, &newOwner) >= 0) {
        watcher->owner_ = newOwner;
        watcher->releases_ += *oldOwner != '\0' && *newOwner == '\0' ? 1 : 0;
    }
    return 0;
}

int BusWatcher::onPosted(sd_bus_message* message, void* self, sd_bus_error*) {
    const char* name = nullptr;
    if (sd_bus_message_read(message, "s", &name) >= 0) {
        ++static_cast<BusWatcher*>(self)->notifications_[name];
    }
    return 0;
}

int BusWatcher::onStatusSignal(sd_bus_message* message, void* self, sd_bus_error*) {
    auto& signals = static_cast<BusWatcher*>(self)->statusSignals_;
    const char* first = nullptr;
    const char* second = nullptr;
    if (sd_bus_message_is_signal(message, kStatusInterface, "UpdateCheckFinished")) {
        if (sd_bus_message_read(message, "ss", &first, &second) >= 0) {
            signals.push_back({{"finished", {first, second}}});
        }
        return 0;
    }
    if (!sd_bus_message_is_signal(message, "org.freedesktop.DBus.Properties",
                                  "PropertiesChanged") ||
        sd_bus_message_read(message, "s", &first) < 0 ||
        std::string_view(first) != kStatusInterface ||
        sd_bus_message_enter_container(message, 'a', "{sv}") < 0) {
        return 0;
    }
    nlohmann::json values = nlohmann::json::object();
    while (sd_bus_message_enter_container(message, 'e', "sv") > 0 &&
           sd_bus_message_read(message, "s", &first) >= 0 &&
           sd_bus_message_peek_type(message, nullptr, &second) >= 0) {
        int flag = 0;
        std::uint64_t number = 0;
        const std::string_view type(second);
        values[first] = type == "s" && sd_bus_message_read(message, "v", "s", &second) >= 0
                            ? nlohmann::json(second)
                        : type == "b" && sd_bus_message_read(message, "v", "b", &flag) >= 0
                            ? nlohmann::json(flag != 0)
                        : type == "t" && sd_bus_message_read(message, "v", "t", &number) >= 0
                            ? nlohmann::json(number)
                            : nlohmann::json("(undocumented type)");
        sd_bus_message_exit_container(message);
    }
    signals.push_back({{"changed", values}});
    return 0;
}

std::optional<nlohmann::json> BusWatcher::takeStatusSignal(bool checkFinished) {
    const char* kind = checkFinished ? "finished" : "changed";
    while (statusTaken_ < statusSignals_.size()) {
        const nlohmann::json& signal = statusSignals_[statusTaken_++];
        if (signal.contains(kind)) {
            return signal[kind];
        }
    }
    return std::nullopt;
}

std::optional<nlohmann::json> BusWatcher::waitForStatus(const nlohmann::json& expected,
                                                        std::chrono::milliseconds timeout) {
    nlohmann::json announced = nlohmann::json::object();
    auto complete = [&] {
        for (const auto& [name, value] : expected.items()) {
            if (!announced.contains(name) || announced[name] != value) {
                return false;
            }
        }
        return true;
    };
    // One signal at a time, so that what follows the last one expected stays to be taken.
    const bool all = waitUntil(
        [&] {
            std::optional<nlohmann::json> changed;
            while (!complete() && (changed = takeStatusSignal(false))) {
                announced.update(*changed);
            }
            return complete();
        },
        timeout);
    if (!all) {
        ADD_FAILURE() << "announced " << announced.dump() << ", expected " << expected.dump();
        return std::nullopt;
    }
    return announced;
}

std::optional<nlohmann::json> BusWatcher::nextCheckFinished(std::chrono::milliseconds timeout) {
    std::optional<nlohmann::json> finished;
    waitUntil([&] { return (finished = takeStatusSignal(true)).has_value(); }, timeout);
    return finished;
}

void BusFixture::SetUp() {
    bus_ = std::make_unique<test::PrivateBus>(
        test::ActivatedDaemon{TAVRIX_DAEMON_PATH, device_.root(), device_.runtimeDirectory(),
                              idleExitSeconds, daemonLaunchPrefix},
        policyFile);
    watcher_ = std::make_unique<BusWatcher>(bus_->address());
}

void BusFixture::TearDown() {
    if (bus_ == nullptr) {
        return;
    }
    // SIGTERM to every daemon still running; each must leave with status 0.
    std::set<pid_t> running;
    for (const test::DaemonLaunch& launch : bus_->launches()) {
        if (!launch.exitStatus) {
            running.insert(launch.pid);
            ::kill(launch.pid, SIGTERM);
        }
    }
    for (pid_t pid : running) {
        if (!waitForDaemonExit(pid)) {
            ADD_FAILURE() << "daemon " << pid << " did not leave after SIGTERM";
            ::kill(pid, SIGKILL);
        }
    }
    for (const test::DaemonLaunch& launch : bus_->launches()) {
        EXPECT_TRUE(killed_.contains(launch.pid) || launch.exitStatus == 0)
            << "daemon " << launch.pid << " exited with " << launch.exitStatus.value_or(-1);
    }
    if (HasFailure()) {
        std::cerr << "----- daemon log -----\n" << bus_->log() << "----- end of daemon log -----\n";
    }
}

std::optional<pid_t> BusFixture::daemonPid() {
    sd_bus_creds* creds = nullptr;
    pid_t pid = 0;
    const bool known =
        sd_bus_get_name_creds(watcher_->bus(), kDaemonBusName, SD_BUS_CREDS_PID, &creds) >= 0 &&
        sd_bus_creds_get_pid(creds, &pid) >= 0;
    sd_bus_creds_unref(creds);
    return known ? std::optional(pid) : std::nullopt;
}

std::optional<pid_t> BusFixture::stopDaemon(std::chrono::milliseconds timeout) {
    const std::optional<pid_t> pid = daemonPid();
    const bool left = pid && ::kill(*pid, SIGTERM) == 0 && waitForDaemonExit(*pid, timeout) == 0;
    return left ? pid : std::nullopt;
}

std::string BusFixture::linkTarget(std::string_view absolutePath) const {
    std::error_code error;
    fs::path target = fs::read_symlink(at(absolutePath), error);
    return error ? std::string() : target.string();
}

std::string BusFixture::linkState() const {
    std::error_code error;
    const fs::path bundle = fs::canonical(at(kBundleLink), error);
    const std::string carrierFile =
        error ? std::string() : fs::canonical(at(kPreferencesLink), error).string();
    if (error || !fs::is_directory(bundle) || !fs::is_regular_file(carrierFile)) {
        return "links dangle";
    }
    return carrierFile.starts_with(bundle.string() + "/") ||
                   carrierFile.starts_with(at(kOverlayDirectory).string() + "/")
               ? "links agree"
               : "links disagree";
}

std::string BusFixture::linkedVersion() const {
    auto info = plist::readFile((at(kBundleLink) / "Info.plist").string());
    const plist::Value* version = info ? info->find("QZBundleVersion") : nullptr;
    return version != nullptr && version->asString() != nullptr ? *version->asString() : "";
}

std::vector<std::uint8_t> BusFixture::pack(const fs::path& directory,
                                           const std::vector<std::string>& options) const {
    const fs::path archive = directory.string() + ".archive";
    std::vector<std::string> argv = {"/usr/bin/bsdtar", "-c", "-f", archive.string()};
    argv.insert(argv.end(), options.begin(), options.end());
    argv.insert(argv.end(), {"-C", directory.string(), "."});
    CommandResult packed = runCommand(argv);
    EXPECT_EQ(packed.status, 0) << packed.output;
    const std::string bytes = test::readText(archive);
    return {bytes.begin(), bytes.end()};
}

fs::path BusFixture::writeVersionedBundle(const std::string& version, std::size_t bulkBytes) const {
    const fs::path directory = device_.base() / ("bundles/" + version + "/Default.bundle");
    writeBundle(directory, version, {{"CarrierName", "Bundle " + version}},
                {{"Resources/only-in-" + version + ".txt", version}});
    if (bulkBytes > 0) {
        test::writeText(directory / "Resources/bulk.bin",
                        test::randomBytes(bulkBytes, std::hash<std::string>()(version)));
    }
    return directory;
}

test::LocalHttpServer& BusFixture::catalogServer() {
    if (!catalogServer_) {
        const fs::path keys = device_.base() / "keys";
        fs::create_directories(keys);
        CommandResult made = runCommand({TAVRIX_CATALOG_TOOL, "keygen", (keys / "secret").string(),
                                         (keys / "public").string()});
        EXPECT_EQ(made.status, 0) << made.output;
        catalogServer_.emplace().serveDirectory("/updates/", site());
        std::string publicKey = test::readText(keys / "public");
        writeCatalogSettings({{"PublicKey", publicKey.substr(0, publicKey.find('\n'))}});
    }
    return *catalogServer_;
}

std::string BusFixture::publishSigned(const fs::path& bundle) {
    catalogServer();
    CommandResult run =
        runCommand({TAVRIX_CATALOG_TOOL, "publish", site().string(), "--key",
                    (device_.base() / "keys/secret").string(), "--fresh", bundle.string()});
    EXPECT_EQ(run.status, 0) << run.output;
    auto catalog = plist::readFile((site() / "catalog.plist").string());
    const plist::Value* assets = catalog ? catalog->find("Assets") : nullptr;
    return assets != nullptr && !assets->asArray()->empty()
               ? "/updates/" + *assets->asArray()->front().find("ArchiveURL")->asString()
               : "(not listed)";
}

void BusFixture::writeCatalogSettings(plist::Dictionary typeSettings) {
    typeSettings.insert_or_assign("CatalogURL", catalogServer().url("/updates/catalog.plist"));
    const plist::Dictionary types{{"com.zandor.Grellas.TavrixBundles", std::move(typeSettings)}};
    EXPECT_TRUE(plist::writeFile(at("/etc/tavrix/AssetCatalog.plist").string(),
                                 plist::Value(plist::Dictionary{{"AssetTypes", types}})));
}

void BusFixture::holdPublished(const std::string& urlPath, double part) {
    test::LocalHttpServer::Response held;
    held.body = test::readText(site() / urlPath.substr(std::string("/updates/").size()));
    held.holdAfterBodyBytes =
        static_cast<std::size_t>(static_cast<double>(held.body.size()) * part);
    catalogServer().serve(urlPath, held);
}

bool BusFixture::killDaemon(pid_t pid) {
    killed_.insert(pid);
    return ::kill(pid, SIGKILL) == 0 && waitForDaemonExit(pid).has_value();
}

std::vector<std::string> BusFixture::daemonLogLines() const {
    std::vector<std::string> lines;
    std::istringstream in(bus_->log());
    for (std::string line; std::getline(in, line);) {
        lines.push_back(std::move(line));
    }
    return lines;
}

int BusFixture::countLogLines(const std::string& text, bool whole) const {
    const auto lines = daemonLogLines();
    return static_cast<int>(std::count_if(lines.begin(), lines.end(), [&](const std::string& line) {
        return whole ? line == text : line.find(text) != std::string::npos;
    }));
}

bool BusFixture::waitForLogLine(const std::string& line, std::chrono::milliseconds timeout,
                                int count) const {
    return pollUntil([&] { return countLogLines(line) >= count; }, timeout);
}

std::optional<int> BusFixture::waitForDaemonExit(pid_t pid,
                                                 std::chrono::milliseconds timeout) const {
    std::optional<int> status;
    pollUntil(
        [&] {
            for (const test::DaemonLaunch& launch : bus_->launches()) {
                status = launch.pid == pid ? launch.exitStatus : status;
            }
            return status.has_value();
        },
        timeout);
    return status;
}

}  // namespace tavrix::integration
