#include "publishing/CatalogKeys.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "io/AtomicFile.h"
#include "io/FileIO.h"
#include "io/UniqueFd.h"
#include "plist/PropertyListFormat.h"

namespace tavrix::tools {
namespace {

// A signer that says more than this is not answering with a signature.
constexpr std::size_t kMaxSignerOutputBytes = 4096;

std::string systemError(const std::string& action, const std::string& path, int error) {
    return action + " " + path + ": " + std::strerror(error);
}

// Runs command with input on its standard input; its standard output.
// Its standard error stays the tool's, so what it says reaches the operator.
Result<std::string> runSigner(const std::string& command, std::string_view input) {
    int toChild[2];
    int fromChild[2];
    if (::pipe2(toChild, O_CLOEXEC) != 0) {
        return Failure{std::string("cannot run the signer: ") + std::strerror(errno)};
    }
    io::UniqueFd childInput(toChild[0]), parentOutput(toChild[1]);
    if (::pipe2(fromChild, O_CLOEXEC) != 0) {
        return Failure{std::string("cannot run the signer: ") + std::strerror(errno)};
    }
    io::UniqueFd parentInput(fromChild[0]), childOutput(fromChild[1]);
    const pid_t pid = ::fork();
    if (pid < 0) {
        return Failure{std::string("cannot run the signer: ") + std::strerror(errno)};
    }
    if (pid == 0) {
        if (::dup2(childInput.get(), STDIN_FILENO) < 0 ||
            ::dup2(childOutput.get(), STDOUT_FILENO) < 0) {
            ::_exit(127);
        }
        ::execl("/bin/sh", "sh", "-c", command.c_str(), static_cast<char*>(nullptr));
        ::_exit(127);
    }
    childInput.reset();
    childOutput.reset();
    // A signer that stops reading early must not end the tool with SIGPIPE; its exit status says
    // what went wrong.
    struct sigaction ignore {
    }, previous{};
    ignore.sa_handler = SIG_IGN;
    ::sigaction(SIGPIPE, &ignore, &previous);
    const int writeError = io::writeAll(parentOutput.get(), input);
    ::sigaction(SIGPIPE, &previous, nullptr);
    parentOutput.reset();
    std::string output;
    const int readError = io::readAll(parentInput.get(), output, kMaxSignerOutputBytes);
    int status = 0;
    while (::waitpid(pid, &status, 0) < 0 && errno == EINTR) {
    }
    if (!WIFEXITED(status) || WEXITSTATUS(status) != 0) {
        return Failure{"the signer '" + command + "' failed (" +
                       (WIFEXITED(status) ? "exit status " + std::to_string(WEXITSTATUS(status))
                                          : std::string("killed")) +
                       ")"};
    }
    if (writeError != 0 || readError != 0) {
        return Failure{"the signer '" + command +
                       "' did not read the catalog or answered too much"};
    }
    return output;
}

}  // namespace

Result<std::string> generateKeyPair(const std::string& secretKeyPath,
                                    const std::string& publicKeyPath) {
    if (!catalog::sodiumReady()) {
        return Failure{"libsodium cannot be initialised"};
    }
    catalog::CatalogPublicKey publicKey{};
    catalog::CatalogSecretKey secretKey{};
    crypto_sign_keypair(publicKey.data(), secretKey.data());
    std::string publicText = catalog::base64Encode(publicKey.data(), publicKey.size());
    const int secretError = io::createFileAtomically(
        secretKeyPath,
        std::string_view(reinterpret_cast<const char*>(secretKey.data()), secretKey.size()), 0600);
    sodium_memzero(secretKey.data(), secretKey.size());
    if (secretError != 0) {
        return Failure{systemError("cannot create", secretKeyPath, secretError)};
    }
    if (int publicError = io::replaceFileAtomically(publicKeyPath, publicText + "\n", 0644);
        publicError != 0) {
        // A lone secret key would make the retry refuse to overwrite it.
        ::unlink(secretKeyPath.c_str());
        return Failure{systemError("cannot write", publicKeyPath, publicError)};
    }
    return publicText;
}

Result<catalog::CatalogSecretKey> readSecretKey(const std::string& path) {
    Result<std::string> bytes = plist::readFileBytes(path);
    catalog::CatalogSecretKey key{};
    if (!bytes || bytes->size() != key.size()) {
        return Failure{path + " is not a secret key made by 'tavrix-catalog keygen'"};
    }
    std::memcpy(key.data(), bytes->data(), key.size());
    sodium_memzero(bytes->data(), bytes->size());
    return key;
}

Result<catalog::TrustedCatalogKey> readPublicKey(const std::string& path,
                                                 const std::string& identifier) {
    Result<std::string> text = plist::readFileBytes(path);
    std::optional<std::string> bytes = text ? catalog::base64Decode(*text) : std::nullopt;
    catalog::TrustedCatalogKey key;
    if (!bytes || bytes->size() != key.publicKey.size()) {
        return Failure{path + " is not a public key made by 'tavrix-catalog keygen'"};
    }
    std::memcpy(key.publicKey.data(), bytes->data(), key.publicKey.size());
    key.identifier = identifier.empty() ? catalog::defaultKeyIdentifier(key.publicKey) : identifier;
    return key;
}

catalog::CatalogPublicKey publicKeyOf(const catalog::CatalogSecretKey& secretKey) {
    catalog::CatalogPublicKey publicKey{};
    crypto_sign_ed25519_sk_to_pk(publicKey.data(), secretKey.data());
    return publicKey;
}

Result<std::string> signCatalogBytes(const CatalogSigner& signer, std::string_view bytes) {
    if (!catalog::sodiumReady()) {
        return Failure{"libsodium cannot be initialised"};
    }
    std::string signature(catalog::kCatalogSignatureBytes, '\0');
    catalog::CatalogPublicKey publicKey = signer.publicKey;
    if (signer.secretKey) {
        crypto_sign_detached(reinterpret_cast<unsigned char*>(signature.data()), nullptr,
                             reinterpret_cast<const unsigned char*>(bytes.data()), bytes.size(),
                             signer.secretKey->data());
        publicKey = publicKeyOf(*signer.secretKey);
    } else {
        Result<std::string> answer = runSigner(signer.command, bytes);
        if (!answer) {
            return answer;
        }
        signature = std::move(*answer);
    }
    if (!catalog::verifyCatalogSignature(bytes, signature, publicKey)) {
        return Failure{"the signature does not verify with the public key; nothing was published"};
    }
    return signature;
}

}  // namespace tavrix::tools
