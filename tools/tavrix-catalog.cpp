// tavrix-catalog: makes signing keys and publishes behavior bundles as an asset catalog that any
// static HTTP server can serve. Failures are one line on stderr and exit status 1, usage mistakes
// exit status 2.
#include <charconv>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "publishing/CatalogPublisher.h"
#include "publishing/CatalogVerifier.h"

namespace {

using tavrix::tools::BundleToPublish;
using tavrix::tools::PublishRequest;
using tavrix::tools::VerifyRequest;

constexpr int kFailure = 1;
constexpr int kUsage = 2;
constexpr const char* kDefaultAssetType = "com.zandor.Grellas.TavrixBundles";

constexpr const char* kHelp =
    "usage: tavrix-catalog keygen SECRET_KEY_FILE PUBLIC_KEY_FILE\n"
    "       tavrix-catalog publish OUTDIR (--key SECRET_KEY_FILE [--key-id ID] | --unsigned)\n"
    "                      [--asset-type TYPE] [--expires-in DAYS] [--serial N] [--fresh]\n"
    "                      BUNDLE_DIR [BUNDLE_OPTIONS]...\n"
    "       tavrix-catalog verify (URL | OUTDIR) (--key [ID=]PUBLIC_KEY_FILE... | "
    "--allow-unsigned)\n"
    "                      [--asset-type TYPE] [--min-serial N]\n"
    "\n"
    "keygen   makes an Ed25519 key pair. The secret key file (mode 0600) signs catalogs;\n"
    "         the public key is printed and written as base64, the form the TrustedKeys\n"
    "         entries of AssetCatalog.plist take.\n"
    "publish  packs each bundle directory into OUTDIR/archives/NAME-VERSION.tgz and lists it\n"
    "         in OUTDIR/catalog.plist, signed into OUTDIR/catalog.plist.sig. Bundles are\n"
    "         added to the catalog already in OUTDIR; one with the same archive name\n"
    "         replaces its entry. Each publication takes the next serial, which devices\n"
    "         never let go back. Serve OUTDIR with any static HTTP server. A bundle\n"
    "         directory needs an Info.plist with QZBundleIdentifier and QZBundleVersion\n"
    "         strings and a behavior.plist; one without them is refused.\n"
    "verify   checks a published catalog as a device would: signature, expiry, serial, and\n"
    "         the size and SHA-256 of every archive. Exit status 1 on any problem.\n"
    "\n"
    "publish options:\n"
    "  --key FILE         sign with this secret key\n"
    "  --key-id ID        the identifier devices list the key under in TrustedKeys\n"
    "                     (default: the key's own, which a lone PublicKey setting also uses)\n"
    "  --unsigned         publish without a signature (for devices set to AllowUnsigned)\n"
    "  --asset-type TYPE  the catalog's asset type (default com.zandor.Grellas.TavrixBundles)\n"
    "  --expires-in DAYS  devices refuse the catalog after this many days (default 30):\n"
    "                     publish again before then\n"
    "  --serial N         publish under this serial instead of the next one; for a site\n"
    "                     rebuilt from scratch, give one above what devices hold\n"
    "  --fresh            start a new catalog instead of adding to the existing one\n"
    "\n"
    "verify options:\n"
    "  --key [ID=]FILE    a trusted public key (repeatable), named ID or its own identifier\n"
    "  --allow-unsigned   check everything but the signature\n"
    "  --min-serial N     the serial devices already hold: a lower one is a rollback\n"
    "\n"
    "BUNDLE_OPTIONS apply to the bundle directory before them:\n"
    "  --version V        must equal the bundle's Info.plist QZBundleVersion, which is the\n"
    "                     asset's Version\n"
    "  --product-type T   a supported product type (repeatable; none: every product type)\n"
    "  --min-os V         MinimumOSVersion\n"
    "  --max-os V         MaximumOSVersion\n"
    "  --rollout PERCENT  only this share of devices (0-100) see it; raising it adds devices\n"
    "\n"
    "  -h, --help         show this help\n"
    "  --version          show the tool's version (before a command)\n";

int usageError(const std::string& message) {
    std::fprintf(stderr, "tavrix-catalog: %s\nTry 'tavrix-catalog --help'.\n", message.c_str());
    return kUsage;
}

int failure(const std::string& message) {
    std::fprintf(stderr, "tavrix-catalog: %s\n", message.c_str());
    return kFailure;
}

// A whole decimal number from minimum to maximum, or nothing.
std::optional<long long> parseNumber(std::string_view text, long long minimum, long long maximum) {
    long long value = 0;
    auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), value);
    if (error != std::errc() || end != text.data() + text.size() || value < minimum ||
        value > maximum) {
        return std::nullopt;
    }
    return value;
}

int runKeygen(const std::vector<std::string_view>& arguments) {
    if (arguments.size() != 2) {
        return usageError("keygen takes SECRET_KEY_FILE PUBLIC_KEY_FILE");
    }
    std::string error;
    auto publicKey =
        tavrix::tools::generateKeyPair(std::string(arguments[0]), std::string(arguments[1]), error);
    if (!publicKey) {
        return failure(error);
    }
    std::printf("%s\n", publicKey->c_str());
    return 0;
}

int runPublish(const std::vector<std::string_view>& arguments) {
    if (arguments.empty() || arguments[0].starts_with("--")) {
        return usageError("publish needs OUTDIR first");
    }
    PublishRequest request;
    request.outputDirectory = std::string(arguments[0]);
    request.assetType = kDefaultAssetType;
    std::string keyPath;
    bool unsignedCatalog = false;
    for (std::size_t i = 1; i < arguments.size(); ++i) {
        std::string_view argument = arguments[i];
        bool takesValue =
            argument == "--key" || argument == "--asset-type" || argument == "--version" ||
            argument == "--product-type" || argument == "--min-os" || argument == "--max-os" ||
            argument == "--key-id" || argument == "--expires-in" || argument == "--rollout";
        if (takesValue && i + 1 == arguments.size()) {
            return usageError(std::string(argument) + " needs a value");
        }
        std::string value = takesValue ? std::string(arguments[++i]) : std::string();
        bool bundleOption = argument == "--version" || argument == "--product-type" ||
                            argument == "--min-os" || argument == "--max-os" ||
                            argument == "--rollout";
        if (bundleOption && request.bundles.empty()) {
            return usageError(std::string(argument) +
                              " must follow the bundle directory it is for");
        }
        if (argument == "--key") {
            keyPath = value;
        } else if (argument == "--key-id") {
            request.keyIdentifier = value;
        } else if (argument == "--expires-in") {
            std::optional<long long> days = parseNumber(value, 1, 3650);
            if (!days) {
                return usageError("--expires-in takes a number of days from 1 to 3650");
            }
            request.expiresInDays = static_cast<int>(*days);
        } else if (argument == "--serial") {
            std::optional<long long> serial = parseNumber(value, 1, INT64_MAX);
            if (!serial) {
                return usageError("--serial takes a whole number from 1");
            }
            request.serial = *serial;
        } else if (argument == "--rollout") {
            std::optional<long long> percent = parseNumber(value, 0, 100);
            if (!percent) {
                return usageError("--rollout takes a percentage from 0 to 100");
            }
            request.bundles.back().rolloutPercent = static_cast<int>(*percent);
        } else if (argument == "--unsigned") {
            unsignedCatalog = true;
        } else if (argument == "--asset-type") {
            request.assetType = value;
        } else if (argument == "--fresh") {
            request.fresh = true;
        } else if (argument == "--version") {
            request.bundles.back().version = value;
        } else if (argument == "--product-type") {
            request.bundles.back().productTypes.push_back(value);
        } else if (argument == "--min-os") {
            request.bundles.back().minimumOSVersion = value;
        } else if (argument == "--max-os") {
            request.bundles.back().maximumOSVersion = value;
        } else if (argument.starts_with("--")) {
            return usageError("unknown option " + std::string(argument));
        } else {
            request.bundles.push_back(BundleToPublish{std::string(argument), {}, {}, {}, {}, {}});
        }
    }
    if (keyPath.empty() == !unsignedCatalog) {
        return usageError("publish needs exactly one of --key FILE and --unsigned");
    }
    if (unsignedCatalog && !request.keyIdentifier.empty()) {
        return usageError("--key-id names the signing key; there is none with --unsigned");
    }
    if (request.bundles.empty()) {
        return usageError("publish needs at least one BUNDLE_DIR");
    }
    if (!keyPath.empty()) {
        std::string error;
        request.secretKey = tavrix::tools::readSecretKey(keyPath, error);
        if (!request.secretKey) {
            return failure(error);
        }
    }
    if (auto error = tavrix::tools::publishCatalog(request)) {
        return failure(*error);
    }
    return 0;
}

int runVerify(const std::vector<std::string_view>& arguments) {
    if (arguments.empty() || arguments[0].starts_with("--")) {
        return usageError("verify needs URL or OUTDIR first");
    }
    VerifyRequest request;
    request.source = std::string(arguments[0]);
    request.assetType = kDefaultAssetType;
    for (std::size_t i = 1; i < arguments.size(); ++i) {
        std::string_view argument = arguments[i];
        if (argument == "--allow-unsigned") {
            request.allowUnsigned = true;
            continue;
        }
        if (i + 1 == arguments.size()) {
            return usageError(std::string(argument) + " needs a value");
        }
        std::string value(arguments[++i]);
        if (argument == "--key") {
            std::size_t equals = value.find('=');
            std::string identifier = equals == std::string::npos ? "" : value.substr(0, equals);
            std::string path = equals == std::string::npos ? value : value.substr(equals + 1);
            std::string error;
            auto key = tavrix::tools::readPublicKey(path, identifier, error);
            if (!key) {
                return failure(error);
            }
            request.keys.push_back(*key);
        } else if (argument == "--asset-type") {
            request.assetType = value;
        } else if (argument == "--min-serial") {
            std::optional<long long> serial = parseNumber(value, 0, INT64_MAX);
            if (!serial) {
                return usageError("--min-serial takes a whole number");
            }
            request.minimumSerial = *serial;
        } else {
            return usageError("unknown option " + std::string(argument));
        }
    }
    if (request.keys.empty() == !request.allowUnsigned) {
        return usageError("verify needs --key FILE (one or more) or --allow-unsigned");
    }
    return tavrix::tools::verifyPublishedCatalog(request) ? 0 : kFailure;
}

}  // namespace

int main(int argc, char** argv) {
    std::vector<std::string_view> arguments(argv + 1, argv + argc);
    for (std::string_view argument : arguments) {
        if (argument == "--help" || argument == "-h") {
            std::fputs(kHelp, stdout);
            return 0;
        }
    }
    // Only before a command: after a bundle directory, --version is that bundle's.
    if (!arguments.empty() && arguments.front() == "--version") {
        std::printf("tavrix-catalog %s\n", TAVRIX_VERSION);
        return 0;
    }
    if (arguments.empty()) {
        return usageError("a command is needed");
    }
    std::string_view command = arguments.front();
    arguments.erase(arguments.begin());
    if (command == "keygen") {
        return runKeygen(arguments);
    }
    if (command == "publish") {
        return runPublish(arguments);
    }
    if (command == "verify") {
        return runVerify(arguments);
    }
    return usageError("unknown command " + std::string(command));
}
