// Whether text is well-formed UTF-8: D-Bus refuses any other text, and names on disk may hold any
// bytes, so what goes on the bus from a file name is checked first.
#pragma once

#include <string_view>

namespace tavrix {

// True for well-formed UTF-8 without overlong forms, surrogates or code points past U+10FFFF.
bool isValidUtf8(std::string_view text);

}  // namespace tavrix
