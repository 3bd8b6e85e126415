// The HTTP branch of the carrier file loader, on libcurl and zlib.
#include <curl/curl.h>
#include <syslog.h>

#include <cctype>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "bundle/CarrierFileLoader.h"
#include "bundle/GzipInflater.h"
#include "http/CurlHandles.h"
#include "util/SystemLog.h"

namespace tavrix {
namespace {

// A body beyond this ends the transfer as failed rather than exhausting memory.
constexpr std::size_t kMaxBodyBytes = kMaxInflatedBytes;
// A redirect loop ends the transfer as failed.
constexpr long kMaxRedirects = 20;

using HeaderList = http::CurlHeaderList;

bool equalsIgnoringCase(std::string_view a, std::string_view b) {
    if (a.size() != b.size()) {
        return false;
    }
    for (std::size_t i = 0; i < a.size(); ++i) {
        if (std::tolower(static_cast<unsigned char>(a[i])) !=
            std::tolower(static_cast<unsigned char>(b[i]))) {
            return false;
        }
    }
    return true;
}

bool containsIgnoringCase(std::string_view text, std::string_view word) {
    for (std::size_t at = 0; at + word.size() <= text.size(); ++at) {
        if (equalsIgnoringCase(text.substr(at, word.size()), word)) {
            return true;
        }
    }
    return false;
}

std::string_view trimmed(std::string_view text) {
    while (!text.empty() && (text.front() == ' ' || text.front() == '\t')) {
        text.remove_prefix(1);
    }
    while (!text.empty() && (text.back() == ' ' || text.back() == '\t' || text.back() == '\r' ||
                             text.back() == '\n')) {
        text.remove_suffix(1);
    }
    return text;
}

// What one transfer gathers: the body and the header fields of the last response (the one a
// redirect chain ends with).
struct Transfer {
    plist::Data body;
    bool sawResponse = false;
    std::vector<std::pair<std::string, std::string>> fields;

    // The field's value, several occurrences joined with ", "; nothing when absent.
    std::optional<std::string> field(std::string_view name) const {
        std::optional<std::string> value;
        for (const auto& [fieldName, fieldValue] : fields) {
            if (equalsIgnoringCase(fieldName, name)) {
                value = value ? *value + ", " + fieldValue : fieldValue;
            }
        }
        return value;
    }
};

std::size_t receiveBody(char* bytes, std::size_t size, std::size_t count, void* context) {
    auto* transfer = static_cast<Transfer*>(context);
    std::size_t length = size * count;
    if (length > kMaxBodyBytes - transfer->body.size()) {
        return 0;  // libcurl ends the transfer with a write error
    }
    transfer->body.insert(transfer->body.end(), bytes, bytes + length);
    return length;
}

std::size_t receiveHeader(char* bytes, std::size_t size, std::size_t count, void* context) {
    auto* transfer = static_cast<Transfer*>(context);
    std::string_view line(bytes, size * count);
    if (line.starts_with("HTTP/")) {
        transfer->sawResponse = true;
        transfer->fields.clear();
    } else if (std::size_t colon = line.find(':'); colon != std::string_view::npos) {
        transfer->fields.emplace_back(std::string(trimmed(line.substr(0, colon))),
                                      std::string(trimmed(line.substr(colon + 1))));
    }
    return size * count;
}

// Hands the body to out as the response's encoding asks: as it is without an encoding,
// inflated for gzip, and not at all for any other encoding (although "compress" is offered).
void takeBody(Transfer& transfer, std::optional<plist::Data>& out) {
    if (!transfer.sawResponse) {
        return;
    }
    std::optional<std::string> encoding = transfer.field("CONTENT-ENCODING");
    if (!encoding) {
        writeSystemLog(LOG_NOTICE, "XML file retrieved, file size: " +
                                       std::to_string(transfer.body.size()) + "\n");
        out = std::move(transfer.body);
        return;
    }
    if (!containsIgnoringCase(*encoding, "GZIP")) {
        return;
    }
    plist::Data inflated;
    if (inflateGzip(transfer.body, inflated)) {
        writeSystemLog(
            LOG_NOTICE,
            "XML file retrieved, compressed size: " + std::to_string(transfer.body.size()) +
                ", decompressed size: " + std::to_string(inflated.size()) + "\n");
        out = std::move(inflated);
    }
}

}  // namespace

bool copyDataFromHTTP(const std::string& url, std::optional<plist::Data>* out) {
    if (out == nullptr) {
        return false;
    }
    out->reset();
    Result<const http::CurlLibrary*> loaded = http::loadCurl();
    if (!loaded) {
        return false;
    }
    const http::CurlLibrary* libcurl = *loaded;
    http::CurlEasy handle(libcurl->easy_init());
    HeaderList headers(libcurl->slist_append(nullptr, "Accept-Encoding: compress, gzip"));
    if (!handle || !headers) {
        return false;
    }
    Transfer transfer;
    CURL* curl = handle.get();
    // libcurl's own decoding stays off (no CURLOPT_ACCEPT_ENCODING): the body arrives as sent
    // and the Content-Encoding field decides. There is no equivalent of an opportunistic
    // connection here, and no time limit of the loader's own.
    bool configured =
        libcurl->easy_setopt(curl, CURLOPT_URL, url.c_str()) == CURLE_OK &&
        libcurl->easy_setopt(curl, CURLOPT_HTTP_VERSION, long{CURL_HTTP_VERSION_1_0}) == CURLE_OK &&
        libcurl->easy_setopt(curl, CURLOPT_HTTPHEADER, headers.get()) == CURLE_OK &&
        libcurl->easy_setopt(curl, CURLOPT_FOLLOWLOCATION, 1L) == CURLE_OK &&
        libcurl->easy_setopt(curl, CURLOPT_MAXREDIRS, kMaxRedirects) == CURLE_OK &&
        libcurl->easy_setopt(curl, CURLOPT_PROTOCOLS_STR, "http,https") == CURLE_OK &&
        libcurl->easy_setopt(curl, CURLOPT_REDIR_PROTOCOLS_STR, "http,https") == CURLE_OK &&
        libcurl->easy_setopt(curl, CURLOPT_NOSIGNAL, 1L) == CURLE_OK &&
        libcurl->easy_setopt(curl, CURLOPT_WRITEFUNCTION, &receiveBody) == CURLE_OK &&
        libcurl->easy_setopt(curl, CURLOPT_WRITEDATA, &transfer) == CURLE_OK &&
        libcurl->easy_setopt(curl, CURLOPT_HEADERFUNCTION, &receiveHeader) == CURLE_OK &&
        libcurl->easy_setopt(curl, CURLOPT_HEADERDATA, &transfer) == CURLE_OK;
    if (!configured || libcurl->easy_perform(curl) != CURLE_OK) {
        return false;
    }
    takeBody(transfer, *out);
    return true;
}

}  // namespace tavrix
