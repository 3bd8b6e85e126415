#include "CatalogVerifier.h"

#include <cstdio>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <nlohmann/json.hpp>

#include "catalog/AssetCatalogFormat.h"
#include "http/HttpTransfer.h"
#include "plist/PropertyListFormat.h"
#include "publishing/CatalogSite.h"

namespace tavrix::tools {
namespace {

namespace fs = std::filesystem;

// Archives of a catalog read from a directory resolve against this base, and are then read from
// the directory; archives listed with an absolute URL are fetched.
constexpr std::string_view kDirectoryBase = "http://published.invalid/";
constexpr std::size_t kMaxSignatureBytes = 4096;
const http::HttpTransferLimits kTransferLimits{15, 1024, 30, 0};

bool isURL(const std::string& source) {
    return source.starts_with("http://") || source.starts_with("https://");
}

// The size and SHA-256 of an archive. Reading stops past the size listed, as a device's download
// does.
Result<std::pair<std::uint64_t, std::string>> measureArchive(const std::string& directory,
                                                             const catalog::CatalogEntry& entry) {
    if (entry.archiveURL.starts_with(kDirectoryBase)) {
        std::string path =
            (fs::path(directory) / entry.archiveURL.substr(kDirectoryBase.size())).string();
        std::error_code code;
        std::uintmax_t size = fs::file_size(path, code);
        std::optional<std::string> digest = catalog::sha256HexOfFile(path);
        if (code || !digest) {
            return Failure{"cannot read " + path};
        }
        return std::make_pair(static_cast<std::uint64_t>(size), *digest);
    }
    catalog::Sha256Digest digest;
    std::uint64_t size = 0;
    Result<> fetched = http::transferHttpBody(
        entry.archiveURL,
        [&](std::string_view bytes) -> Result<> {
            size += bytes.size();
            if (size > entry.archiveSize) {
                return Failure{"it is longer than the " + std::to_string(entry.archiveSize) +
                               " bytes listed"};
            }
            digest.update(bytes);
            return {};
        },
        kTransferLimits);
    if (!fetched) {
        return fetched.failure();
    }
    return std::make_pair(size, digest.finishHex());
}

constexpr double kSecondsPerDay = 86400.0;

const char* verdictName(Verdict verdict) {
    switch (verdict) {
        case Verdict::Good:
            return "good";
        case Verdict::Warning:
            return "warning";
        case Verdict::Bad:
            return "bad";
    }
    return "bad";
}

// The checks that run once the catalog's bytes are in hand; each finding goes into report.
void checkCatalog(const VerifyRequest& request, const std::string& location,
                  const std::string& bytes, VerifyReport& report) {
    Result<plist::Value> catalog = catalog::parseCatalog(bytes);
    if (!catalog) {
        report.problems.push_back("malformed: " + catalog.reason());
        return;
    }
    report.keyID = catalog::catalogKeyID(*catalog);
    catalog::CatalogRefusal refusal;
    if (request.keys.empty()) {
        report.signature = "not checked";
    } else {
        Result<std::string> published =
            readPublished(location + catalog::kCatalogSignatureSuffix, kMaxSignatureBytes);
        std::string signature = published ? *published : std::string();
        if (catalog::verifyWithTrustedKey(bytes, signature, report.keyID, request.keys, refusal)) {
            report.signature = "verified";
        } else {
            report.signature = "refused";
            report.problems.push_back(refusal.what());
        }
    }
    std::optional<catalog::CatalogMetadata> metadata =
        catalog::readCatalogMetadata(*catalog, refusal);
    if (!metadata) {
        report.problems.push_back(refusal.what());
        return;
    }
    report.serial = metadata->serial;
    report.expiresUnixTime = metadata->expires.unixTime();
    const double now = static_cast<double>(std::time(nullptr));
    if (!catalog::checkFreshness(*metadata, plist::Date::fromUnixTime(now), request.minimumSerial,
                                 refusal)) {
        report.problems.push_back(refusal.what());
    } else if (metadata->expires.unixTime() - now < request.warningDays * kSecondsPerDay) {
        report.warnings.push_back("expires within " + std::to_string(request.warningDays) +
                                  " days, at " + catalog::catalogDateText(metadata->expires) +
                                  ": refresh it");
    }
    bool remote = isURL(request.source);
    std::string base = remote ? request.source : std::string(kDirectoryBase) + kCatalogFileName;
    Result<std::vector<catalog::CatalogEntry>> entries =
        catalog::readCatalogEntries(*catalog, base, request.assetType);
    if (!entries) {
        report.problems.push_back("malformed: " + entries.reason());
        return;
    }
    // Devices skip malformed entries; a publisher wants to hear of them.
    std::size_t listed = catalog->find(catalog::kCatalogAssetsKey)->asArray()->size();
    if (entries->size() != listed) {
        report.problems.push_back(std::to_string(listed - entries->size()) + " of " +
                                  std::to_string(listed) +
                                  " entries are malformed and skipped by devices");
    }
    for (const catalog::CatalogEntry& entry : *entries) {
        ArchiveCheck check;
        auto version = entry.attributes.find("Version");
        check.version = version != entry.attributes.end() && version->second.asString() != nullptr
                            ? *version->second.asString()
                            : "";
        check.archive = entry.archiveURL.starts_with(kDirectoryBase)
                            ? entry.archiveURL.substr(kDirectoryBase.size())
                            : entry.archiveURL;
        check.size = entry.archiveSize;
        check.sha256 = entry.archiveSHA256;
        check.rolloutPercent = entry.rolloutPercent;
        auto measured = measureArchive(request.source, entry);
        if (!measured) {
            report.problems.push_back(check.archive + ": " + measured.reason());
        } else if (measured->first != entry.archiveSize) {
            report.problems.push_back(check.archive + ": " + std::to_string(measured->first) +
                                      " bytes, listed as " + std::to_string(entry.archiveSize));
        } else if (measured->second != entry.archiveSHA256) {
            report.problems.push_back(check.archive + ": SHA-256 " + measured->second +
                                      ", listed as " + entry.archiveSHA256);
        } else {
            check.matches = true;
        }
        report.archives.push_back(std::move(check));
    }
}

}  // namespace

std::string catalogLocation(const std::string& source) {
    return isURL(source) ? source : (fs::path(source) / kCatalogFileName).string();
}

Result<std::string> readPublished(const std::string& location, std::size_t maxBytes) {
    if (isURL(location)) {
        return http::fetchHttpBody(location, maxBytes, kTransferLimits);
    }
    Result<std::string> bytes = plist::readFileBytes(location);
    if (!bytes) {
        return Failure{"cannot read " + location + ": " + bytes.reason()};
    }
    return bytes;
}

VerifyReport verifyPublishedCatalog(const VerifyRequest& request) {
    VerifyReport report;
    const std::string location = catalogLocation(request.source);
    Result<std::string> bytes = readPublished(location, catalog::kMaxCatalogBytes);
    if (!bytes) {
        report.problems.push_back("fetch failed: " + bytes.reason());
    } else {
        checkCatalog(request, location, *bytes, report);
    }
    report.verdict = !report.problems.empty()   ? Verdict::Bad
                     : !report.warnings.empty() ? Verdict::Warning
                                                : Verdict::Good;
    return report;
}

void printVerifyReport(const VerifyReport& report, bool json) {
    for (const std::string& problem : report.problems) {
        std::fprintf(stderr, "tavrix-catalog: problem: %s\n", problem.c_str());
    }
    for (const std::string& warning : report.warnings) {
        std::fprintf(stderr, "tavrix-catalog: warning: %s\n", warning.c_str());
    }
    if (json) {
        nlohmann::json archives = nlohmann::json::array();
        for (const ArchiveCheck& check : report.archives) {
            archives.push_back({{"version", check.version},
                                {"archive", check.archive},
                                {"size", check.size},
                                {"sha256", check.sha256},
                                {"rolloutPercent", check.rolloutPercent},
                                {"matches", check.matches}});
        }
        nlohmann::json out{{"verdict", verdictName(report.verdict)},
                           {"signature", report.signature},
                           {"archives", std::move(archives)},
                           {"problems", report.problems},
                           {"warnings", report.warnings}};
        out["serial"] = report.serial ? nlohmann::json(*report.serial) : nlohmann::json();
        out["keyID"] = report.keyID ? nlohmann::json(*report.keyID) : nlohmann::json();
        out["expires"] = report.expiresUnixTime
                             ? nlohmann::json(catalog::catalogDateText(
                                   plist::Date::fromUnixTime(*report.expiresUnixTime)))
                             : nlohmann::json();
        std::printf("%s\n", out.dump(2).c_str());
        return;
    }
    if (!report.signature.empty()) {
        std::printf("signature: %s%s\n", report.signature.c_str(),
                    report.keyID ? (" (key " + *report.keyID + ")").c_str() : "");
    }
    if (report.serial) {
        std::printf("serial: %lld\n", static_cast<long long>(*report.serial));
    }
    if (report.expiresUnixTime) {
        std::printf(
            "expires: %s\n",
            catalog::catalogDateText(plist::Date::fromUnixTime(*report.expiresUnixTime)).c_str());
    }
    for (const ArchiveCheck& check : report.archives) {
        std::printf("archive: %s: version %s, %llu bytes, rollout %d %%, %s\n",
                    check.archive.c_str(), check.version.c_str(),
                    static_cast<unsigned long long>(check.size), check.rolloutPercent,
                    check.matches ? "matches" : "DOES NOT MATCH");
    }
    std::printf("catalog is %s\n", verdictName(report.verdict));
}

}  // namespace tavrix::tools
