#include "payload/ArchiveLibrary.h"

#include <memory>
#include <string>

#include "util/SharedLibrary.h"

namespace tavrix::payload {
namespace {

constexpr const char* kLibraryName = "libarchive.so.13";

}  // namespace

const ArchiveLibrary* loadArchive() {
    static const LoadedLibrary<ArchiveLibrary> libarchive(
        kLibraryName, "Archives are unavailable", [](SharedLibrary& library, ArchiveLibrary& f) {
#define TAVRIX_ARCHIVE_BIND(name) library.bind(f.name, #name);
            TAVRIX_ARCHIVE_FUNCTIONS(TAVRIX_ARCHIVE_BIND)
#undef TAVRIX_ARCHIVE_BIND
            return library.allBound();
        });
    return libarchive.functions().value_or(nullptr);
}

}  // namespace tavrix::payload
