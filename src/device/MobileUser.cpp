#include "device/MobileUser.h"

#include "device/PlatformRoot.h"
#include "device/UserDatabase.h"
#include "util/SharedInstance.h"

namespace tavrix::device {

MobileUser::Facts MobileUser::lookUpUnder(std::string_view root) {
    Facts facts;
    if (auto record = device::lookupUserUnder(root, name())) {
        facts.uid = record->uid;
        facts.gid = record->gid;
        if (!record->homeDirectory.empty()) {
            facts.homeDirectory = record->homeDirectory;
        }
    }
    return facts;
}

const std::string& MobileUser::name() {
    static const std::string kName = "mobile";
    return kName;
}

const MobileUser::Facts& MobileUser::facts() {
    return SharedInstance<Facts>::current().instance(
        [] { return std::make_unique<Facts>(lookUpUnder(device::platformRoot())); });
}

const char* MobileUser::homeDirectory() {
    const auto& home = facts().homeDirectory;
    return home ? home->c_str() : nullptr;
}

uid_t MobileUser::uid() {
    return facts().uid;
}

gid_t MobileUser::gid() {
    return facts().gid;
}

}  // namespace tavrix::device
