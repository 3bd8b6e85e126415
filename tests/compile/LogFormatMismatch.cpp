// Object formats that must not compile, one per CASE; CASE 0 is the well-formed call beside them,
// so that the others fail for their mismatch and not for a broken build line.
#include <cstddef>

#include "plist/Value.h"
#include "util/Log.h"

void logSomething(const tavrix::plist::Value& value) {
    using tavrix::logObjectFormat;
#if CASE == 0
    logObjectFormat("%@ %zu %*d %s %.1lf 100%%", &value, std::size_t{1}, 2, 3, "text", 2.5);
#elif CASE == 1
    logObjectFormat("%@", value);  // the value, not a pointer to it
#elif CASE == 2
    logObjectFormat("%@ and %u", &value);  // an argument missing
#elif CASE == 3
    logObjectFormat("%d", 1, 2);  // one too many
#elif CASE == 4
    logObjectFormat("%d", 1LL);  // a wider integer than the conversion reads
#elif CASE == 5
    logObjectFormat("%y", 1);  // no such conversion (and "%n", which writes, is refused too)
#endif
}
