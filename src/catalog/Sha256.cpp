#include "catalog/Sha256.h"

#include <fcntl.h>
#include <openssl/evp.h>

#include <cerrno>

#include "io/FileIO.h"
#include "io/UniqueFd.h"
#include "util/SharedLibrary.h"

namespace tavrix::catalog {
namespace {

constexpr const char* kLibraryName = "libcrypto.so.3";

struct Crypto {
    decltype(&::EVP_MD_CTX_new) contextNew = nullptr;
    decltype(&::EVP_MD_CTX_free) contextFree = nullptr;
    decltype(&::EVP_sha256) sha256 = nullptr;
    decltype(&::EVP_DigestInit_ex) init = nullptr;
    decltype(&::EVP_DigestUpdate) update = nullptr;
    decltype(&::EVP_DigestFinal_ex) final = nullptr;
};

Result<const Crypto*> loadCrypto() {
    static const LoadedLibrary<Crypto> libcrypto(kLibraryName, "SHA-256 digests are unavailable",
                                                 [](SharedLibrary& library, Crypto& f) {
                                                     library.bind(f.contextNew, "EVP_MD_CTX_new");
                                                     library.bind(f.contextFree, "EVP_MD_CTX_free");
                                                     library.bind(f.sha256, "EVP_sha256");
                                                     library.bind(f.init, "EVP_DigestInit_ex");
                                                     library.bind(f.update, "EVP_DigestUpdate");
                                                     library.bind(f.final, "EVP_DigestFinal_ex");
                                                     return library.allBound();
                                                 });
    return libcrypto.functions();
}

}  // namespace

struct Sha256Digest::Context {
    const Crypto* crypto = nullptr;
    EVP_MD_CTX* state = nullptr;
    bool failed = false;
};

Sha256Digest::Sha256Digest() : context_(std::make_unique<Context>()) {
    Result<const Crypto*> loaded = loadCrypto();
    if (!loaded) {
        context_->failed = true;
        return;
    }
    const Crypto* crypto = *loaded;
    context_->crypto = crypto;
    context_->state = crypto->contextNew();
    context_->failed =
        context_->state == nullptr || crypto->init(context_->state, crypto->sha256(), nullptr) != 1;
}

Sha256Digest::~Sha256Digest() {
    if (context_->state != nullptr) {
        context_->crypto->contextFree(context_->state);
    }
}

void Sha256Digest::update(std::string_view bytes) {
    if (!context_->failed &&
        context_->crypto->update(context_->state, bytes.data(), bytes.size()) != 1) {
        context_->failed = true;
    }
}

std::string Sha256Digest::finishHex() {
    unsigned char digest[EVP_MAX_MD_SIZE];
    unsigned int length = 0;
    if (context_->failed || context_->crypto->final(context_->state, digest, &length) != 1 ||
        length * 2 != kSha256HexLength) {
        context_->failed = true;
        return {};
    }
    context_->failed = true;  // spent
    static constexpr char kHex[] = "0123456789abcdef";
    std::string hex(kSha256HexLength, '\0');
    for (unsigned int i = 0; i < length; ++i) {
        hex[2 * i] = kHex[digest[i] >> 4];
        hex[2 * i + 1] = kHex[digest[i] & 0x0F];
    }
    return hex;
}

std::optional<std::string> sha256HexOfFile(const std::string& path) {
    io::UniqueFd fd = io::openFile(path, O_RDONLY);
    if (!fd) {
        return std::nullopt;
    }
    Sha256Digest digest;
    if (io::readChunks(fd.get(), [&digest](std::string_view chunk) {
            digest.update(chunk);
            return 0;
        }) != 0) {
        return std::nullopt;
    }
    std::string hex = digest.finishHex();
    return hex.empty() ? std::nullopt : std::optional<std::string>(std::move(hex));
}

}  // namespace tavrix::catalog
