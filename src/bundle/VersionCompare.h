// Ordering of version texts such as "1.9" and "1.10": literal and case-sensitive, except that
// runs of digits compare by their numeric value.
#pragma once

#include <string_view>

namespace tavrix {

// -1 when a sorts before b, 0 when they are equal, 1 when a sorts after b. Maximal runs of ASCII
// digits at the same place in both texts compare as numbers of any length ("9" < "10"); runs of
// equal value are equal whatever their leading zeros ("01" == "1", so "1.01" == "1.1"), and the
// comparison goes on after them. Every other byte compares by its unsigned value.
int compareVersionStrings(std::string_view a, std::string_view b);

}  // namespace tavrix
