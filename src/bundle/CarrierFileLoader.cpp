#include "bundle/CarrierFileLoader.h"

#include <syslog.h>

#include <string_view>

#include "plist/PropertyListFormat.h"
#include "util/FileURL.h"
#include "util/SystemLog.h"

namespace tavrix {
namespace {

std::optional<plist::Data> readLocalFile(const std::string& path) {
    Result<std::string> bytes = plist::readFileBytes(path);
    if (!bytes) {
        return std::nullopt;
    }
    return plist::Data(bytes->begin(), bytes->end());
}

// Loaded data as a property list; a missing or empty body parses to nothing, silently.
std::optional<plist::Value> parseLoaded(bool loaded, const std::optional<plist::Data>& data) {
    if (!loaded) {
        writeSystemLog(LOG_ERR, "Failed to load the file\n");
        return std::nullopt;
    }
    // A fetch may succeed without data (an encoding other than gzip); that parses to nothing.
    if (!data || data->empty()) {
        return std::nullopt;
    }
    Result<plist::Value> parsed =
        plist::parse(std::string_view(reinterpret_cast<const char*>(data->data()), data->size()));
    if (!parsed) {
        return std::nullopt;
    }
    return std::move(*parsed);
}

}  // namespace

std::optional<plist::Value> copyDictionaryFromFile(const std::string& path) {
    // A path that names no file URL is refused as such; one that does is read as the path it is.
    if (!fileURLFromPath(path)) {
        // As a C string, the way a printf-style "%s" would show it.
        writeSystemLog(LOG_ERR,
                       "Failed to get the URL for the file " + std::string(path.c_str()) + "\n");
        return std::nullopt;
    }
    std::optional<plist::Data> data = readLocalFile(path);
    std::optional<plist::Value> value = parseLoaded(data.has_value(), data);
    if (!value || !value->isDictionary()) {
        return std::nullopt;
    }
    return value;
}

std::optional<plist::Value> copyPropertyListFromURL(const std::string& url,
                                                    CarrierFileSource source) {
    std::optional<plist::Data> data;
    bool loaded = false;
    if (source == kCarrierFileSourceLocal) {
        std::optional<std::string> path = pathFromFileURL(url);
        data = path ? readLocalFile(*path) : std::nullopt;
        loaded = data.has_value();
    } else {
        loaded = copyDataFromHTTP(url, &data);
    }
    return parseLoaded(loaded, data);
}

}  // namespace tavrix
