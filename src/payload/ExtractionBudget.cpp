#include "payload/ExtractionBudget.h"

#include <algorithm>

#include "util/FileSystemUtilities.h"

namespace tavrix::payload {
namespace {

// Free space is looked at again after this much data, so a single large entry cannot run the file
// system past the reserve between two entries.
constexpr std::uint64_t kFreeSpaceCheckInterval = 1u << 20;

std::uint64_t saturatingAdd(std::uint64_t a, std::uint64_t b) {
    std::uint64_t sum = 0;
    return __builtin_add_overflow(a, b, &sum) ? UINT64_MAX : sum;
}

}  // namespace

ExtractionBudget::ExtractionBudget(const ExtractionLimits& limits, std::string destination)
    : limits_(limits), destination_(std::move(destination)) {}

Result<> ExtractionBudget::admitEntry(std::string_view path, std::uint64_t declaredSize) {
    finishedBytes_ = saturatingAdd(finishedBytes_, entryExtent_);
    entryExtent_ = 0;
    // The disk writer creates missing parents on its own: one entry with a deep path would
    // otherwise make thousands of directories for the price of one.
    std::uint64_t created = 1;
    for (std::size_t slash = path.find('/', 1); slash != std::string_view::npos;
         slash = path.find('/', slash + 1)) {
        if (entries_ + created > limits_.maxEntries) {
            break;
        }
        created +=
            impliedDirectories_.insert(std::hash<std::string_view>()(path.substr(0, slash))).second
                ? 1
                : 0;
    }
    entries_ += created;
    if (entries_ > limits_.maxEntries) {
        return Failure{"it holds more than " + std::to_string(limits_.maxEntries) +
                       " entries (with the directories their paths imply)"};
    }
    if (saturatingAdd(finishedBytes_, declaredSize) > limits_.maxExpandedBytes) {
        return Failure{"it expands to more than " + std::to_string(limits_.maxExpandedBytes) +
                       " bytes"};
    }
    uncheckedBytes_ = 0;
    return checkFreeSpace(declaredSize);
}

Result<> ExtractionBudget::noteExtent(std::uint64_t extent) {
    if (extent <= entryExtent_) {
        return {};
    }
    uncheckedBytes_ += extent - entryExtent_;
    entryExtent_ = extent;
    if (saturatingAdd(finishedBytes_, entryExtent_) > limits_.maxExpandedBytes) {
        return Failure{"it expands to more than " + std::to_string(limits_.maxExpandedBytes) +
                       " bytes"};
    }
    if (uncheckedBytes_ < kFreeSpaceCheckInterval) {
        return {};
    }
    uncheckedBytes_ = 0;
    return checkFreeSpace(0);
}

std::uint64_t ExtractionBudget::reserve() {
    if (!reserve_) {
        std::optional<std::uint64_t> capacity =
            limits_.reserveShare != 0 ? capacityBytesAt(destination_) : std::nullopt;
        reserve_ = capacity ? std::min(limits_.freeSpaceReserve, *capacity / limits_.reserveShare)
                            : limits_.freeSpaceReserve;
    }
    return *reserve_;
}

Result<> ExtractionBudget::checkFinalRoom() {
    return checkFreeSpace(0);
}

Result<> ExtractionBudget::checkFreeSpace(std::uint64_t stillToWrite) {
    std::uint64_t needed = saturatingAdd(reserve(), stillToWrite);
    if (limits_.keepRoomForCopy) {
        std::uint64_t expanded = saturatingAdd(finishedBytes_, entryExtent_);
        needed = saturatingAdd(needed, saturatingAdd(expanded, stillToWrite));
    }
    std::optional<std::uint64_t> available = availableBytesAt(destination_);
    if (!available) {
        return Failure{"the free space of " + destination_ + " cannot be read"};
    }
    if (*available < needed) {
        return Failure{"the file system of " + destination_ + " has " + std::to_string(*available) +
                       " bytes free, " + std::to_string(needed) + " are needed"};
    }
    return {};
}

}  // namespace tavrix::payload
