// Lower-casing of behavior IDs. IDs are UTF-8 text chosen by clients and carrier files, so every
// letter with a lower-case form changes, not only ASCII ones.
#pragma once

#include <string>
#include <string_view>

namespace tavrix {

// text with each code point mapped to its simple lower-case form. Bytes that are not valid UTF-8
// are kept as they are.
std::string lowercaseText(std::string_view text);

}  // namespace tavrix
