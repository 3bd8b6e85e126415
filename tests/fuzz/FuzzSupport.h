// What the fuzz targets share: a log that drops what the code logs (a run would drown in it) and
// the way a target reports a broken promise.
#pragma once

#include <cstdlib>
#include <string_view>

#include "util/SystemLog.h"

namespace tavrix::fuzz {

// Drops every message for the rest of the run; cheap to call for every input.
inline void silenceTheLog() {
    struct Silent : LogSink {
        void write(int, std::string_view) override {}
    };
    static Silent sink;
    static ScopedLogSink quiet(sink);
}

inline void require(bool condition) {
    if (!condition) {
        std::abort();
    }
}

}  // namespace tavrix::fuzz
