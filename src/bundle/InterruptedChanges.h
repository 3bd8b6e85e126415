// What a change of the bundles leaves behind when the process dies in the middle of it, and its
// removal at start-up: temporary link names, half-written generated files, the staged payload
// archive and a payload extracted only in part.
#pragma once

#include <string>

namespace tavrix {

// Removes every such leftover beside the two links, in the generated-files directory and in the
// payload's staging places; logs each removal. Runs before the links are read.
void removeLeftoversOfInterruptedChanges(const std::string& bundleLink,
                                         const std::string& preferencesLink);

// Removes generated carrier files (in the generated-files directory) whose bundle version is no
// longer that of an installed bundle, except keep; logs each removal.
void pruneOverriddenFilesOfRemovedBundles(const std::string& keep);

}  // namespace tavrix
