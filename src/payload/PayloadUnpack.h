// Turning a received bundle payload into files: the staged archive file and its extraction.
// BundleManager::installBehaviorBundleData (in PayloadUnpack.cpp) drives them.
#pragma once

#include <string>

#include "plist/Value.h"

namespace tavrix::payload {

// Where a payload is staged before extraction (under the platform root); one payload at a time.
inline constexpr const char* kBundleArchiveTempPath = "/tmp/behaviorbundle_zipped.tgz";

// Where a new bundle (an extracted payload, a copied download) is assembled before it takes the
// bundle directory's place: beside it, so that the final rename stays on one file system.
std::string extractionStagingPathFor(const std::string& bundleDirectory);

// Writes the bytes to path atomically and logs the outcome. Always true: callers do not look.
bool writeDataToFile(const plist::Data& data, const std::string& path);

// How entry paths are trusted. A client's own bundle payload is written where its entries point;
// archives from the network are refused entries that would leave the destination.
enum class ExtractionSafety { AsArchived, PathSafe };

// Extracts a gzip- or compress-compressed tar or cpio archive file into destinationDirectory
// (created when missing), restoring permissions, times, ACLs and file flags but not owners.
// Relative entry paths land below destinationDirectory. AsArchived writes absolute and ".." paths
// where they point; PathSafe refuses those entries (and hard links to such targets), and anything
// that would be written through a symbolic link, and extracts the rest.
// True when the archive was read to its end; false when it could not be opened or a header could
// not be read (entries before the damage stay extracted). archivePath names a file; standard input
// is never read. Never changes the process's working directory.
bool extractArchive(const std::string& archivePath, const std::string& destinationDirectory,
                    ExtractionSafety safety = ExtractionSafety::AsArchived);

}  // namespace tavrix::payload
