// Plain HTTP(S) GET transfers for the asset catalog: a whole body into memory, or a body streamed
// to a receiver. Only http and https are fetched, and a redirect keeps the scheme of the URL it
// starts from; a server's error status is a failure.
#pragma once

#include <cstddef>
#include <functional>
#include <optional>
#include <string>
#include <string_view>

namespace tavrix::http {

// Receives the body piece by piece. Answering false stops the transfer; refusal then says why.
using HttpBodyReceiver = std::function<bool(std::string_view bytes, std::string& refusal)>;

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

// Runs a GET of url, handing the body to receiver. True when the whole body arrived; otherwise
// false with error saying why (the receiver's refusal when it stopped the transfer).
bool transferHttpBody(const std::string& url, const HttpBodyReceiver& receiver,
                      const HttpTransferLimits& limits, std::string& error);

// The whole body of url, or nothing (with error set) when the transfer fails or the body is
// longer than maxBytes.
std::optional<std::string> fetchHttpBody(const std::string& url, std::size_t maxBytes,
                                         const HttpTransferLimits& limits, std::string& error);

// reference resolved against base (an absolute reference is kept as it is), or nothing when the
// result is not a valid http or https URL.
std::optional<std::string> resolveHttpURL(const std::string& base, const std::string& reference);

}  // namespace tavrix::http
