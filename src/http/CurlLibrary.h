// libcurl, loaded when the first transfer needs it: the network is used only for update checks
// and carrier files, and libcurl's TLS, Kerberos, LDAP and SSH libraries are most of what an
// idle daemon would otherwise map. The header gives the types and constants; every call goes
// through this table.
#pragma once

#include <curl/curl.h>

#include <string>

#include "base/Result.h"

namespace tavrix::http {

struct CurlLibrary {
    decltype(&::curl_easy_init) easy_init = nullptr;
    decltype(&::curl_easy_cleanup) easy_cleanup = nullptr;
    decltype(&::curl_easy_setopt) easy_setopt = nullptr;
    decltype(&::curl_easy_perform) easy_perform = nullptr;
    decltype(&::curl_easy_getinfo) easy_getinfo = nullptr;
    decltype(&::curl_easy_strerror) easy_strerror = nullptr;
    decltype(&::curl_slist_append) slist_append = nullptr;
    decltype(&::curl_slist_free_all) slist_free_all = nullptr;
    decltype(&::curl_url) url = nullptr;
    decltype(&::curl_url_cleanup) url_cleanup = nullptr;
    decltype(&::curl_url_set) url_set = nullptr;
    decltype(&::curl_url_get) url_get = nullptr;
    decltype(&::curl_free) free = nullptr;
};

// libcurl, loaded and globally initialised on the first call (thread-safe). A failure is logged
// once; each caller fails its own operation.
Result<const CurlLibrary*> loadCurl();

}  // namespace tavrix::http
