#include "http/HttpTransfer.h"

#include <strings.h>

#include "http/CurlHandles.h"

namespace tavrix::http {
namespace {

constexpr long kMaxRedirects = 5;

struct TransferState {
    const HttpBodyReceiver* receiver = nullptr;
    std::string refusal;
    bool refused = false;
};

std::size_t receiveBody(char* bytes, std::size_t size, std::size_t count, void* context) {
    auto* state = static_cast<TransferState*>(context);
    std::size_t length = size * count;
    if (!(*state->receiver)(std::string_view(bytes, length), state->refusal)) {
        state->refused = true;
        return CURL_WRITEFUNC_ERROR;
    }
    return length;
}

bool isHttpScheme(const char* scheme) {
    return scheme != nullptr &&
           (strcasecmp(scheme, "http") == 0 || strcasecmp(scheme, "https") == 0);
}

}  // namespace

bool transferHttpBody(const std::string& url, const HttpBodyReceiver& receiver,
                      const HttpTransferLimits& limits, std::string& error) {
    const CurlLibrary* libcurl = loadCurl(&error);
    if (libcurl == nullptr) {
        return false;
    }
    CurlEasy handle(libcurl->easy_init());
    if (!handle) {
        error = "libcurl could not create a transfer";
        return false;
    }
    CURL* curl = handle.get();
    TransferState state{&receiver, {}, false};
    char errorText[CURL_ERROR_SIZE] = {};
    // A redirect keeps the URL's own scheme: never https to http, never anywhere else.
    const char* scheme =
        url.size() >= 6 && strncasecmp(url.c_str(), "https:", 6) == 0 ? "https" : "http";
    bool configured =
        libcurl->easy_setopt(curl, CURLOPT_URL, url.c_str()) == CURLE_OK &&
        libcurl->easy_setopt(curl, CURLOPT_PROTOCOLS_STR, scheme) == CURLE_OK &&
        libcurl->easy_setopt(curl, CURLOPT_REDIR_PROTOCOLS_STR, scheme) == CURLE_OK &&
        libcurl->easy_setopt(curl, CURLOPT_FOLLOWLOCATION, 1L) == CURLE_OK &&
        libcurl->easy_setopt(curl, CURLOPT_MAXREDIRS, kMaxRedirects) == CURLE_OK &&
        libcurl->easy_setopt(curl, CURLOPT_FAILONERROR, 1L) == CURLE_OK &&
        libcurl->easy_setopt(curl, CURLOPT_NOSIGNAL, 1L) == CURLE_OK &&
        libcurl->easy_setopt(curl, CURLOPT_CONNECTTIMEOUT, limits.connectTimeoutSeconds) ==
            CURLE_OK &&
        libcurl->easy_setopt(curl, CURLOPT_LOW_SPEED_LIMIT, limits.lowSpeedBytesPerSecond) ==
            CURLE_OK &&
        libcurl->easy_setopt(curl, CURLOPT_LOW_SPEED_TIME, limits.lowSpeedSeconds) == CURLE_OK &&
        libcurl->easy_setopt(curl, CURLOPT_TIMEOUT_MS, limits.totalTimeoutMilliseconds) ==
            CURLE_OK &&
        libcurl->easy_setopt(curl, CURLOPT_ERRORBUFFER, errorText) == CURLE_OK &&
        libcurl->easy_setopt(curl, CURLOPT_WRITEFUNCTION, receiveBody) == CURLE_OK &&
        libcurl->easy_setopt(curl, CURLOPT_WRITEDATA, &state) == CURLE_OK;
    if (!configured) {
        error = "libcurl refused the transfer options";
        return false;
    }
    CURLcode result = libcurl->easy_perform(curl);
    if (result == CURLE_OK) {
        return true;
    }
    if (state.refused) {
        error = state.refusal;
    } else if (result == CURLE_HTTP_RETURNED_ERROR) {
        long status = 0;
        libcurl->easy_getinfo(curl, CURLINFO_RESPONSE_CODE, &status);
        error = "the server answered HTTP status " + std::to_string(status);
    } else {
        error = errorText[0] != '\0' ? errorText : libcurl->easy_strerror(result);
    }
    return false;
}

std::optional<std::string> fetchHttpBody(const std::string& url, std::size_t maxBytes,
                                         const HttpTransferLimits& limits, std::string& error) {
    std::string body;
    HttpBodyReceiver collect = [&](std::string_view bytes, std::string& refusal) {
        if (bytes.size() > maxBytes - body.size()) {
            refusal = "the body is longer than " + std::to_string(maxBytes) + " bytes";
            return false;
        }
        body.append(bytes);
        return true;
    };
    if (!transferHttpBody(url, collect, limits, error)) {
        return std::nullopt;
    }
    return body;
}

std::optional<std::string> resolveHttpURL(const std::string& base, const std::string& reference) {
    const CurlLibrary* libcurl = loadCurl();
    if (libcurl == nullptr) {
        return std::nullopt;
    }
    CurlUrl handle(libcurl->url());
    if (!handle || libcurl->url_set(handle.get(), CURLUPART_URL, base.c_str(), 0) != CURLUE_OK ||
        libcurl->url_set(handle.get(), CURLUPART_URL, reference.c_str(), 0) != CURLUE_OK) {
        return std::nullopt;
    }
    char* rawScheme = nullptr;
    if (libcurl->url_get(handle.get(), CURLUPART_SCHEME, &rawScheme, 0) != CURLUE_OK) {
        return std::nullopt;
    }
    CurlString scheme(rawScheme);
    if (!isHttpScheme(scheme.get())) {
        return std::nullopt;
    }
    char* rawURL = nullptr;
    if (libcurl->url_get(handle.get(), CURLUPART_URL, &rawURL, 0) != CURLUE_OK) {
        return std::nullopt;
    }
    CurlString resolved(rawURL);
    return std::string(resolved.get());
}

}  // namespace tavrix::http
