// tavrix-catalog: makes signing keys and publishes behavior bundles as an asset catalog that any
// static HTTP server can serve, and runs the catalog through its releases. Failures are one line
// on stderr and exit status 1, usage mistakes exit status 2; verify answers 3 for a catalog that
// is good but needs attention soon.
#include <getopt.h>
#include <unistd.h>

#include <algorithm>
#include <charconv>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "catalog/AssetCatalogFormat.h"
#include "catalog/CatalogRollout.h"
#include "io/FileIO.h"
#include "publishing/CatalogEdits.h"
#include "publishing/CatalogKeys.h"
#include "publishing/CatalogListing.h"
#include "publishing/CatalogPublisher.h"
#include "publishing/CatalogSite.h"
#include "publishing/CatalogVerifier.h"

namespace {

using tavrix::tools::BundleToPublish;
using tavrix::tools::Completion;
using tavrix::tools::PublishRequest;
using tavrix::tools::Verdict;
using tavrix::tools::VerifyRequest;

constexpr int kFailure = 1;
constexpr int kUsage = 2;
constexpr int kWarning = 3;
constexpr const char* kDefaultAssetType = "com.zandor.Grellas.TavrixBundles";

constexpr const char* kHelp =
    "usage: tavrix-catalog keygen SECRET_KEY_FILE PUBLIC_KEY_FILE\n"
    "       tavrix-catalog publish SITE SIGNING [--asset-type TYPE] [--expires-in DAYS]\n"
    "                      [--serial N] [--fresh] BUNDLE_DIR [BUNDLE_OPTIONS]...\n"
    "       tavrix-catalog refresh SITE SIGNING [--expires-in DAYS]\n"
    "       tavrix-catalog withdraw SITE VERSION SIGNING [--expires-in DAYS]\n"
    "       tavrix-catalog rollout SITE VERSION PERCENT SIGNING [--expires-in DAYS]\n"
    "       tavrix-catalog sign SITE (--key SECRET_KEY_FILE | --signer COMMAND --public-key FILE)\n"
    "       tavrix-catalog sign-stdin --key SECRET_KEY_FILE\n"
    "       tavrix-catalog show (URL | SITE)                   (also: list)\n"
    "       tavrix-catalog verify (URL | SITE) (--key [ID=]PUBLIC_KEY_FILE... | --allow-unsigned)\n"
    "                      [--asset-type TYPE] [--min-serial N] [--warn-days DAYS] [--json]\n"
    "       tavrix-catalog bucket SERIAL_NUMBER VERSION\n"
    "\n"
    "SIGNING is one of:\n"
    "  --key FILE [--key-id ID]  sign now with this secret key; ID is what devices list the key\n"
    "                            under in TrustedKeys (default: the key's own identifier)\n"
    "  --stage --key-id ID       stop before signing: write SITE/catalog.plist.unsigned for the\n"
    "                            key ID and leave the served catalog alone until 'sign'\n"
    "  --unsigned                publish without a signature (for devices set to AllowUnsigned)\n"
    "\n"
    "keygen     makes an Ed25519 key pair, both files or neither. The secret key file (mode\n"
    "           0600) signs catalogs; the public key is printed and written as base64, the form\n"
    "           the TrustedKeys entries of AssetCatalog.plist take.\n"
    "publish    packs each bundle directory into SITE/archives/NAME-VERSION-SHA256.tgz (a file\n"
    "           is never rewritten) and lists it in SITE/catalog.plist, replacing an entry of\n"
    "           the same version. A bundle directory needs an Info.plist with\n"
    "           QZBundleIdentifier and QZBundleVersion strings and a behavior.plist.\n"
    "refresh    the same assets under a new serial and expiry.\n"
    "withdraw   leaves VERSION out of the catalog.\n"
    "rollout    offers VERSION to PERCENT (0-100) of the devices, without repacking.\n"
    "sign       signs SITE/catalog.plist.unsigned and puts it live. COMMAND is run by /bin/sh,\n"
    "           reads the catalog on stdin and writes its 64-byte signature on stdout; the\n"
    "           signature must verify with the public key before anything is published.\n"
    "sign-stdin writes the signature of stdin to stdout: the other end of --signer.\n"
    "show       what a catalog holds: serial, expiry, key, versions and their rollout.\n"
    "verify     checks a published catalog as a device would: signature, expiry, serial, and\n"
    "           the size and SHA-256 of every archive. Problems go to stderr. Exit status 0:\n"
    "           good, 3: good but expiring within the warning window, 1: bad.\n"
    "bucket     prints a device's rollout bucket (0-99) for VERSION: the device takes part in a\n"
    "           rollout of PERCENT when its bucket is below PERCENT.\n"
    "\n"
    "Every command that writes a catalog gives it the serial after the one it replaces, which\n"
    "devices never let go back, and an expiry --expires-in DAYS (1-3650, default 30) from now;\n"
    "publish --serial N sets the serial, for a site rebuilt from scratch; --fresh starts a new\n"
    "catalog. Archives that neither the new catalog nor the one it replaced lists are removed.\n"
    "\n"
    "BUNDLE_OPTIONS apply to the bundle directory before them:\n"
    "  --version V        must equal the bundle's Info.plist QZBundleVersion, which is the\n"
    "                     asset's Version\n"
    "  --product-type T   a supported product type (repeatable; none: every product type)\n"
    "  --min-os V         MinimumOSVersion\n"
    "  --max-os V         MaximumOSVersion\n"
    "  --rollout PERCENT  only this share of devices (0-100) see it; raising it adds devices\n"
    "\n"
    "verify options:\n"
    "  --key [ID=]FILE    a trusted public key (repeatable), named ID or its own identifier\n"
    "  --allow-unsigned   check everything but the signature\n"
    "  --min-serial N     the serial devices already hold: a lower one is a rollback\n"
    "  --warn-days DAYS   warn when the catalog expires within DAYS (default 7)\n"
    "  --json             the report as one JSON object\n"
    "\n"
    "Options take their value as '--opt value' or '--opt=value'; after '--' every argument is an\n"
    "operand.\n"
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

// Option codes; operands come as kOperand, in their place among the options.
enum Code : int {
    kOperand = 1,
    kHelpCode = 'h',
    kKey = 256,
    kKeyID,
    kStage,
    kUnsigned,
    kAssetType,
    kExpiresIn,
    kSerial,
    kFresh,
    kVersion,
    kProductType,
    kMinOS,
    kMaxOS,
    kRollout,
    kSigner,
    kPublicKey,
    kAllowUnsigned,
    kMinSerial,
    kWarnDays,
    kJson,
};

struct Argument {
    int code;
    std::string value;
};

const option kAllOptions[] = {
    {"help", no_argument, nullptr, kHelpCode},
    {"key", required_argument, nullptr, kKey},
    {"key-id", required_argument, nullptr, kKeyID},
    {"stage", no_argument, nullptr, kStage},
    {"unsigned", no_argument, nullptr, kUnsigned},
    {"asset-type", required_argument, nullptr, kAssetType},
    {"expires-in", required_argument, nullptr, kExpiresIn},
    {"serial", required_argument, nullptr, kSerial},
    {"fresh", no_argument, nullptr, kFresh},
    {"version", required_argument, nullptr, kVersion},
    {"product-type", required_argument, nullptr, kProductType},
    {"min-os", required_argument, nullptr, kMinOS},
    {"max-os", required_argument, nullptr, kMaxOS},
    {"rollout", required_argument, nullptr, kRollout},
    {"signer", required_argument, nullptr, kSigner},
    {"public-key", required_argument, nullptr, kPublicKey},
    {"allow-unsigned", no_argument, nullptr, kAllowUnsigned},
    {"min-serial", required_argument, nullptr, kMinSerial},
    {"warn-days", required_argument, nullptr, kWarnDays},
    {"json", no_argument, nullptr, kJson},
};

// The command's options, in the order given, with operands among them: the position of a bundle's
// options after its directory matters. Only the codes in allowed are taken; nothing, with error
// set, for anything else.
std::optional<std::vector<Argument>> parseArguments(int argc, char** argv,
                                                    const std::vector<int>& allowed,
                                                    std::string& error) {
    std::vector<option> options;
    for (const option& candidate : kAllOptions) {
        if (candidate.val == kHelpCode ||
            std::find(allowed.begin(), allowed.end(), candidate.val) != allowed.end()) {
            options.push_back(candidate);
        }
    }
    options.push_back({nullptr, 0, nullptr, 0});
    std::vector<Argument> arguments;
    opterr = 0;
    optind = 1;
    // "-": operands are returned in place; ":": a missing value is told from an unknown option.
    for (int code; (code = getopt_long(argc, argv, "-:h", options.data(), nullptr)) != -1;) {
        if (code == '?' || code == ':') {
            std::string given = argv[optind - 1];
            error = code == ':' ? given + " needs a value" : "unknown option " + given;
            return std::nullopt;
        }
        arguments.push_back({code, optarg != nullptr ? optarg : ""});
    }
    for (; optind < argc; ++optind) {
        arguments.push_back({kOperand, argv[optind]});
    }
    return arguments;
}

bool wantsHelp(const std::vector<Argument>& arguments) {
    return std::any_of(arguments.begin(), arguments.end(),
                       [](const Argument& a) { return a.code == kHelpCode; });
}

std::vector<std::string> operandsOf(const std::vector<Argument>& arguments) {
    std::vector<std::string> operands;
    for (const Argument& argument : arguments) {
        if (argument.code == kOperand) {
            operands.push_back(argument.value);
        }
    }
    return operands;
}

const std::vector<int> kSigningCodes{kKey, kKeyID, kStage, kUnsigned, kExpiresIn};

// The signing options and --expires-in, shared by every command that writes a catalog. Nothing
// (with the exit status in status) when they do not fit together or the key cannot be read.
std::optional<Completion> completionFrom(const std::vector<Argument>& arguments, int& status) {
    Completion completion;
    std::string keyPath;
    bool stage = false;
    bool unsignedCatalog = false;
    for (const Argument& argument : arguments) {
        if (argument.code == kKey) {
            keyPath = argument.value;
        } else if (argument.code == kKeyID) {
            completion.keyIdentifier = argument.value;
        } else if (argument.code == kStage) {
            stage = true;
        } else if (argument.code == kUnsigned) {
            unsignedCatalog = true;
        } else if (argument.code == kExpiresIn) {
            std::optional<long long> days = parseNumber(argument.value, 1, 3650);
            if (!days) {
                status = usageError("--expires-in takes a number of days from 1 to 3650");
                return std::nullopt;
            }
            completion.expiresInDays = static_cast<int>(*days);
        }
    }
    if ((keyPath.empty() ? 0 : 1) + (stage ? 1 : 0) + (unsignedCatalog ? 1 : 0) != 1) {
        status = usageError("give exactly one of --key FILE, --stage and --unsigned");
        return std::nullopt;
    }
    if (unsignedCatalog && !completion.keyIdentifier.empty()) {
        status = usageError("--key-id names the signing key; there is none with --unsigned");
        return std::nullopt;
    }
    if (stage && completion.keyIdentifier.empty()) {
        status = usageError("--stage needs --key-id ID: the key that will sign it");
        return std::nullopt;
    }
    completion.mode = stage             ? Completion::Mode::Stage
                      : unsignedCatalog ? Completion::Mode::Unsigned
                                        : Completion::Mode::SignNow;
    if (!keyPath.empty()) {
        auto secretKey = tavrix::tools::readSecretKey(keyPath);
        if (!secretKey) {
            status = failure(secretKey.reason());
            return std::nullopt;
        }
        completion.signer = tavrix::tools::CatalogSigner{*secretKey, {}, {}};
    }
    return completion;
}

int finish(const tavrix::Result<>& done) {
    return done ? 0 : failure(done.reason());
}

int runKeygen(const std::vector<Argument>& arguments) {
    std::vector<std::string> operands = operandsOf(arguments);
    if (operands.size() != 2) {
        return usageError("keygen takes SECRET_KEY_FILE PUBLIC_KEY_FILE");
    }
    auto publicKey = tavrix::tools::generateKeyPair(operands[0], operands[1]);
    if (!publicKey) {
        return failure(publicKey.reason());
    }
    std::printf("%s\n", publicKey->c_str());
    return 0;
}

int runPublish(const std::vector<Argument>& arguments) {
    PublishRequest request;
    request.assetType = kDefaultAssetType;
    int status = 0;
    std::optional<Completion> completion = completionFrom(arguments, status);
    if (!completion) {
        return status;
    }
    request.completion = *completion;
    for (const Argument& argument : arguments) {
        const std::string& value = argument.value;
        const bool bundleOption = argument.code == kVersion || argument.code == kProductType ||
                                  argument.code == kMinOS || argument.code == kMaxOS ||
                                  argument.code == kRollout;
        if (bundleOption && request.bundles.empty()) {
            return usageError("bundle options must follow the bundle directory they are for");
        }
        switch (argument.code) {
            case kOperand:
                if (request.outputDirectory.empty()) {
                    request.outputDirectory = value;
                } else {
                    request.bundles.push_back(BundleToPublish{value, {}, {}, {}, {}, {}});
                }
                break;
            case kSerial: {
                std::optional<long long> serial = parseNumber(value, 1, INT64_MAX);
                if (!serial) {
                    return usageError("--serial takes a whole number from 1");
                }
                request.completion.serial = *serial;
                break;
            }
            case kRollout: {
                std::optional<long long> percent = parseNumber(value, 0, 100);
                if (!percent) {
                    return usageError("--rollout takes a percentage from 0 to 100");
                }
                request.bundles.back().rolloutPercent = static_cast<int>(*percent);
                break;
            }
            case kAssetType:
                request.assetType = value;
                break;
            case kFresh:
                request.fresh = true;
                break;
            case kVersion:
                request.bundles.back().version = value;
                break;
            case kProductType:
                request.bundles.back().productTypes.push_back(value);
                break;
            case kMinOS:
                request.bundles.back().minimumOSVersion = value;
                break;
            case kMaxOS:
                request.bundles.back().maximumOSVersion = value;
                break;
            default:
                break;
        }
    }
    if (request.outputDirectory.empty() || request.bundles.empty()) {
        return usageError("publish needs SITE and at least one BUNDLE_DIR");
    }
    return finish(tavrix::tools::publishCatalog(request));
}

// refresh, withdraw and rollout: operands after SITE, then the change.
int runEdit(const std::string& command, const std::vector<Argument>& arguments) {
    std::vector<std::string> operands = operandsOf(arguments);
    const std::size_t wanted = command == "refresh" ? 1 : command == "withdraw" ? 2 : 3;
    if (operands.size() != wanted) {
        return usageError(command == "refresh"    ? "refresh takes SITE"
                          : command == "withdraw" ? "withdraw takes SITE VERSION"
                                                  : "rollout takes SITE VERSION PERCENT");
    }
    int status = 0;
    std::optional<Completion> completion = completionFrom(arguments, status);
    if (!completion) {
        return status;
    }
    if (command == "refresh") {
        return finish(tavrix::tools::refreshCatalog(operands[0], *completion));
    }
    if (command == "withdraw") {
        return finish(tavrix::tools::withdrawVersion(operands[0], operands[1], *completion));
    }
    std::optional<long long> percent = parseNumber(operands[2], 0, 100);
    if (!percent) {
        return usageError("PERCENT is a whole number from 0 to 100");
    }
    return finish(tavrix::tools::setRollout(operands[0], operands[1], static_cast<int>(*percent),
                                            *completion));
}

// --key FILE, or --signer COMMAND with --public-key FILE.
std::optional<tavrix::tools::CatalogSigner> signerFrom(const std::vector<Argument>& arguments,
                                                       bool commandAllowed, int& status) {
    std::string keyPath, command, publicKeyPath;
    for (const Argument& argument : arguments) {
        keyPath = argument.code == kKey ? argument.value : keyPath;
        command = argument.code == kSigner ? argument.value : command;
        publicKeyPath = argument.code == kPublicKey ? argument.value : publicKeyPath;
    }
    tavrix::tools::CatalogSigner signer;
    if (!keyPath.empty() && command.empty() && publicKeyPath.empty()) {
        auto secretKey = tavrix::tools::readSecretKey(keyPath);
        if (!secretKey) {
            status = failure(secretKey.reason());
            return std::nullopt;
        }
        signer.secretKey = *secretKey;
    } else if (commandAllowed && keyPath.empty() && !command.empty() && !publicKeyPath.empty()) {
        signer.command = command;
        auto publicKey = tavrix::tools::readPublicKey(publicKeyPath, "");
        if (!publicKey) {
            status = failure(publicKey.reason());
            return std::nullopt;
        }
        signer.publicKey = publicKey->publicKey;
    } else {
        status = usageError(commandAllowed
                                ? "give --key FILE, or --signer COMMAND with --public-key FILE"
                                : "give --key FILE");
        return std::nullopt;
    }
    return signer;
}

int runSign(const std::vector<Argument>& arguments) {
    std::vector<std::string> operands = operandsOf(arguments);
    if (operands.size() != 1) {
        return usageError("sign takes SITE");
    }
    int status = 0;
    auto signer = signerFrom(arguments, true, status);
    return signer ? finish(tavrix::tools::signStagedCatalog(operands[0], *signer)) : status;
}

int runSignStdin(const std::vector<Argument>& arguments) {
    if (!operandsOf(arguments).empty()) {
        return usageError("sign-stdin takes no operands");
    }
    int status = 0;
    auto signer = signerFrom(arguments, false, status);
    if (!signer) {
        return status;
    }
    std::string bytes;
    if (int error = tavrix::io::readAll(STDIN_FILENO, bytes, tavrix::catalog::kMaxCatalogBytes);
        error != 0) {
        return failure(std::string("cannot read the catalog on stdin: ") + std::strerror(error));
    }
    auto signature = tavrix::tools::signCatalogBytes(*signer, bytes);
    if (!signature) {
        return failure(signature.reason());
    }
    return std::fwrite(signature->data(), 1, signature->size(), stdout) == signature->size() &&
                   std::fflush(stdout) == 0
               ? 0
               : failure("cannot write the signature");
}

int runShow(const std::vector<Argument>& arguments) {
    std::vector<std::string> operands = operandsOf(arguments);
    if (operands.size() != 1) {
        return usageError("show takes URL or SITE");
    }
    return finish(tavrix::tools::showCatalog(operands[0]));
}

int runVerify(const std::vector<Argument>& arguments) {
    std::vector<std::string> operands = operandsOf(arguments);
    if (operands.size() != 1) {
        return usageError("verify takes URL or SITE");
    }
    VerifyRequest request;
    request.source = operands[0];
    request.assetType = kDefaultAssetType;
    bool json = false;
    for (const Argument& argument : arguments) {
        const std::string& value = argument.value;
        if (argument.code == kKey) {
            std::size_t equals = value.find('=');
            std::string identifier = equals == std::string::npos ? "" : value.substr(0, equals);
            std::string path = equals == std::string::npos ? value : value.substr(equals + 1);
            auto key = tavrix::tools::readPublicKey(path, identifier);
            if (!key) {
                return failure(key.reason());
            }
            request.keys.push_back(*key);
        } else if (argument.code == kAllowUnsigned) {
            request.allowUnsigned = true;
        } else if (argument.code == kAssetType) {
            request.assetType = value;
        } else if (argument.code == kJson) {
            json = true;
        } else if (argument.code == kMinSerial || argument.code == kWarnDays) {
            std::optional<long long> number = parseNumber(value, 0, INT64_MAX);
            if (!number || (argument.code == kWarnDays && *number > 3650)) {
                return usageError(argument.code == kMinSerial
                                      ? "--min-serial takes a whole number"
                                      : "--warn-days takes a number of days from 0 to 3650");
            }
            if (argument.code == kMinSerial) {
                request.minimumSerial = *number;
            } else {
                request.warningDays = static_cast<int>(*number);
            }
        }
    }
    if (request.keys.empty() == !request.allowUnsigned) {
        return usageError("verify needs --key FILE (one or more) or --allow-unsigned");
    }
    tavrix::tools::VerifyReport report = tavrix::tools::verifyPublishedCatalog(request);
    tavrix::tools::printVerifyReport(report, json);
    return report.verdict == Verdict::Good      ? 0
           : report.verdict == Verdict::Warning ? kWarning
                                                : kFailure;
}

int runBucket(const std::vector<Argument>& arguments) {
    std::vector<std::string> operands = operandsOf(arguments);
    if (operands.size() != 2 || operands[0].empty()) {
        return usageError("bucket takes SERIAL_NUMBER VERSION");
    }
    std::printf("%d\n", tavrix::catalog::rolloutBucket(operands[0], operands[1]));
    return 0;
}

struct Command {
    const char* name;
    std::vector<int> options;
    int (*run)(const std::vector<Argument>&);
};

}  // namespace

int main(int argc, char** argv) {
    if (argc < 2) {
        return usageError("a command is needed");
    }
    const std::string command = argv[1];
    if (command == "--help" || command == "-h") {
        std::fputs(kHelp, stdout);
        return 0;
    }
    // Only before a command: after a bundle directory, --version is that bundle's.
    if (command == "--version") {
        std::printf("tavrix-catalog %s\n", TAVRIX_VERSION);
        return 0;
    }
    std::vector<int> publishOptions = kSigningCodes;
    publishOptions.insert(publishOptions.end(), {kAssetType, kSerial, kFresh, kVersion,
                                                 kProductType, kMinOS, kMaxOS, kRollout});
    const std::vector<Command> commands{
        {"keygen", {}, runKeygen},
        {"publish", publishOptions, runPublish},
        {"refresh", kSigningCodes, [](const auto& a) { return runEdit("refresh", a); }},
        {"withdraw", kSigningCodes, [](const auto& a) { return runEdit("withdraw", a); }},
        {"rollout", kSigningCodes, [](const auto& a) { return runEdit("rollout", a); }},
        {"sign", {kKey, kSigner, kPublicKey}, runSign},
        {"sign-stdin", {kKey}, runSignStdin},
        {"show", {}, runShow},
        {"list", {}, runShow},
        {"verify", {kKey, kAllowUnsigned, kAssetType, kMinSerial, kWarnDays, kJson}, runVerify},
        {"bucket", {}, runBucket},
    };
    for (const Command& candidate : commands) {
        if (command != candidate.name) {
            continue;
        }
        std::string error;
        auto arguments = parseArguments(argc - 1, argv + 1, candidate.options, error);
        if (!arguments) {
            return usageError(command + ": " + error);
        }
        if (wantsHelp(*arguments)) {
            std::fputs(kHelp, stdout);
            return 0;
        }
        return candidate.run(*arguments);
    }
    return usageError("unknown command " + command);
}
