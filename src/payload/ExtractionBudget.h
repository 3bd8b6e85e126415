// Keeps one extraction within its ExtractionLimits: counts entries and the bytes they expand to,
// and watches the destination's free space as they are written.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_set>

#include "base/Result.h"
#include "payload/PayloadUnpack.h"

namespace tavrix::payload {

class ExtractionBudget {
  public:
    ExtractionBudget(const ExtractionLimits& limits, std::string destination);

    // Before an entry is written: counts it, with the parent directories its path implies that no
    // entry before it implied, and makes room for the size it declares. Each fails with why the
    // extraction must stop.
    Result<> admitEntry(std::string_view path, std::uint64_t declaredSize);
    // After a block: the current entry now reaches extent bytes (its end, holes included).
    Result<> noteExtent(std::uint64_t extent);
    // When the extraction is over: the room for its copy, when asked for, is still there.
    Result<> checkFinalRoom();

  private:
    Result<> checkFreeSpace(std::uint64_t stillToWrite);

    // The free space kept: the limits' reserve, less on a small file system.
    std::uint64_t reserve();

    const ExtractionLimits limits_;
    std::optional<std::uint64_t> reserve_;
    const std::string destination_;
    std::uint64_t entries_ = 0;
    // Hashes of the parent directories implied so far; a collision only undercounts by one.
    std::unordered_set<std::size_t> impliedDirectories_;
    // Bytes of the entries before the current one, and the current one's extent.
    std::uint64_t finishedBytes_ = 0;
    std::uint64_t entryExtent_ = 0;
    std::uint64_t uncheckedBytes_ = 0;
};

}  // namespace tavrix::payload
