// Turning a received bundle payload into files: the staged archive file and its extraction.
// BundleManager::installBehaviorBundleData (defined with these) drives them.
#pragma once

#include <string>

#include "plist/Value.h"

namespace tavrix::payload {

// Where a payload is staged before extraction (under the platform root); one payload at a time.
inline constexpr const char* kBundleArchiveTempPath = "/tmp/behaviorbundle_zipped.tgz";

// Writes the bytes to path atomically and logs the outcome. Always true: callers do not look.
bool writeDataToFile(const plist::Data& data, const std::string& path);

// How entry paths are trusted. A client's own bundle payload is written where its entries point;
// archives from the network are refused entries that would leave the destination.
enum class ExtractionSafety { AsArchived, PathSafe };

// Extracts a gzip- or compress-compressed tar or cpio archive into destinationDirectory (created
// when missing), restoring permissions, times, ACLs and file flags but not owners. True when the
// archive was read to its end; false when it could not be opened or a header could not be read.
// Never changes the process's working directory.
bool extractArchive(const std::string& archivePath, const std::string& destinationDirectory,
                    ExtractionSafety safety = ExtractionSafety::AsArchived);

}  // namespace tavrix::payload
