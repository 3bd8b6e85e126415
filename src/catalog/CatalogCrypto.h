// The cryptography of the asset catalog, on libsodium: Ed25519 detached signatures of catalogs.
// Archive digests are in Sha256.h.
#pragma once

#include <sodium.h>

#include <array>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "catalog/Sha256.h"

namespace tavrix::catalog {

using CatalogPublicKey = std::array<std::uint8_t, crypto_sign_PUBLICKEYBYTES>;
using CatalogSecretKey = std::array<std::uint8_t, crypto_sign_SECRETKEYBYTES>;
inline constexpr std::size_t kCatalogSignatureBytes = crypto_sign_BYTES;

// Initialises libsodium once for the process; false when it cannot be used.
bool sodiumReady();

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

}  // namespace tavrix::catalog
