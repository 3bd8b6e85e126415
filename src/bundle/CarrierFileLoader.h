// Loading carrier files: a property-list file turned into a dictionary, from a local file or
// fetched over HTTP with gzip transfer compression. Each call stands alone. Failures go straight
// to the system log with syslog priorities (LOG_ERR, LOG_NOTICE for the HTTP size reports).
#pragma once

#include <optional>
#include <string>

#include "plist/Value.h"

namespace tavrix {

enum CarrierFileSource {
    kCarrierFileSourceRemote = 0,
    kCarrierFileSourceLocal = 1,
};

// The dictionary in the property-list file at path (any format), or nothing when the file cannot
// be read, is no property list, or holds something other than a dictionary.
std::optional<plist::Value> copyDictionaryFromFile(const std::string& path);

// The property list behind url, of any type, or nothing. The local source reads "file://" URLs
// (see FileURL.h); any other source fetches url with copyDataFromHTTP.
std::optional<plist::Value> copyPropertyListFromURL(const std::string& url,
                                                    CarrierFileSource source);

// Fetches url over HTTP/1.0 (redirects followed) offering "compress, gzip". *out receives the
// body, inflated when the response's Content-Encoding names gzip; it stays empty when another
// encoding was used or inflating failed. True when the transfer itself succeeded, whatever the
// HTTP status; false when out is null or the transfer failed.
bool copyDataFromHTTP(const std::string& url, std::optional<plist::Data>* out);

}  // namespace tavrix
