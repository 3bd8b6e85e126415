// extractArchive: libarchive's reader feeding its disk writer. Entry paths are prefixed with the
// destination instead of changing the process-wide working directory, which other threads share.
#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "payload/ArchiveEntryPolicy.h"
#include "payload/ArchiveHandles.h"
#include "payload/ExtractionBudget.h"
#include "payload/PayloadUnpack.h"
#include "util/FileSystemHelper.h"
#include "util/Log.h"

namespace tavrix::payload {
namespace {

constexpr size_t kReadBlockSize = 10240;
constexpr mode_t kDestinationMode = 0755;

// Permissions, times, ACLs and file flags; owners are not restored and existing files may be
// replaced.
constexpr int kRestoredAttributes =
    ARCHIVE_EXTRACT_PERM | ARCHIVE_EXTRACT_TIME | ARCHIVE_EXTRACT_ACL | ARCHIVE_EXTRACT_FFLAGS;
static_assert(kRestoredAttributes == 0x66);
// Never write through a symbolic link or to a path with "..". Absolute paths are refused before
// the destination is prefixed (after which every path is absolute), with every other entry that
// could lead outside (ArchiveEntryPolicy).
constexpr int kPathSafetyFlags = ARCHIVE_EXTRACT_SECURE_SYMLINKS | ARCHIVE_EXTRACT_SECURE_NODOTDOT;
// Archives from the network get no file flags either: an immutable or append-only file would
// stop the next install from removing the bundle it replaces.
constexpr int kNetworkArchiveOptions =
    (kRestoredAttributes & ~ARCHIVE_EXTRACT_FFLAGS) | kPathSafetyFlags;

struct FreeDeleter {
    void operator()(char* pointer) const { std::free(pointer); }
};

std::optional<std::string> resolvedPath(const std::string& path) {
    std::unique_ptr<char, FreeDeleter> resolved(::realpath(path.c_str(), nullptr));
    if (!resolved) {
        return std::nullopt;
    }
    return std::string(resolved.get());
}

const char* errorText(archive* handle) {
    const char* text = libarchive().archive_error_string(handle);
    return text != nullptr ? text : "unknown error";
}

// Where the destination stands: the directory written to, and the one the extracted tree will
// become (the same unless the tree is assembled elsewhere and renamed into place afterwards).
struct Placement {
    std::string destination;
    std::string placedAs;
};

// The path an entry name reaches from the placed directory, kept where the placed tree will be:
// a path that lands inside it (an absolute one, or "../Default.bundle/x") is redirected below
// the destination, so that it is part of the tree that takes the directory's place instead of
// being written into the directory about to be replaced.
std::string placedPath(const Placement& placement, const char* name) {
    if (placement.placedAs == placement.destination) {
        return name[0] == '/' ? std::string(name) : placement.destination + "/" + name;
    }
    const std::string reached =
        std::filesystem::path(name[0] == '/' ? std::string(name) : placement.placedAs + "/" + name)
            .lexically_normal()
            .string();
    if (reached == placement.placedAs || reached.starts_with(placement.placedAs + "/")) {
        return placement.destination + reached.substr(placement.placedAs.size());
    }
    return reached;
}

// Points the entry's path and its hard-link target where the archive, extracted in the placed
// directory, would put them. False when the entry has no name to write (the line logged is
// empty, as for an entry that cannot be created).
bool placeEntry(archive_entry* entry, const Placement& placement) {
    const char* name = libarchive().archive_entry_pathname(entry);
    if (name == nullptr || name[0] == '\0') {
        logCFormat("%s", "");
        return false;
    }
    libarchive().archive_entry_copy_pathname(entry, placedPath(placement, name).c_str());
    const char* linkTarget = libarchive().archive_entry_hardlink(entry);
    if (linkTarget != nullptr && linkTarget[0] != '\0') {
        libarchive().archive_entry_copy_hardlink(entry, placedPath(placement, linkTarget).c_str());
    }
    return true;
}

std::uint64_t declaredSize(archive_entry* entry) {
    if (!libarchive().archive_entry_size_is_set(entry) ||
        libarchive().archive_entry_size(entry) < 0) {
        return 0;
    }
    return static_cast<std::uint64_t>(libarchive().archive_entry_size(entry));
}

// Copies the current entry's data block by block (sparse entries keep their holes); stops at the
// entry's end or at the first failure on either side; fails only when the budget runs out, which
// stops the extraction.
Result<> copyEntryData(archive* reader, archive* writer, ExtractionBudget& budget) {
    for (;;) {
        const void* block = nullptr;
        size_t size = 0;
        la_int64_t offset = 0;
        if (libarchive().archive_read_data_block(reader, &block, &size, &offset) != ARCHIVE_OK) {
            return {};
        }
        std::uint64_t start = offset > 0 ? static_cast<std::uint64_t>(offset) : 0;
        std::uint64_t extent = 0;
        if (__builtin_add_overflow(start, size, &extent)) {
            extent = UINT64_MAX;
        }
        // Counted before the write, so that a block past the cap never reaches the disk.
        if (Result<> fits = budget.noteExtent(extent); !fits) {
            return fits;
        }
        if (libarchive().archive_write_data_block(writer, block, size, offset) != ARCHIVE_OK) {
            return {};
        }
    }
}

// The extraction itself; open attaches the reader to the archive named archivePath.
ExtractionOutcome extract(const std::string& archivePath, const std::function<int(archive*)>& open,
                          const std::string& destinationDirectory, ExtractionSafety safety,
                          const ExtractionLimits& limits, std::string* whyNot,
                          const std::string& placedAs) {
    auto fail = [&](const std::string& why,
                    ExtractionOutcome outcome = ExtractionOutcome::Damaged) {
        if (whyNot != nullptr) {
            *whyNot = why;
        } else {
            logCFormat("%s\n", why.c_str());
        }
        return outcome;
    };
    // Empty names would mean standard input and the file-system root to libarchive.
    if (archivePath.empty() || destinationDirectory.empty()) {
        return fail("Cannot extract the archive '" + archivePath + "' into '" +
                    destinationDirectory + "'");
    }
    FileSystemHelper helper;
    if (!helper.fileExists(destinationDirectory)) {
        if (int error = helper.createDirectory(destinationDirectory, kDestinationMode, true);
            error != 0) {
            return fail("Cannot create " + destinationDirectory + ": " + std::strerror(error));
        }
    }
    std::string destination = destinationDirectory;
    if (safety == ExtractionSafety::PathSafe) {
        // Symbolic links in the destination itself are the caller's; only those the archive
        // brings are refused.
        auto resolved = resolvedPath(destinationDirectory);
        if (!resolved) {
            return fail("Cannot extract into " + destinationDirectory + ": " +
                        std::strerror(errno));
        }
        destination = *resolved;
    }

    if (loadArchive() == nullptr) {
        return fail("Cannot extract " + archivePath + ": libarchive is unavailable");
    }
    ArchiveReader reader(libarchive().archive_read_new());
    ArchiveWriter writer(libarchive().archive_write_disk_new());
    if (!reader || !writer) {
        return fail("Cannot extract " + archivePath + ": out of memory");
    }
    libarchive().archive_write_disk_set_options(writer.get(), safety == ExtractionSafety::PathSafe
                                                                  ? kNetworkArchiveOptions
                                                                  : kRestoredAttributes);
    libarchive().archive_read_support_filter_gzip(reader.get());
    libarchive().archive_read_support_filter_compress(reader.get());
    libarchive().archive_read_support_format_tar(reader.get());
    libarchive().archive_read_support_format_cpio(reader.get());
    libarchive().archive_write_disk_set_standard_lookup(writer.get());

    if (open(reader.get()) != ARCHIVE_OK) {
        return fail("Cannot open the archive " + archivePath + ": " + errorText(reader.get()));
    }
    ExtractionBudget budget(limits, destination);
    const Placement placement{destination, placedAs.empty() ? destination : placedAs};
    auto stop = [&](const std::string& why) {
        return fail("Extraction of " + archivePath + " into " + destination + " stopped: " + why,
                    ExtractionOutcome::OverLimit);
    };
    for (;;) {
        archive_entry* entry = nullptr;
        int status = libarchive().archive_read_next_header(reader.get(), &entry);
        if (status == ARCHIVE_EOF) {
            libarchive().archive_read_close(reader.get());
            if (Result<> room = budget.checkFinalRoom(); !room) {
                return stop(room.reason());
            }
            return ExtractionOutcome::Complete;
        }
        if (status != ARCHIVE_OK) {
            return fail("Cannot read the archive " + archivePath + ": " + errorText(reader.get()));
        }
        const char* name = libarchive().archive_entry_pathname(entry);
        if (safety == ExtractionSafety::PathSafe) {
            if (Result<> safe = checkEntryIsSafe(entry); !safe) {
                return fail(std::string("Refusing the archive entry ") + (name ? name : "") +
                            " of " + archivePath + ": " + safe.reason());
            }
        }
        if (Result<> fits = budget.admitEntry(name ? name : "", declaredSize(entry)); !fits) {
            return stop(fits.reason());
        }
        if (!placeEntry(entry, placement)) {
            continue;
        }
        if (libarchive().archive_write_header(writer.get(), entry) < ARCHIVE_WARN) {
            logCFormat("%s", "");
            continue;
        }
        Result<> copied = copyEntryData(reader.get(), writer.get(), budget);
        libarchive().archive_write_finish_entry(writer.get());
        if (!copied) {
            return stop(copied.reason());
        }
    }
}

}  // namespace

bool extractArchive(const std::string& archivePath, const std::string& destinationDirectory,
                    ExtractionSafety safety, const ExtractionLimits& limits, std::string* whyNot) {
    return ExtractionOutcome::Complete == extract(
                                              archivePath,
                                              [&archivePath](archive* reader) {
                                                  return libarchive().archive_read_open_filename(
                                                      reader, archivePath.c_str(), kReadBlockSize);
                                              },
                                              destinationDirectory, safety, limits, whyNot,
                                              std::string());
}

ExtractionOutcome extractArchive(int archiveFd, const std::string& archivePath,
                                 const std::string& destinationDirectory, ExtractionSafety safety,
                                 const ExtractionLimits& limits, std::string* whyNot,
                                 const std::string& placedAs) {
    return extract(
        archivePath,
        [archiveFd](archive* reader) {
            return libarchive().archive_read_open_fd(reader, archiveFd, kReadBlockSize);
        },
        destinationDirectory, safety, limits, whyNot, placedAs);
}

}  // namespace tavrix::payload
