// SHA-256 at the speed of the CPU's own instructions: libcrypto's digest, loaded when the first
// digest is taken (only update checks and the catalog tool need one).
#pragma once

#include <cstddef>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

namespace tavrix::catalog {

inline constexpr std::size_t kSha256HexLength = 64;

// A SHA-256 digest fed piece by piece. Without libcrypto (logged once) the digest is the empty
// text, which matches no expected digest, so nothing unverified is ever accepted.
class Sha256Digest {
  public:
    Sha256Digest();
    ~Sha256Digest();
    Sha256Digest(const Sha256Digest&) = delete;
    Sha256Digest& operator=(const Sha256Digest&) = delete;

    void update(std::string_view bytes);
    // The digest as lower-case hex. The object is spent afterwards.
    std::string finishHex();

  private:
    struct Context;
    std::unique_ptr<Context> context_;
};

// The SHA-256 of the file at path as lower-case hex, or nothing when it cannot be read or hashed.
std::optional<std::string> sha256HexOfFile(const std::string& path);

}  // namespace tavrix::catalog
