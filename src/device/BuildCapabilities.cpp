#include "device/BuildCapabilities.h"

#include "device/DeviceInfoService.h"
#include "util/SharedInstance.h"

namespace tavrix::device {
namespace {

const bool* booleanAnswer(const plist::Dictionary& answers, std::string_view key) {
    auto found = answers.find(key);
    return found == answers.end() ? nullptr : found->second.asBoolean();
}

}  // namespace

BuildCapabilities::Facts BuildCapabilities::decide(const plist::Dictionary& answers) {
    Facts facts;
    if (const bool* carrierInstall = booleanAnswer(answers, "CarrierInstallCapability")) {
        facts.hasCarrierInstallCapability = *carrierInstall;
    }
    if (const bool* internal = booleanAnswer(answers, "InternalBuild")) {
        facts.isInternalBuild = *internal;
    }
    if (!facts.isInternalBuild) {
        auto releaseType = answers.find("ReleaseType");
        const std::string* type =
            releaseType == answers.end() ? nullptr : releaseType->second.asString();
        if (type != nullptr && *type == "Desense") {
            facts.isInternalBuild = true;
        } else if (type != nullptr && *type == "Vendor") {
            facts.isVendorBuild = true;
        }
    }
    return facts;
}

const BuildCapabilities::Facts& BuildCapabilities::facts() {
    return SharedInstance<Facts>::current().instance([] {
        return std::make_unique<Facts>(decide(device::copyDeviceAnswers(
            {"InternalBuild", "CarrierInstallCapability", "ReleaseType"})));
    });
}

bool BuildCapabilities::isInternalBuild() {
    return facts().isInternalBuild;
}

bool BuildCapabilities::hasCarrierInstallCapability() {
    return facts().hasCarrierInstallCapability;
}

bool BuildCapabilities::isVendorBuild() {
    return facts().isVendorBuild;
}

}  // namespace tavrix::device
