// The publisher's keys and the ways a catalog gets signed: with a secret key file on this machine,
// or by an external signer command (a machine or device that keeps the key), whose answer is
// checked against the public key before anything is published.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "base/Result.h"
#include "catalog/CatalogCrypto.h"
#include "catalog/CatalogTrust.h"

namespace tavrix::tools {

// Makes an Ed25519 key pair: the secret key as 64 raw bytes (mode 0600) and the public key as
// base64 text. Both files are written or neither: never over an existing secret key, and a secret
// key whose public half could not be written is removed again. The public key's base64.
Result<std::string> generateKeyPair(const std::string& secretKeyPath,
                                    const std::string& publicKeyPath);

// The secret key in the file keygen wrote.
Result<catalog::CatalogSecretKey> readSecretKey(const std::string& path);

// The public key in the file keygen wrote, named identifier (its default identifier when empty).
Result<catalog::TrustedCatalogKey> readPublicKey(const std::string& path,
                                                 const std::string& identifier);

// The public half of secretKey.
catalog::CatalogPublicKey publicKeyOf(const catalog::CatalogSecretKey& secretKey);

// Who signs: a secret key, or a command run by /bin/sh that reads the bytes to sign on its
// standard input and writes their 64-byte detached signature on its standard output.
struct CatalogSigner {
    std::optional<catalog::CatalogSecretKey> secretKey;
    std::string command;
    // For a command: the key its signatures must verify with.
    catalog::CatalogPublicKey publicKey{};
};

// The detached signature of bytes, checked with the signer's public key.
Result<std::string> signCatalogBytes(const CatalogSigner& signer, std::string_view bytes);

}  // namespace tavrix::tools
