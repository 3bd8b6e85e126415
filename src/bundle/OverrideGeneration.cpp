#include "bundle/OverrideGeneration.h"

#include <utility>

#include "bundle/BundleLinks.h"
#include "bundle/CarrierFileLoader.h"
#include "bundle/DeviceOverlayFile.h"
#include "bundle/OverlayConfiguration.h"
#include "bundle/OverlayContext.h"
#include "bundle/OverriddenCarrierFile.h"
#include "device/TXUtility.h"
#include "util/Log.h"

namespace tavrix {
namespace {

// What differs between the two determinations: where the overlay key and the overlay dictionary
// come from, and whether the merged result keeps its "BehaviorOverrides" section.
class OverlaySource {
  public:
    virtual ~OverlaySource() = default;
    virtual std::string overlayKey(const OverlayContext& context) = 0;
    virtual std::optional<plist::Dictionary> overlayDictionary(const OverlayContext& context) = 0;
    virtual plist::Dictionary finishMerge(plist::Dictionary merged) { return merged; }
};

class DeviceOverlaySource : public OverlaySource {
  public:
    std::string overlayKey(const OverlayContext&) override {
        std::string model = TXUtility::currentHardwareModel().value_or("");
        if (model.empty()) {
            logCFormat("Model name is empty\n");
        }
        return model;
    }

    std::optional<plist::Dictionary> overlayDictionary(const OverlayContext& context) override {
        std::string directory = dirNameOfPath(context.bundle.carrierFilePath);
        std::optional<std::string> name = findDeviceOverlayFileName(
            directory, kDeviceOverlayFilePrefix, kDeviceOverlayFileExtension, context.overlayKey);
        if (!name) {
            return std::nullopt;
        }
        std::optional<plist::Value> overlay = copyDictionaryFromFile(directory + "/" + *name);
        if (!overlay) {
            return std::nullopt;
        }
        return std::move(*overlay->asDictionary());
    }
};

class BehaviorOverlaySource : public OverlaySource {
  public:
    explicit BehaviorOverlaySource(std::string behaviorID) : behaviorID_(std::move(behaviorID)) {}

    std::string overlayKey(const OverlayContext& context) override {
        configuration_.emplace(behaviorID_, *context.carrierDictionary);
        return configuration_->overlayKey();
    }

    std::optional<plist::Dictionary> overlayDictionary(const OverlayContext&) override {
        if (!configuration_ || configuration_->overrideConfiguration() == nullptr) {
            return std::nullopt;
        }
        return *configuration_->overrideConfiguration();
    }

    // The generated carrier file no longer needs the section it was made from.
    plist::Dictionary finishMerge(plist::Dictionary merged) override {
        return removeBehaviorOverrides(merged);
    }

  private:
    std::string behaviorID_;
    std::optional<BehaviorOverlayConfiguration> configuration_;
};

void pointAtOverriddenFile(OverlayContext& context, const std::string& path) {
    context.bundle.overlayType |= context.overlayType;
    context.bundle.carrierFilePath = path;
}

// The steps both determinations share; context holds the overlay type and the bundle record.
OverrideResult determineOverlay(OverlayContext& context, OverlaySource& source) {
    logCFormat("Loading carrier file %s\n", context.bundle.carrierFilePath.c_str());
    context.carrierDictionary = copyDictionaryFromFile(context.bundle.carrierFilePath);
    if (!context.carrierDictionary) {
        logCFormat(
            LogPriority::Warning,
            "Failed to load the base bundle carrier file itself, carrier info not present\n");
        return kCarrierInfoNotPresent;
    }

    context.overlayKey = source.overlayKey(context);
    if (context.overlayKey.empty()) {
        logCFormat(LogPriority::Warning,
                   "Failed to get overlay matching key, marking override not required\n");
        return kOverrideNotRequired;
    }
    logCFormat("Overlay key: '%s'\n", context.overlayKey.c_str());
    std::optional<plist::Dictionary> overlay = source.overlayDictionary(context);
    if (!overlay) {
        logCFormat("No match for overlay\n");
        return kNoMatchForOverlay;
    }

    std::optional<std::string> path = overriddenFilePath(context);
    if (path && isGeneratedCarrierFile(*path)) {
        logCFormat("Overridden file %s already exists, not generating again\n", path->c_str());
        pointAtOverriddenFile(context, *path);
        return kOverrideBundleSuccess;
    }
    logCFormat("Overridden file does not exist\n");

    plist::Dictionary merged =
        source.finishMerge(mergeDictionaries(*context.carrierDictionary->asDictionary(), *overlay));
    if (!writeOverriddenCarrierFile(plist::Value(std::move(merged)), path)) {
        logCFormat(LogPriority::Warning, "Failed to generate overridden carrier plist\n");
        return kOverrideBundleFailure;
    }
    // The record is read afresh from disk before it takes the new carrier file. The path is
    // copied first: resetting empties the field it would otherwise refer to.
    const std::string bundlePath = context.bundle.bundlePath;
    context.bundle.resetWithPath(bundlePath);
    logCFormat("Successfully generated the carrier plist\n");
    pointAtOverriddenFile(context, *path);
    return kOverrideBundleSuccess;
}

}  // namespace

OverrideResult makeDeviceOverlayDecision(CarrierBundle& bundle, const std::optional<std::string>&) {
    OverlayContext context;
    // Logs what it found and points the context at the base bundle's carrier file.
    findBaseBundle(context, kDeviceOverlay);
    DeviceOverlaySource source;
    OverrideResult result = determineOverlay(context, source);
    bundle = context.bundle;
    return result;
}

OverrideResult applyMultimodeOverlay(CarrierBundle& bundle,
                                     const std::optional<std::string>& behaviorID) {
    OverlayContext context;
    context.overlayType = bundle.overlayType | kBehaviorOverlay;
    context.bundle = bundle;
    BehaviorOverlaySource source(behaviorID.value_or(""));
    OverrideResult result = determineOverlay(context, source);
    bundle = context.bundle;
    return result;
}

}  // namespace tavrix
