#include "util/PropertyListFile.h"

#include "util/Log.h"

namespace tavrix {

void logPropertyListRefusal(const std::string& path, const Failure& refusal,
                            const char* consequence) {
    logCFormat(LogPriority::Warning, "Property list %s refused: %s; %s", path.c_str(),
               refusal.reason.c_str(), consequence);
}

}  // namespace tavrix
