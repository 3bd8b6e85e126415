// Facts about the build the device runs, from the device information service, read once on the
// first use of any accessor and never changed afterwards. All are false when unanswered.
#pragma once

#include "plist/Value.h"

namespace tavrix::device {

class BuildCapabilities {
  public:
    struct Facts {
        bool isInternalBuild = false;
        bool hasCarrierInstallCapability = false;
        bool isVendorBuild = false;
    };

    // The facts from the answers for "InternalBuild", "CarrierInstallCapability" (booleans) and
    // "ReleaseType" (a string, consulted only when "InternalBuild" is not true: exactly
    // "Desense" makes an internal build, exactly "Vendor" a vendor build). Answers of other types
    // are ignored.
    static Facts decide(const plist::Dictionary& answers);

    static bool isInternalBuild();
    static bool hasCarrierInstallCapability();
    static bool isVendorBuild();

  private:
    static const Facts& facts();
};

}  // namespace tavrix::device
