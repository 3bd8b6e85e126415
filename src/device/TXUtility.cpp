#include "device/TXUtility.h"

#include <langinfo.h>
#include <locale.h>
#include <sys/stat.h>
#include <sys/statfs.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <type_traits>

#include "device/DeviceInfoService.h"
#include "device/UserDatabase.h"
#include "util/Log.h"
#include "util/SharedInstance.h"

namespace tavrix {
namespace {

bool gIsDaemon = false;

struct LocaleFree {
    void operator()(locale_t locale) const { ::freelocale(locale); }
};
using LocaleHandle = std::unique_ptr<std::remove_pointer_t<locale_t>, LocaleFree>;

// The locale's time of day without its seconds: the short time style. Its time format may name
// the 12-hour or the 24-hour form by a conversion of its own.
std::string shortTimeFormat(locale_t locale) {
    std::string format = ::nl_langinfo_l(T_FMT, locale);
    if (format == "%r") {
        format = ::nl_langinfo_l(T_FMT_AMPM, locale);
    } else if (format == "%T") {
        format = "%H:%M:%S";
    }
    for (const char* seconds : {":%S", ".%S", "%S"}) {
        if (auto at = format.find(seconds); at != std::string::npos) {
            format.erase(at, std::strlen(seconds));
            break;
        }
    }
    return format;
}

std::optional<std::string> homeDirectory() {
    const char* home = std::getenv("HOME");
    if (home != nullptr && *home != '\0') {
        return std::string(home);
    }
    std::optional<device::UserRecord> user = device::lookupSystemUser(::geteuid());
    if (!user || user->homeDirectory.empty()) {
        return std::nullopt;
    }
    return std::move(user->homeDirectory);
}

// The answer for key, asked the first time and kept by the root for the rest of its life.
const std::optional<std::string>& stringFact(std::string_view key) {
    auto& facts = SharedInstance<TXUtility::StringFacts>::current().instance(
        [] { return std::make_unique<TXUtility::StringFacts>(); });
    std::lock_guard lock(facts.mutex);
    auto found = facts.answers.find(key);
    if (found == facts.answers.end()) {
        found = facts.answers.emplace(std::string(key), device::copyDeviceStringAnswer(key)).first;
    }
    return found->second;
}

}  // namespace

TXUtility::TaskQueue& TXUtility::taskQueue() {
    return SharedInstance<TaskQueue>::current().instance(
        [] { return std::make_unique<TaskQueue>(); });
}

void TXUtility::setIsDaemon(bool isDaemon) {
    gIsDaemon = isDaemon;
}

bool TXUtility::isDaemon() {
    return gIsDaemon;
}

bool TXUtility::isWiFiCapable() {
    return device::deviceBooleanAnswer("wi-fi");
}

bool TXUtility::hasCellularRadio() {
    return device::deviceBooleanAnswer("contains-cellular-radio");
}

const std::optional<std::string>& TXUtility::serialNumber() {
    return stringFact("SerialNumber");
}

const std::optional<std::string>& TXUtility::currentProductCategory() {
    return stringFact("DeviceClass");
}

const std::optional<std::string>& TXUtility::currentProductType() {
    return stringFact("ProductType");
}

const std::optional<std::string>& TXUtility::currentProductVersion() {
    return stringFact("ProductVersion");
}

const std::optional<std::string>& TXUtility::currentProductBuild() {
    return stringFact("BuildVersion");
}

const std::optional<std::string>& TXUtility::currentReleaseType() {
    return stringFact("ReleaseType");
}

const std::optional<std::string>& TXUtility::currentHardwareModel() {
    return stringFact("HWModelStr");
}

bool TXUtility::freeSpaceExceeds(std::uint64_t blockSize, std::uint64_t freeBlocks,
                                 std::uint64_t bytes) {
    std::uint64_t freeBytes = 0;
    if (__builtin_mul_overflow(blockSize, freeBlocks, &freeBytes)) {
        return true;
    }
    return freeBytes > bytes;
}

bool TXUtility::hasEnoughDiskSpace(std::uint64_t bytes) {
    auto home = homeDirectory();
    return home && hasEnoughDiskSpaceAt(*home, bytes);
}

bool TXUtility::hasEnoughDiskSpaceAt(const std::string& path, std::uint64_t bytes) {
    struct statfs info {};
    if (::statfs(path.c_str(), &info) != 0) {
        return false;
    }
    // The block counts are in units of the fragment size, which is the block size on nearly every
    // file system; older kernels leave it zero.
    auto unit = static_cast<std::uint64_t>(info.f_frsize > 0 ? info.f_frsize : info.f_bsize);
    return freeSpaceExceeds(unit, static_cast<std::uint64_t>(info.f_bfree), bytes);
}

std::optional<std::string> TXUtility::URLIfFileExists(const std::string& path) {
    struct stat info {};
    if (path.empty() || ::stat(path.c_str(), &info) != 0) {
        return std::nullopt;
    }
    return path;
}

GregorianCalendar TXUtility::gregorianCalendar() {
    return GregorianCalendar();
}

std::optional<plist::Date> TXUtility::addToDate(plist::Date date, long numberOfDays) {
    auto result = gregorianCalendar().addingDays(date, numberOfDays);
    if (!result) {
        logCFormat(LogPriority::Warning,
                   "addToDate:numberOfDays: unable to add %ld days to date: %f", numberOfDays,
                   date.secondsSinceReferenceDate);
    }
    return result;
}

std::string TXUtility::prettyPrintDate(plist::Date date) {
    // The environment's time locale (LC_ALL, LC_TIME, LANG), whatever the process's own is.
    LocaleHandle locale(::newlocale(LC_TIME_MASK, "", locale_t{}));
    if (!locale) {
        locale.reset(::newlocale(LC_TIME_MASK, "C", locale_t{}));
    }
    const std::string format = std::string("%x ") + shortTimeFormat(locale.get());
    // Still something readable for a log line when the date has no local time.
    return gregorianCalendar()
        .localText(date, format.c_str(), locale.get())
        .value_or(std::to_string(date.secondsSinceReferenceDate));
}

std::optional<std::string> TXUtility::runStateName(int runState) {
    switch (runState) {
        case 1:
            return "Foreground";
        case 0:
            return "Background";
        default:
            return std::nullopt;
    }
}

}  // namespace tavrix
