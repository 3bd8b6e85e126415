// Reading the daemon's behavior preferences from an unchanged domain: 100,000 reads through the
// store, which parses the file once and then only checks that it did not change, beside parsing the
// file on every read.
#include <stdlib.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>

#include "BenchSupport.h"
#include "device/BehaviorPreferences.h"
#include "plist/PropertyListFormat.h"

using namespace tavrix;

namespace {

constexpr int kReads = 100000;

// A device root of its own with the mobile user and its behavior preferences domain.
class DeviceRoot {
  public:
    DeviceRoot() {
        std::string pattern =
            (std::filesystem::temp_directory_path() / "tavrix-prefs-bench-XXXXXX").string();
        if (::mkdtemp(pattern.data()) == nullptr) {
            std::abort();
        }
        root_ = pattern;
        std::filesystem::create_directories(root_ / "etc");
        std::ofstream(root_ / "etc/passwd")
            << "mobile:x:501:501:Mobile User:/var/mobile:/usr/sbin/nologin\n";
        domainPath_ = root_ / "var/mobile/Library/Preferences/com.zandor.tavrixservices.plist";
        std::filesystem::create_directories(domainPath_.parent_path());
        plist::writeFile(
            domainPath_.string(),
            plist::Value(plist::Dictionary{{"TavrixID", plist::Value("abc")},
                                           {"EnableSupport", plist::Value(true)},
                                           {"NextUpdate", plist::Value(plist::Date{760000000})}}));
        ::setenv("TAVRIX_ROOT", root_.c_str(), 1);
    }
    ~DeviceRoot() {
        std::error_code ignored;
        std::filesystem::remove_all(root_, ignored);
    }

    const std::filesystem::path& domainPath() const { return domainPath_; }

  private:
    std::filesystem::path root_;
    std::filesystem::path domainPath_;
};

const DeviceRoot& deviceRoot() {
    static DeviceRoot root;
    return root;
}

}  // namespace

int main() {
    std::string path = deviceRoot().domainPath().string();
    if (copyBehaviorPreference(kTavrixIDKey) != plist::Value("abc")) {
        std::fprintf(stderr, "the domain cannot be read\n");
        return 1;
    }
    double ours = bench::medianMicros(3, [] {
        for (int i = 0; i < kReads; ++i) {
            auto value = copyBehaviorPreference(kTavrixIDKey);
            asm volatile("" : : "r"(&value) : "memory");
        }
    });
    // The peer: what every read would cost without the cache.
    double peer = bench::medianMicros(3, [&] {
        for (int i = 0; i < kReads; ++i) {
            auto domain = plist::readFile(path);
            asm volatile("" : : "r"(&domain) : "memory");
        }
    });
    bench::printHeader(
        "Behavior preferences: 100,000 reads of an unchanged domain (peer: parse every read)");
    bench::printRow("100,000 copyBehaviorPreference reads", ours / 1000, peer / 1000, "ms", "<1x");
    bench::printRow("one read", ours / kReads, peer / kReads, "us", "");
    return 0;
}
