#include "bundle/BundleTypes.h"

namespace tavrix {

const char* overlayTypeName(OverlayType type) {
    switch (type) {
        case kNoOverlay:
            return "kNoOverlay";
        case kDeviceOverlay:
            return "kDeviceOverlay";
        case kBehaviorOverlay:
            return "kBehaviorOverlay";
        case kDeviceBehaviorOverlay:
            return "kDeviceBehaviorOverlay";
        default:
            return "kOverlayUnknown";
    }
}

const char* overlayTypeWord(OverlayType type) {
    if ((type & kDeviceBehaviorOverlay) == kDeviceBehaviorOverlay) {
        return "device+id+behavior";
    }
    if ((type & kBehaviorOverlay) != 0) {
        return "id+behavior";
    }
    if ((type & kDeviceOverlay) != 0) {
        return "device+behavior";
    }
    return "carrier";
}

OverlayType overlayTypeOfCarrierFileName(std::string_view fileName) {
    for (OverlayType type : {kDeviceBehaviorOverlay, kBehaviorOverlay, kDeviceOverlay}) {
        if (fileName.starts_with(overlayTypeWord(type))) {
            return type;
        }
    }
    return kNoOverlay;
}

const char* overrideResultName(int result) {
    switch (result) {
        case kOverrideNotRequired:
            return "kOverrideNotRequired";
        case kCarrierInfoNotPresent:
            return "kCarrierInfoNotPresent";
        case kNoMatchForOverlay:
            return "kNoMatchForOverlay";
        case kOverrideBundleSuccess:
            return "kOverrideBundleSuccess";
        case kOverrideBundleFailure:
            return "kOverrideBundleFailure";
        default:
            return "kOverrideUnknown";
    }
}

const char* changeTypeName(int changeType) {
    switch (changeType) {
        case kBundleChangeTypeUnknown:
            return "kBundleChangeTypeUnknown";
        case kBundleChangeTypeNoChange:
            return "kBundleChangeTypeNoChange";
        case kBundleChangeTypeUpdate:
            return "kBundleChangeTypeUpdate";
        case kBundleChangeTypeOverrideSwitch:
            return "kBundleChangeTypeOverrideSwitch";
        default:
            return "Could not determine the change type";
    }
}

}  // namespace tavrix
