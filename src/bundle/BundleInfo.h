// Readers of a bundle's Info dictionary. A bundle is a directory whose Info dictionary is the
// property list "Info.plist" (XML or binary) at its top.
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <utility>

#include "bundle/BundleKeys.h"
#include "plist/PropertyListFormat.h"
#include "plist/Value.h"

namespace tavrix {

// A just-extracted bundle may not show its Info dictionary yet, so value reads try again a few
// times before giving up.
inline constexpr int kBundleInfoRetryCount = 5;
inline constexpr unsigned kBundleInfoRetryDelayMicroseconds = 100;

// One bundle directory. The Info dictionary is looked at on every request and parsed again only
// when the file changed.
class BundleDirectory {
  public:
    explicit BundleDirectory(std::string path) : path_(std::move(path)) {}

    const std::string& path() const { return path_; }
    std::string infoPath() const;
    // The Info dictionary's value for key, nothing when the key is missing; a failure when the
    // dictionary cannot be read (ENOENT: there is none).
    Result<std::optional<plist::Value>> copyInfoValue(std::string_view key) const;

  private:
    std::string path_;
};

// The bundle at path; nothing for an empty path or a path that is no directory.
std::optional<BundleDirectory> createBundleAtPath(const std::string& path);

// The Info value for key of the bundle at path, with the bounded retry above. Nothing at once when
// there is no bundle at path, or after the last attempt.
std::optional<plist::Value> copyBundleInfoValue(const std::string& path, std::string_view key);

// "QZBundleVersion" of the bundle at path, with the retry.
std::optional<plist::Value> copyBundleVersionAtPath(const std::string& path);
// The same for a directory URL, which is the directory's path here (empty: no URL).
std::optional<plist::Value> copyBundleVersionAtURL(const std::string& directoryURL);

// "QZBundleIdentifier" of the bundle at path when it is a string; one attempt, no retry.
std::optional<std::string> copyBundleIdentifierAtPath(const std::string& path);

// An Info value as text: a string as it is, another value by its description, empty for none.
std::string bundleInfoValueText(const std::optional<plist::Value>& value);

}  // namespace tavrix
