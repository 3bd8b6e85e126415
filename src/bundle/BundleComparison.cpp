#include "bundle/BundleComparison.h"

#include <string_view>
#include <vector>

#include "bundle/BundleLinks.h"
#include "bundle/BundleManager.h"
#include "bundle/VersionCompare.h"
#include "io/Paths.h"
#include "util/FileSystemHelper.h"
#include "util/Log.h"

namespace tavrix {
namespace {

constexpr std::string_view kPlistExtension = ".plist";

// Every piece between delimiters, empty ones included ("+a++b" gives "", "a", "", "b").
std::vector<std::string_view> splitAtDelimiter(std::string_view text) {
    std::vector<std::string_view> tokens;
    std::size_t start = 0;
    while (true) {
        std::size_t end = text.find(kCarrierFileNameDelimiter, start);
        if (end == std::string_view::npos) {
            tokens.push_back(text.substr(start));
            return tokens;
        }
        tokens.push_back(text.substr(start, end - start));
        start = end + 1;
    }
}

// The overlay prefix the name starts with, or empty.
std::string_view overlayPrefixOf(std::string_view fileName) {
    OverlayType type = overlayTypeOfCarrierFileName(fileName);
    return type == kNoOverlay ? std::string_view{} : std::string_view(overlayTypeWord(type));
}

}  // namespace

BundleChangeType changeTypeForOverlayTransition(OverlayType current, OverlayType matched) {
    if (current > kDeviceBehaviorOverlay || matched > kDeviceBehaviorOverlay) {
        logCFormat(LogPriority::Warning,
                   "The overlay types provided are invalid: current %d, new one %d\n",
                   static_cast<int>(current), static_cast<int>(matched));
        return kBundleChangeTypeUnknown;
    }
    OverlayType changedBits = current ^ matched;
    if (changedBits == 0) {
        return kBundleChangeTypeNoChange;
    }
    if ((changedBits & kDeviceOverlay) != 0) {
        return kBundleChangeTypeUpdate;
    }
    return kBundleChangeTypeOverrideSwitch;
}

std::string behaviorIDFromCarrierFileName(const std::string& fileName) {
    if (fileName.empty()) {
        logCFormat("Carrier file name is empty?\n");
        return {};
    }
    std::string_view prefix = overlayPrefixOf(fileName);
    if (prefix.empty()) {
        return {};
    }
    std::vector<std::string_view> tokens =
        splitAtDelimiter(std::string_view(fileName).substr(prefix.size()));
    // "", bundle name, overlay key, [extra identifier,] version + ".plist"
    if (tokens.size() != 4 && tokens.size() != 5) {
        logCFormat(LogPriority::Warning, "Not enough tokens to extract behavior ID\n");
        return {};
    }
    return std::string(tokens[2]);
}

std::string versionFromCarrierFileName(const std::string& fileName) {
    if (fileName.empty()) {
        logCFormat("Carrier file name is empty?\n");
        return {};
    }
    std::string_view prefix = overlayPrefixOf(fileName);
    if (prefix.empty()) {
        logCFormat("There is no overlay for the carrier file: %s\n", fileName.c_str());
        return {};
    }
    std::size_t extension = fileName.find(kPlistExtension);
    if (extension == std::string::npos) {
        logCFormat("plist extension is not present in the carrier file name\n");
        return {};
    }
    // Only the part after the prefix counts: the '+' inside the prefix separates no version.
    std::string_view pieces = std::string_view(fileName).substr(0, extension).substr(prefix.size());
    std::size_t delimiter = pieces.rfind(kCarrierFileNameDelimiter);
    if (delimiter == std::string_view::npos) {
        logCFormat("_ is missing from the carrier file\n");
        return {};
    }
    if (delimiter + 1 == pieces.size()) {
        logCFormat(LogPriority::Warning,
                   "_ is the last character in the string, cannot get the version\n");
        return {};
    }
    return std::string(pieces.substr(delimiter + 1));
}

bool compareCarrierFileNames(const std::string& currentName, const std::string& matchedName) {
    std::string currentID = behaviorIDFromCarrierFileName(currentName);
    if (currentID.empty()) {
        logCFormat("Current carrier file does not have behavior ID: %s\n", currentName.c_str());
        return false;
    }
    std::string matchedID = behaviorIDFromCarrierFileName(matchedName);
    if (matchedID.empty()) {
        logCFormat("Matched carrier file does not have behavior ID: %s\n", matchedName.c_str());
        return false;
    }
    logCFormat("Behavior ID's: current - %s (%s), matched - %s (%s)\n", currentID.c_str(),
               currentName.c_str(), matchedID.c_str(), matchedName.c_str());
    if (currentID != matchedID) {
        return true;
    }
    std::string currentVersion = versionFromCarrierFileName(currentName);
    if (currentVersion.empty()) {
        logCFormat("Current carrier file does not have version: %s\n", currentName.c_str());
        return false;
    }
    std::string matchedVersion = versionFromCarrierFileName(matchedName);
    if (matchedVersion.empty()) {
        logCFormat("Matched carrier file does not have version: %s\n", matchedName.c_str());
        return false;
    }
    logCFormat("Versions in the plist files (%s, %s)\n", currentVersion.c_str(),
               matchedVersion.c_str());
    if (compareVersionStrings(currentVersion, matchedVersion) == -1) {
        logCFormat("New version is higher\n");
        return true;
    }
    return false;
}

bool isCandidateBundleNewer(const CarrierBundle& current, const CarrierBundle& matched) {
    logCFormat("Bundle versions: %s, %s\n", current.bundleVersion.c_str(),
               matched.bundleVersion.c_str());
    if (!current.bundleVersion.empty() && !matched.bundleVersion.empty()) {
        if (compareVersionStrings(current.bundleVersion, matched.bundleVersion) == -1) {
            return true;
        }
    } else {
        logCFormat(
            LogPriority::Warning,
            "Both the versions are not non-empty, cannot compare, existing %s, candidate %s\n",
            current.bundleVersion.c_str(), matched.bundleVersion.c_str());
    }
    // An older matched bundle may still carry another behavior ID: the file names decide.
    std::string currentName = baseNameOfPath(current.carrierFilePath);
    std::string matchedName = baseNameOfPath(matched.carrierFilePath);
    if (currentName == matchedName) {
        return false;
    }
    logCFormat("Carrier path file names (%s, %s) are not matching, checking further\n",
               current.carrierFilePath.c_str(), matched.carrierFilePath.c_str());
    return compareCarrierFileNames(currentName, matchedName);
}

bool bundleLinksExist(const CarrierBundle& bundle) {
    FileSystemHelper fileSystem;
    bool present = fileSystem.fileExists(bundle.bundleLinkPath) &&
                   fileSystem.fileExists(bundle.bundlePath) &&
                   fileSystem.fileExists(bundle.bundleRealPath);
    bool match = readLinkTarget(bundle.bundleLinkPath) == bundle.bundlePath &&
                 io::realPathOf(bundle.bundlePath) == bundle.bundleRealPath;
    bool preferencesPresent = fileSystem.fileExists(bundle.preferencesLinkPath) &&
                              fileSystem.fileExists(readLinkTarget(bundle.preferencesLinkPath));
    logCFormat(
        "Links exist: Bundle links present: %d, Bundle links match: %d, Bundle preferences link "
        "present: %d\n",
        present ? 1 : 0, match ? 1 : 0, preferencesPresent ? 1 : 0);
    return present && match && preferencesPresent;
}

BundleChangeType BundleManager::compareBundles(const CarrierBundle& current,
                                               const CarrierBundle& matched) const {
    if (!bundleLinksExist(current)) {
        logCFormat("Original Bundle Links Do Not Exist. Treat as Carrier Change\n");
        return kBundleChangeTypeUpdate;
    }
    std::string currentID = current.copyBundleIdentifier();
    std::string matchedID = matched.copyBundleIdentifier();
    if (currentID.empty() || matchedID.empty()) {
        logCFormat("No Bundle ID. Carrier Change\n");
        return kBundleChangeTypeUpdate;
    }
    if (currentID != matchedID) {
        logCFormat("Different Bundle IDs??\n");
        return kBundleChangeTypeUpdate;
    }
    if (isCandidateBundleNewer(current, matched)) {
        logCFormat("Newer Bundle Version. Bundle Update\n");
        return kBundleChangeTypeUpdate;
    }
    BundleChangeType result =
        changeTypeForOverlayTransition(current.overlayType, matched.overlayType);
    logCFormat("Same bundles, but carrier file comparison result: %s\n", changeTypeName(result));
    return result;
}

}  // namespace tavrix
