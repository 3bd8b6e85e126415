#include "PlistJson.h"

#include <sodium.h>

#include <cmath>
#include <cstdio>

#include "plist/DateText.h"

namespace tavrix::tools {
namespace {

std::string base64(const plist::Data& data) {
    std::string text(sodium_base64_ENCODED_LEN(data.size(), sodium_base64_VARIANT_ORIGINAL), '\0');
    sodium_bin2base64(text.data(), text.size(), data.data(), data.size(),
                      sodium_base64_VARIANT_ORIGINAL);
    text.resize(text.size() - 1);  // the terminating NUL
    return text;
}

}  // namespace

std::string isoDate(const plist::Date& date) {
    if (!std::isfinite(date.secondsSinceReferenceDate)) {
        return "(invalid date)";
    }
    double whole = std::floor(date.secondsSinceReferenceDate);
    auto micros = static_cast<long>(std::llround((date.secondsSinceReferenceDate - whole) * 1e6));
    if (micros >= 1000000) {
        micros -= 1000000;
        whole += 1;
    }
    if (!plist::hasDateText(whole)) {
        return "(invalid date)";
    }
    std::string out = plist::xmlDateText(whole);
    if (micros > 0) {
        char fraction[32];
        std::snprintf(fraction, sizeof fraction, ".%06ld", micros);
        std::string digits = fraction;
        digits.erase(digits.find_last_not_of('0') + 1);
        out.insert(out.size() - 1, digits);  // before the Z
    }
    return out;
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
