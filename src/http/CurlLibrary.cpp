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
    Result<std::unique_ptr<SharedLibrary>> library = SharedLibrary::open(kLibraryName);
    if (!library) {
        return LoadedCurl{nullptr, {}, library.reason()};
    }
    LoadedCurl loaded;
    CurlLibrary& f = loaded.functions;
    decltype(&::curl_global_init) globalInit = nullptr;
    SharedLibrary& curl = **library;
    curl.bind(globalInit, "curl_global_init");
    curl.bind(f.easy_init, "curl_easy_init");
    curl.bind(f.easy_cleanup, "curl_easy_cleanup");
    curl.bind(f.easy_setopt, "curl_easy_setopt");
    curl.bind(f.easy_perform, "curl_easy_perform");
    curl.bind(f.easy_getinfo, "curl_easy_getinfo");
    curl.bind(f.easy_strerror, "curl_easy_strerror");
    curl.bind(f.slist_append, "curl_slist_append");
    curl.bind(f.slist_free_all, "curl_slist_free_all");
    curl.bind(f.url, "curl_url");
    curl.bind(f.url_cleanup, "curl_url_cleanup");
    curl.bind(f.url_set, "curl_url_set");
    curl.bind(f.url_get, "curl_url_get");
    curl.bind(f.free, "curl_free");
    if (Result<> bound = curl.allBound(); !bound) {
        return LoadedCurl{nullptr, {}, bound.reason()};
    }
    if (globalInit(CURL_GLOBAL_DEFAULT) != CURLE_OK) {
        return LoadedCurl{nullptr, {}, std::string(kLibraryName) + " could not be initialised"};
    }
    // Kept for the rest of the process: libcurl's global state is never torn down.
    loaded.library = std::move(*library);
    return loaded;
}

const LoadedCurl& loaded() {
    static const LoadedCurl curl = [] {
        LoadedCurl made = load();
        if (!made.library) {
            writeSystemLog(LOG_ERR, "HTTP transfers are unavailable: " + made.error);
        }
        return made;
    }();
    return curl;
}

}  // namespace

Result<const CurlLibrary*> loadCurl() {
    if (!loaded().library) {
        return Failure{"HTTP transfers are unavailable: " + loaded().error};
    }
    return &loaded().functions;
}

}  // namespace tavrix::http
