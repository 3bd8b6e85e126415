#include "bus/ServiceManager.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <string_view>

#include "device/PlatformRoot.h"
#include "io/AtomicFile.h"
#include "io/FileIO.h"
#include "io/UniqueFd.h"
#include "util/Log.h"
#include "util/SharedInstance.h"

namespace tavrix::bus {
namespace {

constexpr std::chrono::seconds kDefaultIdleGrace{30};

std::chrono::milliseconds idleGraceFromEnvironment() {
    const char* configured = std::getenv("TAVRIX_IDLE_EXIT_SEC");
    if (configured == nullptr || *configured == '\0') {
        return kDefaultIdleGrace;
    }
    char* end = nullptr;
    double seconds = std::strtod(configured, &end);
    if (end == configured || *end != '\0' || !(seconds >= 0) || seconds > 86400) {
        return kDefaultIdleGrace;
    }
    return std::chrono::milliseconds(static_cast<long long>(seconds * 1000));
}

std::string runtimeDirectoryFromEnvironment() {
    // systemd may list several directories separated by ':'; the first is ours.
    const char* configured = std::getenv("RUNTIME_DIRECTORY");
    if (configured != nullptr && *configured != '\0') {
        std::string_view value(configured);
        return std::string(value.substr(0, value.find(':')));
    }
    return device::resolvePath("/run/tavrixservicesd");
}

std::int64_t ticksNow() {
    return std::chrono::steady_clock::now().time_since_epoch().count();
}

}  // namespace

ServiceManager& ServiceManager::shared() {
    return SharedInstance<ServiceManager>::current().instance(
        [] { return std::unique_ptr<ServiceManager>(new ServiceManager()); });
}

ServiceManager::ServiceManager()
    : runtimeDirectory_(runtimeDirectoryFromEnvironment()),
      keepAlivePath_(runtimeDirectory_ + "/keep-alive"),
      idleGrace_(idleGraceFromEnvironment()),
      lastActivityTicks_(ticksNow()),
      wake_(io::WakeEvent::create()) {}

void ServiceManager::openTransaction() {
    openTransactions_.fetch_add(1);
    noteActivity();
}

void ServiceManager::closeTransaction() {
    if (openTransactions_.fetch_sub(1) <= 0) {
        openTransactions_.fetch_add(1);  // never below zero, whatever the callers do
    }
    noteActivity();
    wake();
}

Result<std::int64_t> ServiceManager::readKeepAlive() const {
    std::lock_guard lock(keepAliveMutex_);
    io::UniqueFd fd(::open(keepAlivePath_.c_str(), O_RDONLY | O_CLOEXEC));
    if (!fd) {
        if (errno == ENOENT) {
            return std::int64_t{0};
        }
        return Failure{"cannot open " + keepAlivePath_, errno};
    }
    std::string text;
    if (int error = io::readAll(fd.get(), text, 31); error != 0) {
        return Failure{"cannot read " + keepAlivePath_, error};
    }
    char* end = nullptr;
    long long parsed = std::strtoll(text.c_str(), &end, 10);
    if (end == text.c_str()) {
        return Failure{keepAlivePath_ + " holds no number"};
    }
    return std::int64_t{parsed};
}

bool ServiceManager::writeKeepAlive(std::int64_t value) {
    std::lock_guard lock(keepAliveMutex_);
    std::error_code error;
    std::filesystem::create_directories(runtimeDirectory_, error);
    if (error) {
        return false;
    }
    if (io::replaceFileAtomically(keepAlivePath_, std::to_string(value) + "\n", 0644) != 0) {
        return false;
    }
    noteActivity();
    wake();
    return true;
}

bool ServiceManager::isIdle() const {
    if (openTransactions_.load() > 0) {
        return false;
    }
    // A flag that cannot be read counts as set: better to stay than to leave work behind.
    return readKeepAlive() == std::int64_t{0};
}

void ServiceManager::noteActivity() {
    lastActivityTicks_.store(ticksNow());
}

std::chrono::steady_clock::time_point ServiceManager::lastActivity() const {
    return std::chrono::steady_clock::time_point(
        std::chrono::steady_clock::duration(lastActivityTicks_.load()));
}

ServiceManager::InstanceLock ServiceManager::tryLockInstance() {
    if (instanceLockHeld_) {
        return InstanceLock::Held;
    }
    const std::string path = runtimeDirectory_ + "/instance.lock";
    if (!instanceLockFd_) {
        std::error_code error;
        std::filesystem::create_directories(runtimeDirectory_, error);
        // No link is followed and the file is checked once open, so that nobody else's file can
        // stand in for the lock (and be truncated, or be held by its owner forever).
        io::UniqueFd fd(
            ::open(path.c_str(), O_RDWR | O_CREAT | O_NOFOLLOW | O_CLOEXEC | O_NOCTTY, 0600));
        if (!fd) {
            logCFormat(LogPriority::Warning, "Cannot open the instance lock %s: %s\n", path.c_str(),
                       std::strerror(errno));
            return InstanceLock::Unusable;
        }
        struct stat info {};
        if (::fstat(fd.get(), &info) != 0 || !S_ISREG(info.st_mode) || info.st_uid != ::geteuid()) {
            logCFormat("The instance lock %s is not a file of this daemon's user\n", path.c_str());
            return InstanceLock::Unusable;
        }
        instanceLockFd_ = std::move(fd);
    }
    if (::flock(instanceLockFd_.get(), LOCK_EX | LOCK_NB) == 0) {
        instanceLockHeld_ = true;
        return InstanceLock::Held;
    }
    if (errno == EWOULDBLOCK || errno == EINTR) {
        return InstanceLock::HeldByAnother;
    }
    // Retried while waiting: said once.
    if (!instanceLockFailureLogged_) {
        logCFormat(LogPriority::Warning, "Cannot lock %s: %s\n", path.c_str(),
                   std::strerror(errno));
        instanceLockFailureLogged_ = true;
    }
    return InstanceLock::Unusable;
}

void ServiceManager::notifyReady(const std::string& status) {
    sd_notifyf(0, "READY=1\nSTATUS=%s", status.c_str());
}

void ServiceManager::notifyStatus(const std::string& status) {
    sd_notifyf(0, "STATUS=%s", status.c_str());
}

void ServiceManager::notifyStopping() {
    sd_notify(0, "STOPPING=1\nSTATUS=Leaving");
}

}  // namespace tavrix::bus
