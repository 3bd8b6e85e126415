// The one way the user bundle is replaced, for a client's payload and for a downloaded update:
// the new bundle is assembled beside the old one, in the daemon's own protected directory, and
// renamed into its place, so that a crash leaves the old bundle or the new one.
#pragma once

#include <functional>
#include <string>

namespace tavrix {

// Fills the empty directory at staging with the new bundle's files; false, with the reason in
// whyNot, when it could not be filled whole.
using UserBundleFill = std::function<bool(const std::string& staging, std::string* whyNot)>;

// Whether a bundle that could not be filled whole still replaces the old one (a client's payload
// does: the old bundle is gone even when the new one fails, and what was extracted is used).
enum class IncompleteBundle { Place, Discard };

// Replaces the user bundle with what fill makes. True when it was filled whole and put in place;
// otherwise false with the reason in whyNot (the old bundle stays unless the new one was placed).
bool replaceUserBundle(const UserBundleFill& fill, IncompleteBundle incomplete,
                       std::string* whyNot);

}  // namespace tavrix
