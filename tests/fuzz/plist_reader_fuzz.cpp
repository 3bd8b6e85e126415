// Feeds arbitrary bytes (up to several megabytes, see plist_reader.options) to the property-list
// reader. Whatever passes the bounds check must really stay within the bounds once libplist has
// built it, and whatever the reader accepts must write back and read again.
#include <plist/plist.h>

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <memory>
#include <string_view>
#include <utility>
#include <vector>

#include "plist/PropertyListBounds.h"
#include "plist/PropertyListFormat.h"

namespace {

// libplist's own tree of bytes that passed the bounds check, measured without recursion.
void checkTreeWithinBounds(std::string_view bytes) {
    plist_t raw = nullptr;
    plist_from_memory(bytes.data(), static_cast<uint32_t>(bytes.size()), &raw);
    std::unique_ptr<void, decltype(&plist_free)> root(raw, &plist_free);
    if (!root) {
        return;
    }
    std::size_t nodes = 0;
    std::vector<std::pair<plist_t, std::size_t>> pending{{root.get(), 1}};
    while (!pending.empty()) {
        auto [node, depth] = pending.back();
        pending.pop_back();
        ++nodes;
        if (depth > tavrix::plist::kMaxPropertyListDepth ||
            nodes > tavrix::plist::kMaxPropertyListNodes * 2) {
            std::abort();  // the bounds check let through what it promised to refuse
        }
        plist_type type = plist_get_node_type(node);
        if (type == PLIST_ARRAY) {
            for (uint32_t i = 0, n = plist_array_get_size(node); i < n; ++i) {
                pending.emplace_back(plist_array_get_item(node, i), depth + 1);
            }
        } else if (type == PLIST_DICT) {
            plist_dict_iter iter = nullptr;
            plist_dict_new_iter(node, &iter);
            std::unique_ptr<void, decltype(&std::free)> owner(iter, &std::free);
            for (plist_t child = nullptr;;) {
                child = nullptr;
                plist_dict_next_item(node, iter, nullptr, &child);
                if (child == nullptr) {
                    break;
                }
                ++nodes;  // its key
                pending.emplace_back(child, depth + 1);
            }
        }
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    using namespace tavrix::plist;
    std::string_view bytes(reinterpret_cast<const char*>(data), size);
    auto value = parse(bytes);
    if (size > 0 && size <= kMaxPropertyListBytes) {
        bool binary = plist_is_binary(bytes.data(), static_cast<uint32_t>(size)) != 0;
        if (binary ? checkBinaryBounds(bytes) : checkXmlBounds(bytes)) {
            checkTreeWithinBounds(bytes);
        }
    }
    if (!value) {
        return 0;
    }
    (void)value->description();
    for (Format format : {Format::Xml, Format::Binary}) {
        // Reals that are not numbers never compare equal, so only presence is checked.
        tavrix::Result<std::string> bytesBack = serialize(*value, format);
        if (!bytesBack || !parse(*bytesBack)) {
            std::abort();
        }
    }
    return 0;
}
