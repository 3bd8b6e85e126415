#include "TavrixctlOutput.h"

#include <cmath>
#include <cstdio>
#include <ctime>

namespace tavrix::tools {
namespace {

// Dates count from 2001-01-01 00:00:00 UTC.
constexpr double kReferenceDateUnixSeconds = 978307200.0;

std::string formatDate(const plist::Date& date, const char* format) {
    const auto seconds = static_cast<std::time_t>(
        std::floor(date.secondsSinceReferenceDate + kReferenceDateUnixSeconds));
    std::tm parts{};
    char text[64] = "";
    if (::gmtime_r(&seconds, &parts) == nullptr ||
        std::strftime(text, sizeof text, format, &parts) == 0) {
        return "(invalid date)";
    }
    return text;
}

std::string jsonString(const std::string& text) {
    std::string out = "\"";
    for (unsigned char c : text) {
        switch (c) {
            case '"':
                out += "\\\"";
                break;
            case '\\':
                out += "\\\\";
                break;
            case '\n':
                out += "\\n";
                break;
            case '\t':
                out += "\\t";
                break;
            default:
                if (c < 0x20) {
                    char escaped[8];
                    std::snprintf(escaped, sizeof escaped, "\\u%04x", c);
                    out += escaped;
                } else {
                    out += static_cast<char>(c);
                }
        }
    }
    return out + "\"";
}

std::string base64(const plist::Data& data) {
    static constexpr char kAlphabet[] =
        "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
    std::string out;
    for (std::size_t i = 0; i < data.size(); i += 3) {
        const std::uint32_t chunk = (std::uint32_t{data[i]} << 16) |
                                    (i + 1 < data.size() ? std::uint32_t{data[i + 1]} << 8 : 0) |
                                    (i + 2 < data.size() ? std::uint32_t{data[i + 2]} : 0);
        out += kAlphabet[(chunk >> 18) & 63];
        out += kAlphabet[(chunk >> 12) & 63];
        out += i + 1 < data.size() ? kAlphabet[(chunk >> 6) & 63] : '=';
        out += i + 2 < data.size() ? kAlphabet[chunk & 63] : '=';
    }
    return out;
}

const std::string* textAt(const plist::Dictionary& dictionary, const char* key) {
    auto found = dictionary.find(key);
    return found != dictionary.end() ? found->second.asString() : nullptr;
}

std::string textOr(const plist::Dictionary& dictionary, const char* key, const char* none) {
    const std::string* text = textAt(dictionary, key);
    return text != nullptr ? *text : none;
}

std::string dateOr(const plist::Dictionary& dictionary, const char* key, const char* none) {
    auto found = dictionary.find(key);
    const plist::Date* date = found != dictionary.end() ? found->second.asDate() : nullptr;
    return date != nullptr ? readableDate(*date) : none;
}

const plist::Dictionary* dictionaryAt(const plist::Dictionary& dictionary, const char* key) {
    auto found = dictionary.find(key);
    return found != dictionary.end() ? found->second.asDictionary() : nullptr;
}

void line(std::string& out, const char* label, const std::string& text) {
    char padded[32];
    std::snprintf(padded, sizeof padded, "%-24s", (std::string(label) + ":").c_str());
    out += padded + text + "\n";
}

}  // namespace

std::string readableDate(const plist::Date& date) {
    return formatDate(date, "%Y-%m-%d %H:%M:%S UTC");
}

std::string toJson(const plist::Value& value) {
    switch (value.type()) {
        case plist::Type::Dictionary: {
            std::string out = "{";
            for (const auto& [key, child] : *value.asDictionary()) {
                out += (out.size() > 1 ? "," : "") + jsonString(key) + ":" + toJson(child);
            }
            return out + "}";
        }
        case plist::Type::Array: {
            std::string out = "[";
            for (const plist::Value& child : *value.asArray()) {
                out += (out.size() > 1 ? "," : "") + toJson(child);
            }
            return out + "]";
        }
        case plist::Type::String:
            return jsonString(*value.asString());
        case plist::Type::Integer: {
            const plist::Integer& integer = *value.asInteger();
            return integer.isLargeUnsigned() ? std::to_string(integer.unsignedValue())
                                             : std::to_string(integer.signedValue());
        }
        case plist::Type::Real: {
            const double real = *value.asReal();
            if (!std::isfinite(real)) {
                return "null";
            }
            char text[32];
            std::snprintf(text, sizeof text, "%.17g", real);
            return text;
        }
        case plist::Type::Boolean:
            return *value.asBoolean() ? "true" : "false";
        case plist::Type::Date:
            return jsonString(formatDate(*value.asDate(), "%Y-%m-%dT%H:%M:%SZ"));
        case plist::Type::Data:
            return jsonString(base64(*value.asData()));
    }
    return "null";
}

std::string readableStatus(const plist::Dictionary& status) {
    std::string out;
    line(out, "Daemon version", textOr(status, "DaemonVersion", "(unknown)"));
    line(out, "Behavior ID", textOr(status, "BehaviorID", "(none)"));
    auto supported = status.find("Supported");
    const bool* flag = supported != status.end() ? supported->second.asBoolean() : nullptr;
    line(out, "Bundles supported",
         flag != nullptr && *flag ? std::string("yes")
                                  : "no (" + textOr(status, "WhyNotSupported", "unknown") + ")");
    if (const plist::Dictionary* linked = dictionaryAt(status, "LinkedBundle")) {
        line(out, "Linked bundle", textOr(*linked, "Path", "(unknown)"));
        line(out, "  identifier", textOr(*linked, "Identifier", "(none)"));
        line(out, "  version", textOr(*linked, "Version", "(none)"));
        line(out, "  overlay", textOr(*linked, "OverlayType", "(none)"));
        line(out, "  carrier file", textOr(*linked, "CarrierFile", "(none)"));
    } else {
        line(out, "Linked bundle", "(none)");
    }
    line(out, "System bundle version", textOr(status, "SystemBundleVersion", "(none)"));
    line(out, "User bundle version", textOr(status, "UserBundleVersion", "(none)"));
    line(out, "Next update check", dateOr(status, "NextUpdateCheck", "(not scheduled)"));
    if (const plist::Dictionary* check = dictionaryAt(status, "LastCheck")) {
        line(out, "Last update check",
             dateOr(*check, "Time", "(unknown time)") + ": " + textOr(*check, "Reason", "") + " [" +
                 textOr(*check, "Outcome", "?") + "]");
    } else {
        line(out, "Last update check", "(none)");
    }
    if (const plist::Dictionary* payload = dictionaryAt(status, "LastPayload")) {
        auto extracted = payload->find("Extracted");
        const bool* done = extracted != payload->end() ? extracted->second.asBoolean() : nullptr;
        line(out, "Last payload",
             dateOr(*payload, "Time", "(unknown time)") + ": " +
                 (done != nullptr && *done ? "extracted" : "not extracted") + " (" +
                 textOr(*payload, "Reason", "") + ")");
    } else {
        line(out, "Last payload", "(none)");
    }
    return out;
}

}  // namespace tavrix::tools
