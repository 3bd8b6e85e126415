// Turning a received bundle payload into files: the staged archive file and its extraction.
// BundleManager::installBehaviorBundleData (bundle/BundleInstall.cpp) drives them.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "base/Result.h"
#include "io/Directory.h"
#include "io/UniqueFd.h"
#include "plist/Value.h"

namespace tavrix::payload {

// Where a payload is staged before extraction (under the platform root); one payload at a time.
inline constexpr const char* kBundleArchiveTempPath = "/tmp/behaviorbundle_zipped.tgz";

// Where a new bundle (an extracted payload, a copied download) is assembled before it takes the
// bundle directory's place: beside it, so that the final rename stays on one file system.
std::string extractionStagingPathFor(const std::string& bundleDirectory);

// A payload staged at its fixed path by this process: the file it wrote, held open for reading,
// so that what is unpacked is what was written whatever appears at the path meanwhile. Removed
// when the object goes, if the path still names it.
class StagedPayload {
  public:
    StagedPayload(io::Directory directory, std::string name, io::UniqueFd file);
    ~StagedPayload();
    StagedPayload(StagedPayload&&) = default;
    StagedPayload& operator=(StagedPayload&&) = delete;

    int fd() const { return file_.get(); }

  private:
    io::Directory directory_;
    std::string name_;
    io::UniqueFd file_;
};

// Writes the bytes to path (whose directory others may write in, like /tmp) whole, as a file
// created where nothing is: what is at path already is removed first only when it is this
// process's own, and anything else there refuses the payload. Logs the outcome.
Result<StagedPayload> stagePayload(const plist::Data& data, const std::string& path);

// How entry paths are trusted. A client's own bundle payload is written where its entries point;
// archives from the network hold only what stays inside the destination.
enum class ExtractionSafety { AsArchived, PathSafe };

// What one extraction may cost. Bytes count what the entries expand to (a sparse entry counts to
// its end), not what the archive weighs, so a small compressed bomb is stopped as it unpacks.
struct ExtractionLimits {
    std::uint64_t maxExpandedBytes = 0;
    std::uint64_t maxEntries = 0;
    // Free space the destination's file system keeps after every write.
    std::uint64_t freeSpaceReserve = 0;
    // The extracted tree is copied elsewhere afterwards: keep room for that copy as well.
    bool keepRoomForCopy = false;
    // When not 0, the reserve is at most this fraction (1/share) of the file system, so that a
    // small one is not refused everything by a reserve it cannot even hold.
    std::uint64_t reserveShare = 0;
};

// A real bundle is a few hundred files and a few megabytes; these leave ample headroom while a
// payload can no longer fill the disk the daemon shares with the rest of the system.
inline constexpr std::uint64_t kPayloadMaxExpandedBytes = 256ull << 20;
inline constexpr std::uint64_t kPayloadMaxEntries = 20000;
inline constexpr std::uint64_t kPayloadFreeSpaceReserve = 64ull << 20;
inline constexpr std::uint64_t kPayloadReserveShare = 16;
inline constexpr ExtractionLimits kClientPayloadLimits{kPayloadMaxExpandedBytes, kPayloadMaxEntries,
                                                       kPayloadFreeSpaceReserve, false,
                                                       kPayloadReserveShare};

// Extracts a gzip- or compress-compressed tar or cpio archive file into destinationDirectory
// (created when missing), restoring permissions, times, ACLs and file flags but not owners.
// Relative entry paths land below destinationDirectory.
// AsArchived writes absolute and ".." paths where they point. PathSafe takes only regular files,
// directories and symbolic links whose target stays inside the destination, all below it, never
// written through a link; any other entry (hard link, device, FIFO, socket, escaping path or link)
// stops the extraction, logged. File flags are not restored in PathSafe.
// Either way, going past a limit stops the extraction; what was written stays.
// True when the archive was read to its end with nothing refused or cut short; false otherwise,
// with one line saying why: logged, or put in whyNot when given (for a caller that reports it as
// part of its own failure). archivePath names a file; standard input is never read. Never
// changes the working directory.
bool extractArchive(const std::string& archivePath, const std::string& destinationDirectory,
                    ExtractionSafety safety = ExtractionSafety::AsArchived,
                    const ExtractionLimits& limits = kClientPayloadLimits,
                    std::string* whyNot = nullptr);
// How an extraction ended: read to its end, stopped by a damaged or refused archive, or stopped
// at a limit (size, entries, free space) before it filled the disk.
enum class ExtractionOutcome { Complete, Damaged, OverLimit };

// The same for the archive open at archiveFd (read from its current offset), answering how it
// ended; archivePath names it in messages. placedAs, when given, is the directory the extracted
// tree becomes once renamed: entries land as if extracted there, and those that would land inside
// it land at the same place below destinationDirectory.
ExtractionOutcome extractArchive(int archiveFd, const std::string& archivePath,
                                 const std::string& destinationDirectory, ExtractionSafety safety,
                                 const ExtractionLimits& limits, std::string* whyNot,
                                 const std::string& placedAs = std::string());

}  // namespace tavrix::payload
