// The names a behavior bundle is made of: what the daemon reads in a bundle, and what the
// publishing tool checks before it packs one.
#pragma once

namespace tavrix {

inline constexpr const char* kBundleInfoFileName = "Info.plist";
inline constexpr const char* kBundleVersionKey = "QZBundleVersion";
inline constexpr const char* kBundleIdentifierKey = "QZBundleIdentifier";
// The carrier file every bundle has at its top.
inline constexpr const char* kBaseCarrierFileName = "behavior.plist";

}  // namespace tavrix
