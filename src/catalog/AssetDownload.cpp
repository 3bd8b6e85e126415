#include "catalog/AssetDownload.h"

#include <fcntl.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <vector>

#include "catalog/AssetCatalog.h"
#include "catalog/AssetCatalogService.h"
#include "catalog/CatalogCrypto.h"
#include "http/HttpTransfer.h"
#include "io/Directory.h"
#include "io/FileIO.h"
#include "io/Paths.h"
#include "io/Random.h"
#include "io/UniqueFd.h"
#include "payload/PayloadUnpack.h"
#include "util/FileSystemUtilities.h"
#include "util/Log.h"

namespace tavrix::catalog {
namespace {

constexpr const char* kStagedArchiveSuffix = ".download";
constexpr const char* kStagedExtractionSuffix = ".extracting";

// Downloading reports come at each further quarter of the archive, not for every chunk.
constexpr std::uint64_t kDownloadReportSteps = 4;

// Removes a staging file or directory when the step that made it is over.
class StagedPath {
  public:
    explicit StagedPath(std::string path) : path_(std::move(path)) { removeItemTree(path_); }
    ~StagedPath() { removeItemTree(path_); }
    StagedPath(const StagedPath&) = delete;
    StagedPath& operator=(const StagedPath&) = delete;

    const std::string& path() const { return path_; }

  private:
    std::string path_;
};

Failure errnoFailure(const char* action, const std::string& path, int error) {
    return {std::string("cannot ") + action + " " + path + ": " + std::strerror(error)};
}

AssetProgress byteProgress(const char* operation, std::uint64_t written, std::uint64_t total) {
    AssetProgress report(operation);
    report.bytesWritten = written;
    report.totalBytes = total;
    return report;
}

// Streams the archive into fd, hashing it on the way.
Result<> downloadArchive(const CatalogEntry& entry, int fd, const AssetLimits& limits,
                         const AssetProgressReporter& report) {
    Sha256Digest digest;
    std::uint64_t received = 0;
    const std::uint64_t step = std::max<std::uint64_t>(entry.archiveSize / kDownloadReportSteps, 1);
    std::uint64_t nextReport = step;
    http::HttpBodyReceiver receiver = [&](std::string_view bytes) -> Result<> {
        // The daemon ends after the transactions it waits for: a download still running then
        // fails, and the next launch checks again.
        if (AssetCatalogService::shared().stopping()) {
            return Failure{"the daemon is stopping"};
        }
        if (bytes.size() > entry.archiveSize - received) {
            return Failure{"the server sent more than the catalog's " +
                           std::to_string(entry.archiveSize) + " bytes"};
        }
        if (int error = io::writeAll(fd, bytes); error != 0) {
            return Failure{std::string("cannot write the archive: ") + std::strerror(error)};
        }
        digest.update(bytes);
        received += bytes.size();
        if (received >= nextReport) {
            report(byteProgress(kAssetOperationDownloading, received, entry.archiveSize));
            nextReport = (received / step + 1) * step;
        }
        return {};
    };
    if (Result<> transferred =
            http::transferHttpBody(entry.archiveURL, receiver, limits.archiveTransfer());
        !transferred) {
        return Failure{"cannot download " + entry.archiveURL + ": " + transferred.reason()};
    }
    if (received != entry.archiveSize) {
        return Failure{"the archive is " + std::to_string(received) + " bytes, the catalog says " +
                       std::to_string(entry.archiveSize)};
    }
    std::string actual = digest.finishHex();
    if (actual != entry.archiveSHA256) {
        return Failure{"the archive's SHA-256 is " + actual + ", the catalog says " +
                       entry.archiveSHA256};
    }
    return {};
}

payload::ExtractionLimits extractionLimits(const AssetLimits& limits) {
    return {limits.maxExpandedBytes, limits.maxArchiveEntries, limits.freeSpaceReserveBytes, true};
}

}  // namespace

namespace {

bool isHexText(std::string_view text, std::size_t length) {
    return text.size() == length &&
           text.find_first_not_of("0123456789abcdef") == std::string_view::npos;
}

// "<archive SHA-256>-<random suffix>", the name every download's directory gets.
bool isDownloadName(std::string_view name) {
    return name.size() == 64 + 1 + 16 && name[64] == '-' && isHexText(name.substr(0, 64), 64) &&
           isHexText(name.substr(65), 16);
}

}  // namespace

void removeAbandonedDownloads(const std::string& typeCacheDirectory, bool completedToo) {
    std::vector<std::string> names;
    if (readDirectoryNames(typeCacheDirectory, names) != 0) {
        return;
    }
    for (const std::string& name : names) {
        bool staging = name.starts_with(".") && (name.ends_with(kStagedArchiveSuffix) ||
                                                 name.ends_with(kStagedExtractionSuffix));
        if (staging || (completedToo && isDownloadName(name))) {
            logCFormat("Asset catalog: removing the abandoned download %s\n", name.c_str());
            removeItemTree(typeCacheDirectory + "/" + name);
        }
    }
}

AssetCacheLocation AssetCacheLocation::forDownload(const std::string& typeCacheDirectory,
                                                   const CatalogEntry& entry) {
    std::string name = entry.archiveSHA256 + "-" + io::uniqueHexSuffix();
    std::string base = typeCacheDirectory + "/";
    return {base + name, base + "." + name + kStagedArchiveSuffix,
            base + "." + name + kStagedExtractionSuffix};
}

Result<> downloadAndInstallAsset(const CatalogEntry& entry, const AssetCacheLocation& location,
                                 const AssetLimits& limits, const AssetProgressReporter& report) {
    report(byteProgress(kAssetOperationStarted, 0, entry.archiveSize));
    std::string cacheDirectory = io::parentDirectory(location.directory);
    if (int error = createDirectoryAt(cacheDirectory, 0755, true)) {
        return errnoFailure("create", cacheDirectory, error);
    }
    removeAbandonedDownloads(cacheDirectory, /*completedToo=*/false);
    StagedPath archive(location.archiveFile);
    {
        io::UniqueFd fd =
            io::openFile(archive.path(), O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW, 0600);
        if (!fd) {
            return errnoFailure("create", archive.path(), errno);
        }
        if (Result<> downloaded = downloadArchive(entry, fd.get(), limits, report); !downloaded) {
            return downloaded;
        }
    }
    report(AssetProgress(kAssetOperationInstalling));
    StagedPath extraction(location.extractionDirectory);
    // The installer copies the extracted tree next: the extraction keeps room for that copy.
    std::string whyNot;
    if (!payload::extractArchive(archive.path(), extraction.path(),
                                 payload::ExtractionSafety::PathSafe, extractionLimits(limits),
                                 &whyNot)) {
        return Failure{whyNot};
    }
    // A resumed install copies from here, so the tree is on the disk before it takes its name.
    int error = 0;
    auto cache = io::Directory::open(cacheDirectory, io::Directory::LastLink::Follow, &error);
    if (!cache) {
        return errnoFailure("open", cacheDirectory, error);
    }
    if ((error = cache->flushTree(io::lastPathComponent(extraction.path()))) != 0) {
        return errnoFailure("flush", extraction.path(), error);
    }
    if ((error = cache->renameEntry(io::lastPathComponent(extraction.path()),
                                    io::lastPathComponent(location.directory))) != 0) {
        return errnoFailure("install into", location.directory, error);
    }
    return {};
}

bool AssetProgress::isFinal() const {
    return std::string_view(operation) == kAssetOperationCompleted ||
           std::string_view(operation) == kAssetOperationFailed;
}

plist::Dictionary AssetProgress::dictionary() const {
    plist::Dictionary report{{kAssetProgressOperationKey, plist::Value(operation)}};
    if (bytesWritten) {
        report.emplace(kAssetProgressBytesWrittenKey,
                       plist::Value(static_cast<long long>(*bytesWritten)));
    }
    if (totalBytes) {
        report.emplace(kAssetProgressTotalBytesKey,
                       plist::Value(static_cast<long long>(*totalBytes)));
    }
    if (!error.empty()) {
        report.emplace(kAssetProgressErrorKey, plist::Value(error));
    }
    return report;
}

}  // namespace tavrix::catalog
