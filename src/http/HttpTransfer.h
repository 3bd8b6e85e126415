// Plain HTTP(S) GET transfers for the asset catalog: a whole body into memory, or a body streamed
// to a receiver. Only http and https are fetched, and a redirect keeps the scheme of the URL it
// starts from; a server's error status is a failure.
#pragma once

#include <cstddef>
#include <functional>
#include <optional>
#include <string>
#include <string_view>

#include "base/Result.h"

namespace tavrix::http {

// Receives the body piece by piece. A failure stops the transfer, and becomes its failure.
using HttpBodyReceiver = std::function<Result<>(std::string_view bytes)>;

// How long a transfer may take. A server that accepts and then trickles must not hold the thread
// that waits for it: a transfer slower than lowSpeedBytesPerSecond for lowSpeedSeconds ends, and
// so does one that is not over after its total time.
struct HttpTransferLimits {
    long connectTimeoutSeconds = 15;
    long lowSpeedBytesPerSecond = 1024;
    long lowSpeedSeconds = 30;
    // 0 means no limit on the whole transfer (the low-speed limit still applies).
    long totalTimeoutMilliseconds = 0;
};

// Runs a GET of url, handing the body to receiver. Fails unless the whole body arrived (with the
// receiver's reason when it stopped the transfer).
Result<> transferHttpBody(const std::string& url, const HttpBodyReceiver& receiver,
                          const HttpTransferLimits& limits);

// The whole body of url; fails when the transfer fails or the body is longer than maxBytes.
Result<std::string> fetchHttpBody(const std::string& url, std::size_t maxBytes,
                                  const HttpTransferLimits& limits);

// reference resolved against base (an absolute reference is kept as it is), or nothing when the
// result is not a valid http or https URL.
std::optional<std::string> resolveHttpURL(const std::string& base, const std::string& reference);

}  // namespace tavrix::http
