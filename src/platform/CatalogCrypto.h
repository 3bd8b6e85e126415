// The cryptography of the asset catalog, on libsodium: SHA-256 digests of archives and Ed25519
// detached signatures of catalogs.
#pragma once

#include <sodium.h>

#include <array>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace tavrix::platform {

using CatalogPublicKey = std::array<std::uint8_t, crypto_sign_PUBLICKEYBYTES>;
using CatalogSecretKey = std::array<std::uint8_t, crypto_sign_SECRETKEYBYTES>;
inline constexpr std::size_t kCatalogSignatureBytes = crypto_sign_BYTES;
inline constexpr std::size_t kSha256HexLength = 2 * crypto_hash_sha256_BYTES;

// Initialises libsodium once for the process; false when it cannot be used.
bool sodiumReady();

// A SHA-256 digest fed piece by piece.
class Sha256Digest {
  public:
    Sha256Digest();
    void update(std::string_view bytes);
    // The digest as lower-case hex. The object is spent afterwards.
    std::string finishHex();

  private:
    crypto_hash_sha256_state state_{};
};

// The SHA-256 of the file at path as lower-case hex, or nothing when it cannot be read.
std::optional<std::string> sha256HexOfFile(const std::string& path);

// True for 64 hex digits (either case).
bool isSha256Hex(std::string_view text);

// True when signature is a valid Ed25519 signature of message by publicKey.
bool verifyCatalogSignature(std::string_view message, std::string_view signature,
                            const CatalogPublicKey& publicKey);

// bytes in standard base64 with padding, the form keys take in settings files and on screens.
std::string base64Encode(const std::uint8_t* bytes, std::size_t length);
// The bytes of standard base64 text (white space ignored), or nothing when it is not valid
// base64.
std::optional<std::string> base64Decode(std::string_view text);

}  // namespace tavrix::platform
