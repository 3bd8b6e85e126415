#include "device/BehaviorPreferences.h"

#include "device/MobileUser.h"
#include "device/PreferencesStore.h"

namespace tavrix {

std::optional<plist::Value> copyBehaviorPreference(std::string_view key) {
    return device::PreferencesStore::shared().copyValue(key, kBehaviorPreferencesDomain,
                                                        device::MobileUser::name());
}

bool setBehaviorPreference(std::string_view key, const std::optional<plist::Value>& value) {
    return device::PreferencesStore::shared().storeValue(key, value, kBehaviorPreferencesDomain,
                                                         device::MobileUser::name());
}

}  // namespace tavrix
