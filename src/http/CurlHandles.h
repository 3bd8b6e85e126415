// Owners of libcurl handles: each handle is wrapped the moment it is created and released on
// every path. A handle exists only once libcurl is loaded, so the deleters find it loaded.
#pragma once

#include <memory>

#include "http/CurlLibrary.h"

namespace tavrix::http {

struct CurlEasyCleanup {
    void operator()(CURL* handle) const { (*loadCurl())->easy_cleanup(handle); }
};
struct CurlUrlCleanup {
    void operator()(CURLU* handle) const { (*loadCurl())->url_cleanup(handle); }
};
struct CurlSlistFree {
    void operator()(curl_slist* list) const { (*loadCurl())->slist_free_all(list); }
};
struct CurlFree {
    void operator()(char* text) const { (*loadCurl())->free(text); }
};

using CurlEasy = std::unique_ptr<CURL, CurlEasyCleanup>;
using CurlUrl = std::unique_ptr<CURLU, CurlUrlCleanup>;
using CurlHeaderList = std::unique_ptr<curl_slist, CurlSlistFree>;
// A string that libcurl allocated.
using CurlString = std::unique_ptr<char, CurlFree>;

}  // namespace tavrix::http
