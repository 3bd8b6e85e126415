// libarchive, loaded when the first archive is read or written: only a bundle payload, an
// update and the archive writer need it, and with its compression and XML libraries (ICU among
// them) it is a fifth of what an idle daemon would otherwise map. The headers give the types and
// constants; every call goes through this table, whose members carry the functions' own names.
#pragma once

#include <archive.h>
#include <archive_entry.h>

#define TAVRIX_ARCHIVE_FUNCTIONS(X)            \
    X(archive_error_string)                    \
    X(archive_set_error)                       \
    X(archive_read_new)                        \
    X(archive_read_free)                       \
    X(archive_read_close)                      \
    X(archive_read_support_filter_gzip)        \
    X(archive_read_support_filter_compress)    \
    X(archive_read_support_format_tar)         \
    X(archive_read_support_format_cpio)        \
    X(archive_read_open_filename)              \
    X(archive_read_open_fd)                    \
    X(archive_read_next_header)                \
    X(archive_read_data_block)                 \
    X(archive_write_new)                       \
    X(archive_write_free)                      \
    X(archive_write_close)                     \
    X(archive_write_add_filter_bzip2)          \
    X(archive_write_add_filter_gzip)           \
    X(archive_write_set_filter_option)         \
    X(archive_write_set_format_pax_restricted) \
    X(archive_write_set_bytes_per_block)       \
    X(archive_write_set_bytes_in_last_block)   \
    X(archive_write_open)                      \
    X(archive_write_header)                    \
    X(archive_write_data)                      \
    X(archive_write_data_block)                \
    X(archive_write_finish_entry)              \
    X(archive_write_disk_new)                  \
    X(archive_write_disk_set_options)          \
    X(archive_write_disk_set_standard_lookup)  \
    X(archive_entry_new)                       \
    X(archive_entry_free)                      \
    X(archive_entry_pathname)                  \
    X(archive_entry_copy_pathname)             \
    X(archive_entry_hardlink)                  \
    X(archive_entry_copy_hardlink)             \
    X(archive_entry_symlink)                   \
    X(archive_entry_filetype)                  \
    X(archive_entry_set_filetype)              \
    X(archive_entry_size)                      \
    X(archive_entry_size_is_set)               \
    X(archive_entry_set_size)                  \
    X(archive_entry_set_perm)                  \
    X(archive_entry_set_mtime)

namespace tavrix::payload {

struct ArchiveLibrary {
#define TAVRIX_ARCHIVE_MEMBER(name) decltype(&::name) name = nullptr;
    TAVRIX_ARCHIVE_FUNCTIONS(TAVRIX_ARCHIVE_MEMBER)
#undef TAVRIX_ARCHIVE_MEMBER
};

// libarchive, loaded on the first call (thread-safe); null when it cannot be, with the reason
// logged once. Callers that create handles check it; each such caller fails its own operation.
const ArchiveLibrary* loadArchive();

// The loaded library, for code that already holds a handle (which exists only once it loaded).
inline const ArchiveLibrary& libarchive() {
    return *loadArchive();
}

}  // namespace tavrix::payload
