// The preferences store: values by key in named domains of a user, for any host. A domain of a
// user is the property-list file <home>/Library/Preferences/<domain>.plist, whose top level is a
// dictionary.
//
// Reads follow symbolic links and are cached until the file changes or the domain is synchronized.
// A file is never written larger than its reader accepts (plist::kMaxPropertyListBytes).
// Values set are pending until the domain is synchronized, which merges them into the file on disk
// under a lock on the Preferences directory (other processes may write other keys of the same
// domain) and replaces it atomically. A damaged file reads as an empty domain and is logged.
// Safe to use from several threads.
#pragma once

#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "plist/PropertyListFormat.h"
#include "plist/Value.h"

namespace tavrix::device {

class PreferencesStore {
  public:
    // The daemon root's store.
    static PreferencesStore& shared();

    // A store of its own, with nothing cached or pending (tests; another process's view).
    PreferencesStore();
    ~PreferencesStore();
    PreferencesStore(const PreferencesStore&) = delete;
    PreferencesStore& operator=(const PreferencesStore&) = delete;

    // The value for key: the pending one when it was set and not yet synchronized, else the one in
    // the file. Nothing when the key is absent or removed, or the domain or user is invalid.
    std::optional<plist::Value> copyValue(std::string_view key, std::string_view domain,
                                          std::string_view user);

    // Sets the value for key until the next synchronize; nothing removes the key.
    void setValue(std::string_view key, const std::optional<plist::Value>& value,
                  std::string_view domain, std::string_view user);

    // Writes the pending values of the domain to disk and forgets cached reads, so changes made by
    // others are seen. False when the domain could not be written; its pending values are kept.
    [[nodiscard]] bool synchronize(std::string_view domain, std::string_view user);

    // setValue and synchronize in one step; when the domain cannot be written, the value is not
    // kept pending, so that reads answer what is stored.
    [[nodiscard]] bool storeValue(std::string_view key, const std::optional<plist::Value>& value,
                    std::string_view domain, std::string_view user);

  private:
    struct Domain;
    using UserDomains = std::map<std::string, std::unique_ptr<Domain>, std::less<>>;

    // The domain's state, created on first use; null (logged) for an invalid name or unknown user.
    Domain* domainFor(std::string_view domain, std::string_view user);
    // Writes the pending values and forgets cached reads; mutex_ held.
    bool synchronizeLocked(Domain& domain);
    bool writePending(Domain& domain);
    // Logs that the domain's file is damaged, once per version of the file.
    void logDamage(Domain& domain, const Failure& refusal);

    std::mutex mutex_;
    std::map<std::string, UserDomains, std::less<>> users_;
};

}  // namespace tavrix::device
