#include "util/SharedLibrary.h"

#include "util/SystemLog.h"

namespace tavrix {

Result<std::unique_ptr<SharedLibrary>> SharedLibrary::open(const char* name) {
    // RTLD_NOW: a library too old for a symbol fails here, not in the middle of a transfer.
    void* handle = ::dlopen(name, RTLD_NOW | RTLD_LOCAL);
    if (handle == nullptr) {
        const char* why = ::dlerror();
        return Failure{why != nullptr ? why : std::string(name) + " cannot be loaded"};
    }
    return std::unique_ptr<SharedLibrary>(new SharedLibrary(name, handle));
}

void logUnusableLibrary(const std::string& line) {
    writeSystemLog(LOG_ERR, line);
}

}  // namespace tavrix
