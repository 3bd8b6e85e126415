#include "http/CurlLibrary.h"

#include <memory>

#include "util/SharedLibrary.h"

namespace tavrix::http {
namespace {

constexpr const char* kLibraryName = "libcurl.so.4";

}  // namespace

Result<const CurlLibrary*> loadCurl() {
    static const LoadedLibrary<CurlLibrary> libcurl(
        kLibraryName, "HTTP transfers are unavailable", [](SharedLibrary& curl, CurlLibrary& f) {
            decltype(&::curl_global_init) globalInit = nullptr;
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
                return bound;
            }
            // Its global state is never torn down.
            if (globalInit(CURL_GLOBAL_DEFAULT) != CURLE_OK) {
                return Result<>(Failure{std::string(kLibraryName) + " could not be initialised"});
            }
            return Result<>();
        });
    return libcurl.functions();
}

}  // namespace tavrix::http
