#include "util/ContainExceptions.h"

#include "util/Log.h"

namespace tavrix::detail {

void logContainedException(const char* what, const char* reason) noexcept {
    try {
        if (reason != nullptr) {
            logCFormat(LogPriority::Warning, "%s failed with an exception: %s", what, reason);
        } else {
            logCFormat(LogPriority::Warning, "%s failed with an unknown exception", what);
        }
    } catch (...) {
        // Out of memory even for the line: there is nothing left to report with.
    }
}

}  // namespace tavrix::detail
