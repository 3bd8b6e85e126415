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
    LoadedArchive loaded;
    std::string error;
    auto library = SharedLibrary::open(kLibraryName, error);
    bool bound = library != nullptr;
#define TAVRIX_ARCHIVE_BIND(name) \
    bound = bound && library->bind(loaded.functions.name, #name, error);
    TAVRIX_ARCHIVE_FUNCTIONS(TAVRIX_ARCHIVE_BIND)
#undef TAVRIX_ARCHIVE_BIND
    if (!bound) {
        writeSystemLog(LOG_ERR, "Archives are unavailable: " + error);
        return LoadedArchive{};
    }
    loaded.library = std::move(library);
    return loaded;
}

}  // namespace

const ArchiveLibrary* loadArchive() {
    static const LoadedArchive loaded = load();
    return loaded.library ? &loaded.functions : nullptr;
}

}  // namespace tavrix::payload
