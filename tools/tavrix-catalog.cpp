// tavrix-catalog: makes signing keys and publishes behavior bundles as an asset catalog that any
// static HTTP server can serve. Failures are one line on stderr and exit status 1, usage mistakes
// exit status 2.
#include <cstdio>
#include <cstring>
#include <string>
#include <string_view>
#include <vector>

#include "catalog/CatalogPublisher.h"

namespace {

using tavrix::tools::BundleToPublish;
using tavrix::tools::PublishRequest;

constexpr int kFailure = 1;
constexpr int kUsage = 2;
constexpr const char* kDefaultAssetType = "com.zandor.Grellas.TavrixBundles";

constexpr const char* kHelp =
    "usage: tavrix-catalog keygen SECRET_KEY_FILE PUBLIC_KEY_FILE\n"
    "       tavrix-catalog publish OUTDIR (--key SECRET_KEY_FILE | --unsigned)\n"
    "                      [--asset-type TYPE] [--fresh] BUNDLE_DIR [BUNDLE_OPTIONS]...\n"
    "\n"
    "keygen   makes an Ed25519 key pair. The secret key file (mode 0600) signs catalogs;\n"
    "         the public key is printed and written as base64, the form the PublicKey\n"
    "         setting of AssetCatalog.plist takes.\n"
    "publish  packs each bundle directory into OUTDIR/archives/NAME-VERSION.tgz and lists it\n"
    "         in OUTDIR/catalog.plist, signed into OUTDIR/catalog.plist.sig. Bundles are\n"
    "         added to the catalog already in OUTDIR; one with the same archive name\n"
    "         replaces its entry. Serve OUTDIR with any static HTTP server. A bundle\n"
    "         directory needs an Info.plist with QZBundleIdentifier and QZBundleVersion\n"
    "         strings and a behavior.plist; one without them is refused.\n"
    "\n"
    "publish options:\n"
    "  --key FILE         sign with this secret key\n"
    "  --unsigned         publish without a signature (for devices with no PublicKey)\n"
    "  --asset-type TYPE  the catalog's asset type (default com.zandor.Grellas.TavrixBundles)\n"
    "  --fresh            start a new catalog instead of adding to the existing one\n"
    "\n"
    "BUNDLE_OPTIONS apply to the bundle directory before them:\n"
    "  --version V        must equal the bundle's Info.plist QZBundleVersion, which is the\n"
    "                     asset's Version\n"
    "  --product-type T   a supported product type (repeatable; none: every product type)\n"
    "  --min-os V         MinimumOSVersion\n"
    "  --max-os V         MaximumOSVersion\n"
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
        bool takesValue = argument == "--key" || argument == "--asset-type" ||
                          argument == "--version" || argument == "--product-type" ||
                          argument == "--min-os" || argument == "--max-os";
        if (takesValue && i + 1 == arguments.size()) {
            return usageError(std::string(argument) + " needs a value");
        }
        std::string value = takesValue ? std::string(arguments[++i]) : std::string();
        bool bundleOption = argument == "--version" || argument == "--product-type" ||
                            argument == "--min-os" || argument == "--max-os";
        if (bundleOption && request.bundles.empty()) {
            return usageError(std::string(argument) +
                              " must follow the bundle directory it is for");
        }
        if (argument == "--key") {
            keyPath = value;
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
            request.bundles.push_back(BundleToPublish{std::string(argument), {}, {}, {}, {}});
        }
    }
    if (keyPath.empty() == !unsignedCatalog) {
        return usageError("publish needs exactly one of --key FILE and --unsigned");
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
    return usageError("unknown command " + std::string(command));
}
