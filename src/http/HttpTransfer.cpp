#include "http/HttpTransfer.h"

#include <strings.h>

#include "http/CurlHandles.h"

namespace tavrix::http {
namespace {

constexpr long kMaxRedirects = 5;

struct TransferState {
    const HttpBodyReceiver* receiver = nullptr;
    Result<> received;
};

std::size_t receiveBody(char* bytes, std::size_t size, std::size_t count, void* context) {
    auto* state = static_cast<TransferState*>(context);
    std::size_t length = size * count;
    state->received = (*state->receiver)(std::string_view(bytes, length));
    return state->received ? length : CURL_WRITEFUNC_ERROR;
}

bool isHttpScheme(const char* scheme) {
    return scheme != nullptr &&
           (strcasecmp(scheme, "http") == 0 || strcasecmp(scheme, "https") == 0);
}

}  // namespace

Result<> transferHttpBody(const std::string& url, const HttpBodyReceiver& receiver,
                          const HttpTransferLimits& limits) {
    Result<const CurlLibrary*> loaded = loadCurl();
    if (!loaded) {
        return loaded.failure();
    }
    const CurlLibrary* libcurl = *loaded;
    CurlEasy handle(libcurl->easy_init());
    if (!handle) {
        return Failure{"libcurl could not create a transfer"};
    }
    CURL* curl = handle.get();
    TransferState state{&receiver, {}};
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
        return Failure{"libcurl refused the transfer options"};
    }
    CURLcode result = libcurl->easy_perform(curl);
    if (result == CURLE_OK) {
        return {};
    }
    if (!state.received) {
        return state.received;
    }
    if (result == CURLE_HTTP_RETURNED_ERROR) {
        long status = 0;
        libcurl->easy_getinfo(curl, CURLINFO_RESPONSE_CODE, &status);
        return Failure{"the server answered HTTP status " + std::to_string(status)};
    }
    return Failure{errorText[0] != '\0' ? errorText : libcurl->easy_strerror(result)};
}

Result<std::string> fetchHttpBody(const std::string& url, std::size_t maxBytes,
                                  const HttpTransferLimits& limits) {
    std::string body;
    HttpBodyReceiver collect = [&](std::string_view bytes) -> Result<> {
        if (bytes.size() > maxBytes - body.size()) {
            return Failure{"the body is longer than " + std::to_string(maxBytes) + " bytes"};
        }
        body.append(bytes);
        return {};
    };
    if (Result<> transferred = transferHttpBody(url, collect, limits); !transferred) {
        return transferred.failure();
    }
    return body;
}

std::optional<std::string> resolveHttpURL(const std::string& base, const std::string& reference) {
    Result<const CurlLibrary*> loaded = loadCurl();
    if (!loaded) {
        return std::nullopt;
    }
    const CurlLibrary* libcurl = *loaded;
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
