#include "util/PropertyListFile.h"

#include <cerrno>

#include "util/Log.h"

namespace tavrix {

void logPropertyListRefusal(const std::string& path, const plist::Refusal& refusal,
                            const char* consequence) {
    logCFormat(LogPriority::Warning, "Property list %s refused: %s; %s", path.c_str(),
               refusal.reason.c_str(), consequence);
}

std::optional<plist::Value> readPropertyListFile(const std::string& path, const char* consequence) {
    plist::Refusal refusal;
    std::optional<plist::Value> value = plist::readFile(path, &refusal);
    if (!value && refusal.error != ENOENT) {
        logPropertyListRefusal(path, refusal, consequence);
    }
    return value;
}

}  // namespace tavrix
