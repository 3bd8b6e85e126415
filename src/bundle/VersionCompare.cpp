#include "bundle/VersionCompare.h"

#include <cstddef>

namespace tavrix {
namespace {

bool isDigit(char c) {
    return c >= '0' && c <= '9';
}

int sign(int value) {
    return (value > 0) - (value < 0);
}

// The run of digits starting at position, without its leading zeros; position moves past it.
std::string_view takeDigitRun(std::string_view text, std::size_t& position) {
    std::size_t start = position;
    while (position < text.size() && isDigit(text[position])) {
        ++position;
    }
    std::string_view run = text.substr(start, position - start);
    std::size_t firstSignificant = run.find_first_not_of('0');
    return firstSignificant == std::string_view::npos ? std::string_view{}
                                                      : run.substr(firstSignificant);
}

// Numbers of any length: the longer significant run is the larger, equal lengths compare
// digit by digit.
int compareDigitRuns(std::string_view a, std::string_view b) {
    if (a.size() != b.size()) {
        return a.size() < b.size() ? -1 : 1;
    }
    return sign(a.compare(b));
}

}  // namespace

int compareVersionStrings(std::string_view a, std::string_view b) {
    std::size_t i = 0;
    std::size_t j = 0;
    while (i < a.size() && j < b.size()) {
        if (isDigit(a[i]) && isDigit(b[j])) {
            int order = compareDigitRuns(takeDigitRun(a, i), takeDigitRun(b, j));
            if (order != 0) {
                return order;
            }
            continue;
        }
        auto left = static_cast<unsigned char>(a[i]);
        auto right = static_cast<unsigned char>(b[j]);
        if (left != right) {
            return left < right ? -1 : 1;
        }
        ++i;
        ++j;
    }
    bool aLeft = i < a.size();
    bool bLeft = j < b.size();
    return aLeft == bLeft ? 0 : (aLeft ? 1 : -1);
}

}  // namespace tavrix
