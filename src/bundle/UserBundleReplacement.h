// How the user bundle's replacement (BundleManager::replaceUserBundle) is filled: the new bundle
// is assembled beside the old one, in the daemon's own protected directory, and renamed into its
// place, so that a crash leaves the old bundle or the new one.
#pragma once

#include <functional>
#include <string>

namespace tavrix {

// How filling the new bundle went: whole; cut short, yet to be used in place of the old one (a
// client's damaged payload: the old bundle is gone even then, and what was extracted is used); or
// refused, the old bundle staying.
enum class BundleFill { Whole, Incomplete, Refused };

// How filling went, with the reason for anything but Whole.
struct BundleFillOutcome {
    BundleFill fill = BundleFill::Whole;
    std::string reason;
};

// Fills the empty directory at staging with the new bundle's files.
using UserBundleFill = std::function<BundleFillOutcome(const std::string& staging)>;

}  // namespace tavrix
