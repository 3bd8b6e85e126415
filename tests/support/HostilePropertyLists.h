// Property lists laid out by hand, because no writer produces these shapes.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace tavrix::test {

// A binary property list of the given encoded objects, the first one at the top, with 4-byte
// offsets and 2-byte references.
inline std::string binaryList(const std::vector<std::string>& objects) {
    std::string bytes = "bplist00";
    std::string table;
    auto bigEndian = [](std::uint64_t value, int width) {
        std::string out;
        for (int shift = (width - 1) * 8; shift >= 0; shift -= 8) {
            out += static_cast<char>((value >> shift) & 0xff);
        }
        return out;
    };
    for (const std::string& object : objects) {
        table += bigEndian(bytes.size(), 4);
        bytes += object;
    }
    const std::uint64_t tableOffset = bytes.size();
    bytes += table + std::string(6, '\0') + '\x04' + '\x02';
    return bytes + bigEndian(objects.size(), 8) + bigEndian(0, 8) + bigEndian(tableOffset, 8);
}

// An array object referring to the given objects (fewer than 15).
inline std::string arrayOf(const std::vector<std::uint16_t>& refs) {
    std::string object(1, static_cast<char>(0xA0 | refs.size()));
    for (std::uint16_t ref : refs) {
        object += static_cast<char>(ref >> 8);
        object += static_cast<char>(ref & 0xff);
    }
    return object;
}

// depth arrays, each holding the next one copies times (fewer than 15), and a string at the
// bottom. One copy nests as deep as there are arrays; with two, 40 arrays in a few hundred bytes
// expand to 2^40 nodes.
inline std::string nestedBinaryList(int depth, int copies) {
    std::vector<std::string> objects;
    for (int i = 0; i < depth; ++i) {
        objects.push_back(arrayOf(std::vector<std::uint16_t>(copies, i + 1)));
    }
    objects.push_back("\x51x");  // the one-letter ASCII string "x"
    return binaryList(objects);
}

// depth XML arrays inside each other, each opening tag with these attributes.
inline std::string nestedXml(int depth, const std::string& attributes = "") {
    std::string xml = "<plist>";
    for (int i = 0; i < depth; ++i) {
        xml += "<array" + attributes + ">";
    }
    for (int i = 0; i < depth; ++i) {
        xml += "</array>";
    }
    return xml + "</plist>";
}

}  // namespace tavrix::test
