#include "payload/ArchiveLibrary.h"

#include <memory>
#include <string>

#include "util/SharedLibrary.h"
#include "util/SystemLog.h"

namespace tavrix::payload {
namespace {

constexpr const char* kLibraryName = "libarchive.so.13";

struct LoadedArchive {
    std::unique_ptr<SharedLibrary> library;
    ArchiveLibrary functions;
};

LoadedArchive load() {
    Result<std::unique_ptr<SharedLibrary>> library = SharedLibrary::open(kLibraryName);
    if (!library) {
        writeSystemLog(LOG_ERR, "Archives are unavailable: " + library.reason());
        return LoadedArchive{};
    }
    LoadedArchive loaded;
#define TAVRIX_ARCHIVE_BIND(name) (*library)->bind(loaded.functions.name, #name);
    TAVRIX_ARCHIVE_FUNCTIONS(TAVRIX_ARCHIVE_BIND)
#undef TAVRIX_ARCHIVE_BIND
    if (Result<> bound = (*library)->allBound(); !bound) {
        writeSystemLog(LOG_ERR, "Archives are unavailable: " + bound.reason());
        return LoadedArchive{};
    }
    loaded.library = std::move(*library);
    return loaded;
}

}  // namespace

const ArchiveLibrary* loadArchive() {
    static const LoadedArchive loaded = load();
    return loaded.library ? &loaded.functions : nullptr;
}

}  // namespace tavrix::payload
