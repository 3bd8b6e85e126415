#include "http/CurlLibrary.h"

#include <memory>

#include "util/SharedLibrary.h"
#include "util/SystemLog.h"

namespace tavrix::http {
namespace {

constexpr const char* kLibraryName = "libcurl.so.4";

struct LoadedCurl {
    std::unique_ptr<SharedLibrary> library;
    CurlLibrary functions;
    std::string error;
};

LoadedCurl load() {
    LoadedCurl loaded;
    std::string& error = loaded.error;
    auto library = SharedLibrary::open(kLibraryName, error);
    CurlLibrary& f = loaded.functions;
    decltype(&::curl_global_init) globalInit = nullptr;
    bool bound = library && library->bind(globalInit, "curl_global_init", error) &&
                 library->bind(f.easy_init, "curl_easy_init", error) &&
                 library->bind(f.easy_cleanup, "curl_easy_cleanup", error) &&
                 library->bind(f.easy_setopt, "curl_easy_setopt", error) &&
                 library->bind(f.easy_perform, "curl_easy_perform", error) &&
                 library->bind(f.easy_getinfo, "curl_easy_getinfo", error) &&
                 library->bind(f.easy_strerror, "curl_easy_strerror", error) &&
                 library->bind(f.slist_append, "curl_slist_append", error) &&
                 library->bind(f.slist_free_all, "curl_slist_free_all", error) &&
                 library->bind(f.url, "curl_url", error) &&
                 library->bind(f.url_cleanup, "curl_url_cleanup", error) &&
                 library->bind(f.url_set, "curl_url_set", error) &&
                 library->bind(f.url_get, "curl_url_get", error) &&
                 library->bind(f.free, "curl_free", error);
    if (bound && globalInit(CURL_GLOBAL_DEFAULT) != CURLE_OK) {
        error = std::string(kLibraryName) + " could not be initialised";
        bound = false;
    }
    if (!bound) {
        writeSystemLog(LOG_ERR, "HTTP transfers are unavailable: " + error);
        return LoadedCurl{nullptr, {}, std::move(error)};
    }
    // Kept for the rest of the process: libcurl's global state is never torn down.
    loaded.library = std::move(library);
    return loaded;
}

}  // namespace

const CurlLibrary* loadCurl(std::string* error) {
    static const LoadedCurl loaded = load();
    if (!loaded.library) {
        if (error != nullptr) {
            *error = "HTTP transfers are unavailable: " + loaded.error;
        }
        return nullptr;
    }
    return &loaded.functions;
}

}  // namespace tavrix::http
