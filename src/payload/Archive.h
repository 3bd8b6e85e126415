// An in-memory writer of compressed tar archives (POSIX pax, restricted) made of whole files,
// with a cap on the total uncompressed size. Its output is a bundle payload that extractArchive
// unpacks.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "payload/ArchiveHandles.h"
#include "plist/Value.h"

namespace tavrix::payload {

inline constexpr int kArchiveTypeGzip = 1;
inline constexpr int kArchiveTypeBzip2 = 2;
inline constexpr std::uint32_t kDefaultMaxUncompressedSize = 10000000;

class Archive {
  public:
    // An empty archive compressed as archiveType that accepts files up to size bytes in total
    // (inclusive); zipFileName is kept as its identifier. Null for an unknown archive type or when
    // libarchive cannot set the writer up.
    static std::unique_ptr<Archive> initWithMaxUncompressedSize(std::uint32_t size, int archiveType,
                                                                const std::string& zipFileName);
    // The same with the default cap.
    static std::unique_ptr<Archive> initWithArchiveType(int archiveType,
                                                        const std::string& zipFileName);
    // The same, gzip-compressed.
    static std::unique_ptr<Archive> initWithMaxUncompressedSize(std::uint32_t size,
                                                                const std::string& zipFileName);

    Archive(const Archive&) = delete;
    Archive& operator=(const Archive&) = delete;

    // Adds the regular file at path under the entry name asFile (mode 0644, the file's size and
    // modification time, no owner). False, with the archive unchanged and still usable, when the
    // file is unreadable, not a regular file, would take the total over the cap, or libarchive
    // refuses it.
    bool addFile(const std::string& path, const std::string& asFile);
    // Adds the file under the last component of its path.
    bool addFile(const std::string& path);
    // Adds the file a "file://" URL (percent-encoded, host empty or "localhost") or a plain path
    // names. False for any other URL.
    bool addFileURL(const std::string& url);

    // Files added from now on get this modification time instead of their own, so that the same
    // files always make the same archive.
    void setEntryModificationTime(std::int64_t seconds) { entryModificationTime_ = seconds; }

    // Finishes the archive: archiveData is complete only after this. Files cannot be added after.
    bool close();
    // Replaces the file at path with archiveData atomically.
    bool writeToFile(const std::string& path) const;

    // The size of the file at path (symbolic links followed), or 0 when it cannot be examined.
    static std::uint64_t sizeOnDiskForPath(const std::string& path);

    // How much smaller the archive is than its files, in percent: not a number or infinite while
    // no bytes were added.
    float compressionPercent() const;

    std::uint32_t maxUncompressedSize() const { return maxUncompressedSize_; }
    std::uint32_t uncompressedSize() const { return uncompressedSize_; }
    int archiveType() const { return archiveType_; }
    const plist::Data& archiveData() const { return archiveData_; }
    // The source paths added, in order.
    const std::vector<std::string>& files() const { return files_; }
    const std::string& identifier() const { return identifier_; }

  private:
    Archive(std::uint32_t maxUncompressedSize, int archiveType, std::string identifier);

    std::uint32_t maxUncompressedSize_;
    std::uint32_t uncompressedSize_ = 0;
    int archiveType_;
    // The writer's callbacks append here, so the object never moves (it lives behind a pointer).
    plist::Data archiveData_;
    // Declared after archiveData_: freeing the writer closes it, which may still append.
    ArchiveWriter archive_;
    std::vector<std::string> files_;
    std::string identifier_;
    std::optional<std::int64_t> entryModificationTime_;
};

// Packs every entry of directory (one level, by name) into a gzip'd archive written to
// archiveFileName, logging each name. Entries that cannot be added are left out.
void archiveDirectory(const std::string& directory, const std::string& archiveFileName);

// The whole content of the regular file at path, or nothing when it cannot be read.
std::optional<plist::Data> copyDataFromFile(const std::string& path);

}  // namespace tavrix::payload
