#include "TavrixctlOutput.h"

#include <cstdio>

#include "plist/DateText.h"

namespace tavrix::tools {
namespace {

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
    const double seconds = date.secondsSinceReferenceDate;
    return plist::hasDateText(seconds) ? plist::readableDateText(seconds) + " UTC"
                                       : "(invalid date)";
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
