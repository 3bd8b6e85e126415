#include "PlistJson.h"

#include <sodium.h>

#include <cmath>
#include <cstdio>
#include <ctime>

namespace tavrix::tools {
namespace {

// Dates count from 2001-01-01 00:00:00 UTC.
constexpr double kReferenceDateUnixSeconds = 978307200.0;

std::string base64(const plist::Data& data) {
    std::string text(sodium_base64_ENCODED_LEN(data.size(), sodium_base64_VARIANT_ORIGINAL), '\0');
    sodium_bin2base64(text.data(), text.size(), data.data(), data.size(),
                      sodium_base64_VARIANT_ORIGINAL);
    text.resize(text.size() - 1);  // the terminating NUL
    return text;
}

}  // namespace

std::string isoDate(const plist::Date& date) {
    const double unixSeconds = date.secondsSinceReferenceDate + kReferenceDateUnixSeconds;
    if (!std::isfinite(unixSeconds)) {
        return "(invalid date)";
    }
    const double whole = std::floor(unixSeconds);
    auto micros = static_cast<long>(std::llround((unixSeconds - whole) * 1e6));
    auto seconds = static_cast<std::time_t>(whole);
    if (micros >= 1000000) {
        micros -= 1000000;
        ++seconds;
    }
    std::tm parts{};
    char text[64] = "";
    if (::gmtime_r(&seconds, &parts) == nullptr ||
        std::strftime(text, sizeof text, "%Y-%m-%dT%H:%M:%S", &parts) == 0) {
        return "(invalid date)";
    }
    std::string out = text;
    if (micros > 0) {
        char fraction[32];
        std::snprintf(fraction, sizeof fraction, ".%06ld", micros);
        std::string digits = fraction;
        digits.erase(digits.find_last_not_of('0') + 1);
        out += digits;
    }
    return out + "Z";
}

nlohmann::json toJson(const plist::Value& value) {
    switch (value.type()) {
        case plist::Type::Dictionary: {
            const plist::Dictionary& dictionary = *value.asDictionary();
            nlohmann::json object = nlohmann::json::object();
            for (const auto& [key, child] : dictionary) {
                object[key] = toJson(child);
            }
            if (dictionary.size() == 1 && dictionary.begin()->first.starts_with("$")) {
                return {{"$dictionary", std::move(object)}};
            }
            return object;
        }
        case plist::Type::Array: {
            nlohmann::json array = nlohmann::json::array();
            for (const plist::Value& child : *value.asArray()) {
                array.push_back(toJson(child));
            }
            return array;
        }
        case plist::Type::String:
            return *value.asString();
        case plist::Type::Integer: {
            const plist::Integer& integer = *value.asInteger();
            return integer.isLargeUnsigned() ? nlohmann::json(integer.unsignedValue())
                                             : nlohmann::json(integer.signedValue());
        }
        case plist::Type::Real:
            return *value.asReal();  // NaN and infinities come out as null
        case plist::Type::Boolean:
            return *value.asBoolean();
        case plist::Type::Date:
            return {{"$date", isoDate(*value.asDate())}};
        case plist::Type::Data:
            return {{"$data", base64(*value.asData())}};
    }
    return nullptr;
}

std::string dumpJson(const nlohmann::json& json, JsonStyle style) {
    // Text that is not UTF-8 (a file name) is replaced rather than failing the whole answer.
    return json.dump(style == JsonStyle::Pretty ? 2 : -1, ' ', false,
                     nlohmann::json::error_handler_t::replace) +
           "\n";
}

}  // namespace tavrix::tools
