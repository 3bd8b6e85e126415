// Answers about the device and small date, file and queue services, as class members only.
// Facts that cannot change while the process runs are asked once and kept for its life.
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <mutex>
#include <optional>
#include <string>

#include "plist/Value.h"
#include "util/GregorianCalendar.h"
#include "util/SerialQueue.h"

namespace tavrix {

class TXUtility {
  public:
    TXUtility() = delete;

    // The serial queue for the daemon's operations, created on first use.
    class TaskQueue : public SerialQueue {
      public:
        TaskQueue() : SerialQueue("com.zandor.tavrixservices.operationTaskQueue") {}
    };
    static TaskQueue& taskQueue();

    // Whether this process is the daemon; false until set. Set once at start-up, before any
    // other thread asks.
    static void setIsDaemon(bool isDaemon);
    static bool isDaemon();

    // Radio capabilities, asked anew on every call.
    static bool isWiFiCapable();
    static bool hasCellularRadio();

    // String facts, asked on the first call only. Nil when the answer is missing or not a string,
    // and then for the rest of the process's life.
    struct StringFacts {
        std::mutex mutex;
        std::map<std::string, std::optional<std::string>, std::less<>> answers;
    };
    static const std::optional<std::string>& serialNumber();
    static const std::optional<std::string>& currentProductCategory();
    static const std::optional<std::string>& currentProductType();
    static const std::optional<std::string>& currentProductVersion();
    static const std::optional<std::string>& currentProductBuild();
    static const std::optional<std::string>& currentReleaseType();
    static const std::optional<std::string>& currentHardwareModel();

    // True when the file system holding the home directory has more than bytes free (counting
    // the blocks reserved for privileged users); false when it cannot be asked.
    static bool hasEnoughDiskSpace(std::uint64_t bytes);
    // The same for the file system holding path.
    static bool hasEnoughDiskSpaceAt(const std::string& path, std::uint64_t bytes);
    // The rule behind hasEnoughDiskSpace: blockSize x freeBlocks strictly above bytes. A product
    // beyond 64 bits is more than any request.
    static bool freeSpaceExceeds(std::uint64_t blockSize, std::uint64_t freeBlocks,
                                 std::uint64_t bytes);

    // path when something exists there (symbolic links followed), else nothing.
    static std::optional<std::string> URLIfFileExists(const std::string& path);

    // A new calendar in the system time zone.
    static GregorianCalendar gregorianCalendar();

    // date moved by numberOfDays calendar days, or nothing (logged) when that is not possible.
    static std::optional<plist::Date> addToDate(plist::Date date, long numberOfDays);

    // date in local time as a short date and a short time in the current locale's style.
    static std::string prettyPrintDate(plist::Date date);

    // "Foreground" for 1, "Background" for 0, nothing for any other run state.
    static std::optional<std::string> runStateName(int runState);
};

}  // namespace tavrix
