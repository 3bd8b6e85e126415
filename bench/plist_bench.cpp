// Reading and writing a property list of about 1 MB (10,000 keys) through the project's value type,
// side by side with libplist alone on the same bytes. The ratio is the cost of the value type.
#include <plist/plist.h>

#include <cstdio>
#include <cstdlib>
#include <memory>
#include <string>

#include "BenchSupport.h"
#include "plist/PropertyListFormat.h"

using namespace tavrix;

namespace {

constexpr int kKeys = 10000;
constexpr int kRuns = 15;

plist::Value makeDocument() {
    plist::Dictionary root;
    for (int i = 0; i < kKeys; ++i) {
        char key[32];
        std::snprintf(key, sizeof key, "carrier.setting.%05d", i);
        root.emplace(key, plist::Value(plist::Dictionary{
                              {"name", plist::Value("value number " + std::to_string(i))},
                              {"count", plist::Value(i * 7 - 5000)},
                          }));
    }
    return plist::Value(std::move(root));
}

struct NodeDeleter {
    void operator()(void* node) const { plist_free(node); }
};

plist_t libplistParse(const std::string& bytes) {
    plist_t node = nullptr;
    plist_from_memory(bytes.data(), static_cast<uint32_t>(bytes.size()), &node);
    return node;
}

void compare(const char* label, const plist::Value& document, plist::Format format) {
    std::string bytes = *plist::serialize(document, format);
    std::unique_ptr<void, NodeDeleter> node(libplistParse(bytes));
    if (!node || !plist::parse(bytes)) {
        std::fprintf(stderr, "cannot read back the %s document\n", label);
        std::exit(1);
    }
    double oursRead = bench::medianMicros(kRuns, [&] { (void)plist::parse(bytes); });
    double peerRead = bench::medianMicros(kRuns, [&] { plist_free(libplistParse(bytes)); });
    double oursWrite =
        bench::medianMicros(kRuns, [&] { (void)plist::serialize(document, format); });
    double peerWrite = bench::medianMicros(kRuns, [&] {
        char* out = nullptr;
        uint32_t length = 0;
        if (format == plist::Format::Xml) {
            plist_to_xml(node.get(), &out, &length);
            plist_to_xml_free(out);
        } else {
            plist_to_bin(node.get(), &out, &length);
            plist_to_bin_free(out);
        }
    });
    std::string size = " (" + std::to_string(bytes.size() / 1024) + " KiB)";
    bench::printRow(std::string("read ") + label + size, oursRead / 1000, peerRead / 1000, "ms",
                    "<=1.3x");
    bench::printRow(std::string("write ") + label + size, oursWrite / 1000, peerWrite / 1000, "ms",
                    "<=1.3x");
}

}  // namespace

int main() {
    plist::Value document = makeDocument();
    bench::printHeader("Property lists: value type over libplist (peer: libplist alone)");
    compare("XML", document, plist::Format::Xml);
    compare("binary", document, plist::Format::Binary);
    return 0;
}
