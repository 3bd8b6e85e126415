#include "platform/CatalogCrypto.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <vector>

#include "util/UniqueFd.h"

namespace tavrix::platform {

bool sodiumReady() {
    static const bool ready = sodium_init() >= 0;
    return ready;
}

Sha256Digest::Sha256Digest() {
    sodiumReady();
    crypto_hash_sha256_init(&state_);
}

void Sha256Digest::update(std::string_view bytes) {
    crypto_hash_sha256_update(&state_, reinterpret_cast<const unsigned char*>(bytes.data()),
                              bytes.size());
}

std::string Sha256Digest::finishHex() {
    unsigned char digest[crypto_hash_sha256_BYTES];
    crypto_hash_sha256_final(&state_, digest);
    char hex[kSha256HexLength + 1];
    sodium_bin2hex(hex, sizeof hex, digest, sizeof digest);
    return std::string(hex, kSha256HexLength);
}

std::optional<std::string> sha256HexOfFile(const std::string& path) {
    UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
    if (!fd) {
        return std::nullopt;
    }
    Sha256Digest digest;
    std::vector<char> buffer(1 << 16);
    for (;;) {
        ssize_t count = ::read(fd.get(), buffer.data(), buffer.size());
        if (count < 0 && errno == EINTR) {
            continue;
        }
        if (count < 0) {
            return std::nullopt;
        }
        if (count == 0) {
            return digest.finishHex();
        }
        digest.update(std::string_view(buffer.data(), static_cast<std::size_t>(count)));
    }
}

bool isSha256Hex(std::string_view text) {
    if (text.size() != kSha256HexLength) {
        return false;
    }
    for (char c : text) {
        bool hex = (c >= '0' && c <= '9') || (c >= 'a' && c <= 'f') || (c >= 'A' && c <= 'F');
        if (!hex) {
            return false;
        }
    }
    return true;
}

bool verifyCatalogSignature(std::string_view message, std::string_view signature,
                            const CatalogPublicKey& publicKey) {
    if (!sodiumReady() || signature.size() != kCatalogSignatureBytes) {
        return false;
    }
    return crypto_sign_verify_detached(reinterpret_cast<const unsigned char*>(signature.data()),
                                       reinterpret_cast<const unsigned char*>(message.data()),
                                       message.size(), publicKey.data()) == 0;
}

std::string base64Encode(const std::uint8_t* bytes, std::size_t length) {
    constexpr int kVariant = sodium_base64_VARIANT_ORIGINAL;
    std::string text(sodium_base64_ENCODED_LEN(length, kVariant), '\0');
    sodium_bin2base64(text.data(), text.size(), bytes, length, kVariant);
    text.resize(text.size() - 1);  // the terminating NUL
    return text;
}

std::optional<std::string> base64Decode(std::string_view text) {
    std::string bytes(text.size(), '\0');
    std::size_t length = 0;
    const char* end = nullptr;
    // White space (line breaks in a property list or a key file) is skipped.
    if (sodium_base642bin(reinterpret_cast<unsigned char*>(bytes.data()), bytes.size(), text.data(),
                          text.size(), " \t\r\n", &length, &end,
                          sodium_base64_VARIANT_ORIGINAL) != 0 ||
        end != text.data() + text.size()) {
        return std::nullopt;
    }
    bytes.resize(length);
    return bytes;
}

}  // namespace tavrix::platform
