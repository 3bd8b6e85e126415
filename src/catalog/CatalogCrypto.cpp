#include "catalog/CatalogCrypto.h"

namespace tavrix::catalog {

bool sodiumReady() {
    static const bool ready = sodium_init() >= 0;
    return ready;
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

}  // namespace tavrix::catalog
