// Owners of libarchive handles: each handle is wrapped the moment it is created and freed (which
// also closes it) on every path.
#pragma once

#include <memory>

#include "payload/ArchiveLibrary.h"

namespace tavrix::payload {

struct ArchiveReadFree {
    void operator()(archive* handle) const { libarchive().archive_read_free(handle); }
};
struct ArchiveWriteFree {
    void operator()(archive* handle) const { libarchive().archive_write_free(handle); }
};
struct ArchiveEntryFree {
    void operator()(archive_entry* entry) const { libarchive().archive_entry_free(entry); }
};

// A reader from archive_read_new.
using ArchiveReader = std::unique_ptr<archive, ArchiveReadFree>;
// A writer from archive_write_new or archive_write_disk_new.
using ArchiveWriter = std::unique_ptr<archive, ArchiveWriteFree>;
using ArchiveEntry = std::unique_ptr<archive_entry, ArchiveEntryFree>;

}  // namespace tavrix::payload
