// Archives made in the tests with libarchive itself, so that the unpacker is checked
// against the real formats rather than against bytes of our own making.
#pragma once

#include <archive.h>
#include <archive_entry.h>
#include <sys/stat.h>

#include <cstdint>
#include <ctime>
#include <stdexcept>
#include <string>
#include <vector>

#include "TestSupport.h"
#include "payload/ArchiveHandles.h"

namespace tavrix::test {

enum class Container { Tar, Cpio };
enum class Compression { Gzip, Compress };

struct ArchiveItem {
    enum class Kind { File, Directory, Symlink, Hardlink, Fifo };
    Kind kind = Kind::File;
    std::string path;
    std::string content;
    mode_t mode = 0644;
    std::time_t mtime = 1500000000;
    // The target of a symbolic or hard link.
    std::string linkTarget;
};

inline ArchiveItem fileItem(std::string path, std::string content, mode_t mode = 0644,
                            std::time_t mtime = 1500000000) {
    return {ArchiveItem::Kind::File, std::move(path), std::move(content), mode, mtime, {}};
}
inline ArchiveItem directoryItem(std::string path, mode_t mode = 0755,
                                 std::time_t mtime = 1500000000) {
    return {ArchiveItem::Kind::Directory, std::move(path), {}, mode, mtime, {}};
}
inline ArchiveItem symlinkItem(std::string path, std::string target) {
    return {ArchiveItem::Kind::Symlink, std::move(path), {}, 0777, 1500000000, std::move(target)};
}
inline ArchiveItem hardlinkItem(std::string path, std::string target) {
    return {ArchiveItem::Kind::Hardlink, std::move(path), {}, 0644, 1500000000, std::move(target)};
}
inline ArchiveItem fifoItem(std::string path) {
    return {ArchiveItem::Kind::Fifo, std::move(path), {}, 0644, 1500000000, {}};
}

// The archive holding items, in order, as a file's bytes.
inline std::string buildArchive(const std::vector<ArchiveItem>& items,
                                Container container = Container::Tar,
                                Compression compression = Compression::Gzip) {
    payload::ArchiveWriter writer(archive_write_new());
    archive* handle = writer.get();
    if (container == Container::Tar) {
        archive_write_set_format_pax_restricted(handle);
    } else {
        archive_write_set_format_cpio_newc(handle);
    }
    switch (compression) {
        case Compression::Gzip:
            archive_write_add_filter_gzip(handle);
            break;
        case Compression::Compress:
            archive_write_add_filter_compress(handle);
            break;
    }
    std::string bytes;
    auto write = [](archive*, void* out, const void* buffer, size_t length) -> la_ssize_t {
        static_cast<std::string*>(out)->append(static_cast<const char*>(buffer), length);
        return static_cast<la_ssize_t>(length);
    };
    if (archive_write_open(handle, &bytes, nullptr, write, nullptr) != ARCHIVE_OK) {
        throw std::runtime_error(archive_error_string(handle));
    }
    for (const ArchiveItem& item : items) {
        payload::ArchiveEntry entry(archive_entry_new());
        archive_entry_copy_pathname(entry.get(), item.path.c_str());
        archive_entry_set_perm(entry.get(), item.mode);
        archive_entry_set_mtime(entry.get(), item.mtime, 0);
        // cpio wants a size on every entry; a symbolic link's is its target's length.
        archive_entry_set_size(entry.get(), 0);
        switch (item.kind) {
            case ArchiveItem::Kind::File:
                archive_entry_set_filetype(entry.get(), AE_IFREG);
                archive_entry_set_size(entry.get(), static_cast<la_int64_t>(item.content.size()));
                break;
            case ArchiveItem::Kind::Directory:
                archive_entry_set_filetype(entry.get(), AE_IFDIR);
                break;
            case ArchiveItem::Kind::Symlink:
                archive_entry_set_filetype(entry.get(), AE_IFLNK);
                archive_entry_copy_symlink(entry.get(), item.linkTarget.c_str());
                archive_entry_set_size(entry.get(),
                                       static_cast<la_int64_t>(item.linkTarget.size()));
                break;
            case ArchiveItem::Kind::Hardlink:
                archive_entry_set_filetype(entry.get(), AE_IFREG);
                archive_entry_copy_hardlink(entry.get(), item.linkTarget.c_str());
                break;
            case ArchiveItem::Kind::Fifo:
                archive_entry_set_filetype(entry.get(), AE_IFIFO);
                break;
        }
        if (archive_write_header(handle, entry.get()) != ARCHIVE_OK) {
            throw std::runtime_error(archive_error_string(handle));
        }
        if (!item.content.empty()) {
            archive_write_data(handle, item.content.data(), item.content.size());
        }
    }
    archive_write_close(handle);
    return bytes;
}

}  // namespace tavrix::test
