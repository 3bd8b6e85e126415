// The small enumerations the bundle core passes around, with the texts its log lines use.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>

namespace tavrix {

// Which overlays a carrier file carries: a bit set (device bit 1, behavior bit 2).
using OverlayType = std::uint32_t;
inline constexpr OverlayType kNoOverlay = 0;
inline constexpr OverlayType kDeviceOverlay = 1;
inline constexpr OverlayType kBehaviorOverlay = 2;
inline constexpr OverlayType kDeviceBehaviorOverlay = 3;

// "kNoOverlay" ... "kDeviceBehaviorOverlay"; "kOverlayUnknown" above 3.
const char* overlayTypeName(OverlayType type);
// The word an overridden carrier file name starts with: "device+id+behavior" for both bits,
// else "id+behavior" for the behavior bit, else "device+behavior" for the device bit, else
// "carrier".
const char* overlayTypeWord(OverlayType type);
// The overlay type a carrier file name announces by its prefix at position 0 ("device+id+behavior"
// tested first, then "id+behavior", then "device+behavior"); kNoOverlay for any other name.
OverlayType overlayTypeOfCarrierFileName(std::string_view fileName);

// What an overlay determination did.
enum OverrideResult {
    kOverrideNotRequired = 0,
    kCarrierInfoNotPresent = 1,
    kNoMatchForOverlay = 2,
    kOverrideBundleSuccess = 3,
    kOverrideBundleFailure = 4,
    kOverrideUnknown = 5,
};
// The enumerator's own text; "kOverrideUnknown" for any other value.
const char* overrideResultName(int result);

// What going from the linked bundle to the matched one changes.
enum BundleChangeType : std::int32_t {
    kBundleChangeTypeUnknown = -1,
    kBundleChangeTypeNoChange = 0,
    kBundleChangeTypeUpdate = 1,
    kBundleChangeTypeOverrideSwitch = 2,
};
// The enumerator's own text; "Could not determine the change type" for any other value.
const char* changeTypeName(int changeType);

}  // namespace tavrix
