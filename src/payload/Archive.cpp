#include "payload/Archive.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <ctime>
#include <limits>
#include <new>

#include "io/AtomicFile.h"
#include "io/FileIO.h"
#include "io/Paths.h"
#include "io/UniqueFd.h"
#include "util/FileSystemHelper.h"
#include "util/FileURL.h"
#include "util/Log.h"

namespace tavrix::payload {
namespace {

constexpr int kUnderlyingDataMissingError = 22;
constexpr int kBytesPerBlock = 32;
constexpr int kBytesInLastBlock = 1;
constexpr mode_t kEntryMode = 0644;
constexpr mode_t kArchiveFileMode = 0644;

int openCallback(archive* handle, void* clientData) {
    if (clientData == nullptr) {
        libarchive().archive_set_error(handle, kUnderlyingDataMissingError,
                                       "Underlying KWData was nil");
        return ARCHIVE_FATAL;
    }
    return ARCHIVE_OK;
}

la_ssize_t writeCallback(archive* handle, void* clientData, const void* buffer, size_t length) {
    auto* data = static_cast<plist::Data*>(clientData);
    const auto* bytes = static_cast<const std::uint8_t*>(buffer);
    try {
        data->insert(data->end(), bytes, bytes + length);
    } catch (const std::bad_alloc&) {
        // No exception may cross libarchive's C frames.
        libarchive().archive_set_error(handle, ENOMEM, "Out of memory for the archive data");
        return -1;
    }
    return static_cast<la_ssize_t>(length);
}

int closeCallback(archive*, void*) {
    return ARCHIVE_OK;
}

struct FileContents {
    plist::Data bytes;
    struct stat info {};
};

// The content of the regular file at path, read up to one byte past limit so that a file grown
// since it was measured is noticed without reading all of it. Other kinds of files are refused:
// opening a FIFO or a device could block or never end.
std::optional<FileContents> readRegularFile(const std::string& path, std::uint64_t limit) {
    io::UniqueFd fd(::open(path.c_str(), O_RDONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
    if (!fd) {
        return std::nullopt;
    }
    FileContents contents;
    if (::fstat(fd.get(), &contents.info) != 0 || !S_ISREG(contents.info.st_mode)) {
        return std::nullopt;
    }
    // Reading stops once past limit; the caller sees the size and refuses.
    int error = io::readChunks(fd.get(), [&contents, limit](std::string_view chunk) {
        contents.bytes.insert(contents.bytes.end(), chunk.begin(), chunk.end());
        return contents.bytes.size() > limit ? EFBIG : 0;
    });
    if (error != 0 && error != EFBIG) {
        return std::nullopt;
    }
    return contents;
}

// The file-system path of a file URL, or the text itself when it has no scheme.
std::optional<std::string> pathOfFileURL(const std::string& url) {
    if (url.rfind("file://", 0) == 0) {
        return pathFromFileURL(url);
    }
    if (url.find("://") != std::string::npos) {
        return std::nullopt;
    }
    return url;
}

}  // namespace

Archive::Archive(std::uint32_t maxUncompressedSize, int archiveType, std::string identifier)
    : maxUncompressedSize_(maxUncompressedSize),
      archiveType_(archiveType),
      archive_(loadArchive() != nullptr ? libarchive().archive_write_new() : nullptr),
      identifier_(std::move(identifier)) {}

std::unique_ptr<Archive> Archive::initWithMaxUncompressedSize(std::uint32_t size, int archiveType,
                                                              const std::string& zipFileName) {
    std::unique_ptr<Archive> created(new Archive(size, archiveType, zipFileName));
    archive* writer = created->archive_.get();
    if (writer == nullptr) {
        return nullptr;
    }
    int filterStatus = ARCHIVE_FATAL;
    if (archiveType == kArchiveTypeBzip2) {
        filterStatus = libarchive().archive_write_add_filter_bzip2(writer);
    } else if (archiveType == kArchiveTypeGzip) {
        filterStatus = libarchive().archive_write_add_filter_gzip(writer);
        // The time of writing in the gzip header would make equal archives differ.
        if (filterStatus == ARCHIVE_OK) {
            filterStatus =
                libarchive().archive_write_set_filter_option(writer, "gzip", "timestamp", nullptr);
        }
    }
    if (filterStatus != ARCHIVE_OK ||
        libarchive().archive_write_set_format_pax_restricted(writer) != ARCHIVE_OK ||
        libarchive().archive_write_set_bytes_per_block(writer, kBytesPerBlock) != ARCHIVE_OK ||
        libarchive().archive_write_set_bytes_in_last_block(writer, kBytesInLastBlock) !=
            ARCHIVE_OK ||
        libarchive().archive_write_open(writer, &created->archiveData_, openCallback, writeCallback,
                                        closeCallback) != ARCHIVE_OK) {
        return nullptr;
    }
    return created;
}

std::unique_ptr<Archive> Archive::initWithArchiveType(int archiveType,
                                                      const std::string& zipFileName) {
    return initWithMaxUncompressedSize(kDefaultMaxUncompressedSize, archiveType, zipFileName);
}

std::unique_ptr<Archive> Archive::initWithMaxUncompressedSize(std::uint32_t size,
                                                              const std::string& zipFileName) {
    return initWithMaxUncompressedSize(size, kArchiveTypeGzip, zipFileName);
}

bool Archive::addFile(const std::string& path, const std::string& asFile) {
    std::uint64_t size = sizeOnDiskForPath(path);
    if (size > std::numeric_limits<std::uint32_t>::max() || size > maxUncompressedSize_) {
        return false;
    }
    auto contents = readRegularFile(path, maxUncompressedSize_);
    if (!contents) {
        return false;
    }
    const std::uint64_t length = contents->bytes.size();
    if (length > maxUncompressedSize_ || uncompressedSize_ + length > maxUncompressedSize_) {
        return false;
    }

    ArchiveEntry entry(libarchive().archive_entry_new());
    if (!entry) {
        return false;
    }
    libarchive().archive_entry_copy_pathname(entry.get(), asFile.c_str());
    libarchive().archive_entry_set_size(entry.get(), static_cast<la_int64_t>(length));
    libarchive().archive_entry_set_filetype(entry.get(), AE_IFREG);
    libarchive().archive_entry_set_perm(entry.get(), kEntryMode);
    if (entryModificationTime_) {
        libarchive().archive_entry_set_mtime(entry.get(), *entryModificationTime_, 0);
    } else {
        libarchive().archive_entry_set_mtime(entry.get(), contents->info.st_mtim.tv_sec,
                                             contents->info.st_mtim.tv_nsec);
    }
    if (libarchive().archive_write_header(archive_.get(), entry.get()) != ARCHIVE_OK) {
        return false;
    }
    la_ssize_t written = libarchive().archive_write_data(archive_.get(), contents->bytes.data(),
                                                         contents->bytes.size());
    if (written < 0 || static_cast<std::uint64_t>(written) != length) {
        return false;
    }
    uncompressedSize_ += static_cast<std::uint32_t>(length);
    files_.push_back(path);
    return true;
}

bool Archive::addFile(const std::string& path) {
    return addFile(path, io::lastPathComponent(path));
}

bool Archive::addFileURL(const std::string& url) {
    auto path = pathOfFileURL(url);
    return path && addFile(*path);
}

bool Archive::close() {
    return libarchive().archive_write_close(archive_.get()) == ARCHIVE_OK;
}

bool Archive::writeToFile(const std::string& path) const {
    return io::replaceFileAtomically(path, archiveData_, kArchiveFileMode) == 0;
}

std::uint64_t Archive::sizeOnDiskForPath(const std::string& path) {
    struct stat info {};
    if (path.empty() || ::stat(path.c_str(), &info) != 0 || info.st_size < 0) {
        return 0;
    }
    return static_cast<std::uint64_t>(info.st_size);
}

float Archive::compressionPercent() const {
    return (1.0f -
            static_cast<float>(archiveData_.size()) / static_cast<float>(uncompressedSize_)) *
           100.0f;
}

void archiveDirectory(const std::string& directory, const std::string& archiveFileName) {
    const std::string prefix = directory + "/";
    std::vector<std::string> names;
    FileSystemHelper().listDirectory(directory, names, false);
    for (const std::string& name : names) {
        const plist::Value nameValue(name);
        logObjectFormat("Adding File: %@ to the zip file", &nameValue);
    }
    auto archive = Archive::initWithArchiveType(kArchiveTypeGzip, archiveFileName);
    if (!archive) {
        return;
    }
    for (const std::string& name : names) {
        archive->addFile(prefix + name);
    }
    archive->close();
    archive->writeToFile(archiveFileName);
}

std::optional<plist::Data> copyDataFromFile(const std::string& path) {
    auto contents = readRegularFile(path, std::numeric_limits<std::uint64_t>::max() - 1);
    if (!contents) {
        return std::nullopt;
    }
    return std::move(contents->bytes);
}

}  // namespace tavrix::payload
