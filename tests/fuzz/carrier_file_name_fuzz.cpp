// Feeds arbitrary bytes as carrier file names and version texts to the file-name grammar and the
// version order. Besides not crashing, the order must be reflexive and antisymmetric, and what the
// grammar extracts must be a piece of the name that it was read from.
#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

#include "FuzzSupport.h"
#include "bundle/BundleComparison.h"
#include "bundle/VersionCompare.h"

namespace {

using tavrix::fuzz::require;

void checkName(const std::string& name) {
    std::string behaviorID = tavrix::behaviorIDFromCarrierFileName(name);
    require(behaviorID.find('+') == std::string::npos);
    require(behaviorID.empty() || name.find("+" + behaviorID + "+") != std::string::npos);
    std::string version = tavrix::versionFromCarrierFileName(name);
    require(version.find('+') == std::string::npos);
    require(version.empty() || name.find("+" + version + ".plist") != std::string::npos);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    tavrix::fuzz::silenceTheLog();
    std::string_view input(reinterpret_cast<const char*>(data), size);
    std::string first(input.substr(0, size / 2));
    std::string second(input.substr(size / 2));

    checkName(std::string(input));
    checkName(first);
    checkName(second);
    (void)tavrix::compareCarrierFileNames(first, second);

    int order = tavrix::compareVersionStrings(first, second);
    require(order >= -1 && order <= 1);
    require(tavrix::compareVersionStrings(second, first) == -order);
    require(tavrix::compareVersionStrings(first, first) == 0);
    return 0;
}
