// Owners of libcurl handles: each handle is wrapped the moment it is created and released on
// every path.
#pragma once

#include <curl/curl.h>

#include <memory>

namespace tavrix::platform {

struct CurlEasyCleanup {
    void operator()(CURL* handle) const { curl_easy_cleanup(handle); }
};
struct CurlUrlCleanup {
    void operator()(CURLU* handle) const { curl_url_cleanup(handle); }
};
struct CurlSlistFree {
    void operator()(curl_slist* list) const { curl_slist_free_all(list); }
};
struct CurlFree {
    void operator()(char* text) const { curl_free(text); }
};

using CurlEasy = std::unique_ptr<CURL, CurlEasyCleanup>;
using CurlUrl = std::unique_ptr<CURLU, CurlUrlCleanup>;
using CurlHeaderList = std::unique_ptr<curl_slist, CurlSlistFree>;
// A string that libcurl allocated.
using CurlString = std::unique_ptr<char, CurlFree>;

}  // namespace tavrix::platform
