// Payloads chosen to hurt, sent to the real daemon. Whatever a payload holds, the call is
// answered, the daemon stays small, every later call is answered, and so is every call to the
// next launch (which redoes the bundle match from the stored ID, so a payload that stopped one
// process would stop every one after it).
#include <signal.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/types.h>

#include <fstream>
#include <functional>
#include <random>
#include <set>

#include "BusFixture.h"
#include "HostilePropertyLists.h"
#include "TestSupport.h"
#include "plist/PropertyListFormat.h"

namespace tavrix::integration {
namespace {

namespace fs = std::filesystem;

// An idle daemon holds about 12 MB; a payload may cost working memory, never its expansion. Under
// a sanitizer memory is shadowed (and freed memory held back in quarantine), so the bound there
// only catches an expansion.
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr long kMaxResidentKiB = 640 * 1024;
#else
constexpr long kMaxResidentKiB = 160 * 1024;
#endif

// A carrier file listing many IDs for one large configuration.
plist::Dictionary manyIDsCarrierFile() {
    plist::Array ids;
    for (int i = 0; i < 20000; ++i) {
        ids.push_back(plist::Value("id-" + std::to_string(i)));
    }
    plist::Dictionary configuration;
    for (int i = 0; i < 2000; ++i) {
        configuration.emplace("Key" + std::to_string(i), std::string(40, 'v'));
    }
    plist::Dictionary group = {{"SupportedBehaviorIDs", std::move(ids)},
                               {"OverrideConfiguration", std::move(configuration)}};
    return {{"CarrierName", "Many"},
            {"BehaviorOverrides", plist::Dictionary{{"Group", std::move(group)}}}};
}

struct HostileCase {
    const char* name;
    // Turns a good bundle directory (Info.plist and behavior.plist) into the hostile one.
    std::function<void(const fs::path& bundle)> spoil;
    // A bundle compressed from many zeros: packed by streaming zeros into gzip.
    std::uint64_t zeroFileBytes = 0;
};

void PrintTo(const HostileCase& hostile, std::ostream* out) {
    *out << hostile.name;
}

void replaceWithFifo(const fs::path& file) {
    fs::remove(file);
    ASSERT_EQ(::mkfifo(file.c_str(), 0644), 0);
}

const HostileCase kCases[] = {
    {"FifoAsCarrierFile", [](const fs::path& b) { replaceWithFifo(b / "behavior.plist"); }},
    {"FifoAsInfo", [](const fs::path& b) { replaceWithFifo(b / "Info.plist"); }},
    {"DeepXmlCarrierFile",
     [](const fs::path& b) { test::writeText(b / "behavior.plist", test::nestedXml(200000)); }},
    {"DeepBinaryCarrierFile",
     [](const fs::path& b) {
         test::writeText(b / "behavior.plist", test::nestedBinaryList(30000, 1));
     }},
    {"DeepBinaryInfo",
     [](const fs::path& b) {
         test::writeText(b / "Info.plist", test::nestedBinaryList(30000, 1));
     }},
    {"SelfSharingBinaryCarrierFile",
     [](const fs::path& b) {
         test::writeText(b / "behavior.plist", test::nestedBinaryList(40, 2));
     }},
    {"SparseHugeCarrierFile",
     [](const fs::path& b) { fs::resize_file(b / "behavior.plist", std::uintmax_t{100} << 30); }},
    {"ManyIDsForOneConfiguration",
     [](const fs::path& b) {
         ASSERT_TRUE(
             plist::writeFile((b / "behavior.plist").string(), plist::Value(manyIDsCarrierFile())));
     }},
    {"GzipBomb", [](const fs::path&) {}, std::uint64_t{4} << 30},
};

class HostilePayloadTest : public BusFixture, public testing::WithParamInterface<HostileCase> {
  protected:
    std::vector<std::uint8_t> hostilePayload(const HostileCase& hostile) {
        fs::path source = device().base() / "hostile";
        writeBundle(source, "10", {{"CarrierName", "10"}});
        hostile.spoil(source);
        if (hostile.zeroFileBytes == 0) {
            return pack(source);
        }
        fs::path archive = device().base() / "hostile.tgz";
        // One entry of zeros as repeated gzip members: a few MB that expand to gigabytes.
        CommandResult packed = runCommand({"/usr/bin/python3", "-c", R"(
import gzip, sys, tarfile
archive, info, size = sys.argv[1], sys.argv[2], int(sys.argv[3])
chunk = 64 << 20
def entry(name, length):
    header = tarfile.TarInfo(name)
    header.size = length
    return header.tobuf(format=tarfile.USTAR_FORMAT)
data = open(info, "rb").read()
with open(archive, "wb") as out:
    out.write(gzip.compress(entry("Info.plist", len(data)) + data + bytes(-len(data) % 512)))
    out.write(gzip.compress(entry("zeros", size)))
    zeros = gzip.compress(bytes(chunk), 1)
    for _ in range(size // chunk):
        out.write(zeros)
    out.write(gzip.compress(bytes(1024)))
)",
                                           archive.string(), (source / "Info.plist").string(),
                                           std::to_string(hostile.zeroFileBytes)});
        EXPECT_EQ(packed.status, 0) << packed.output;
        std::ifstream in(archive, std::fstream::binary);
        return {std::istreambuf_iterator<char>(in), {}};
    }

    // Every call a client can make is answered, the daemon stays small, and both links lead to
    // files that exist or are not there at all.
    void expectServing(const char* when) {
        auto caller = client();
        EXPECT_TRUE(caller.isTavrixBundleSupported()) << when;
        // Either bundle's settings, or none when no carrier file could be read: answered.
        (void)caller.copyTavrixValue("CarrierName");
        const std::optional<pid_t> pid = daemonPid();
        ASSERT_TRUE(pid) << when;
        std::ifstream status("/proc/" + std::to_string(*pid) + "/status");
        std::string line;
        while (std::getline(status, line) && !line.starts_with("VmHWM:")) {
        }
        ASSERT_TRUE(line.starts_with("VmHWM:")) << when;
        EXPECT_LT(std::stol(line.substr(6)), kMaxResidentKiB) << when;
        for (const char* link : {kBundleLink, kPreferencesLink}) {
            std::error_code error;
            EXPECT_TRUE(!fs::is_symlink(at(link), error) || fs::exists(at(link), error))
                << link << " dangles " << when;
        }
    }
};

TEST_P(HostilePayloadTest, DaemonKeepsServingAndSoDoesItsNextLaunch) {
    const HostileCase& hostile = GetParam();
    device().writeDaemonPreferences({{"EnableSupport", true}});
    writeBundle(at(kSystemBundle), "1", {{"CarrierName", "1"}});
    std::set<std::string> before;
    for (const auto& entry : fs::directory_iterator(device().base())) {
        before.insert(entry.path().filename().string());
    }
    const fs::path previous = device().base() / "hostile-previous";
    writeBundle(previous, "5", {{"CarrierName", "5"}});
    ASSERT_TRUE(client().setTavrixID("id-7", pack(previous)));
    ASSERT_TRUE(client().setTavrixID("id-7", hostilePayload(hostile)));
    const std::optional<pid_t> pid = daemonPid();
    ASSERT_TRUE(pid);
    expectServing("after the payload");
    if (hostile.zeroFileBytes != 0) {
        // Stopped at a limit before it filled the disk: the bundle before it stays linked.
        EXPECT_EQ(linkedVersion(), "5");
    }

    ASSERT_EQ(::kill(*pid, SIGTERM), 0);
    EXPECT_EQ(waitForDaemonExit(*pid), std::optional<int>(0));
    expectServing("at the next launch");
    EXPECT_NE(daemonPid(), pid);
    // Nothing appeared beside the device root but the payload sources made here.
    for (const auto& entry : fs::directory_iterator(device().base())) {
        const std::string name = entry.path().filename().string();
        EXPECT_TRUE(before.contains(name) || name.starts_with("hostile")) << name;
    }
}

using SmallFileSystemsTest = BusFixture;

// A payload is checked against the room it needs before the bundle before it is touched: on a home
// of 40 MiB a bundle still installs (the free-space reserve is a sixteenth of so small a file
// system), one that would not fit is refused, and with /tmp full the payload cannot be staged;
// either way the bundle before it stays linked. (Root only: the small file systems are mounted.)
TEST_F(SmallFileSystemsTest, PayloadsThatDoNotFitKeepTheBundleBeforeThem) {
    if (::geteuid() != 0) {
        GTEST_SKIP() << "needs root to mount small file systems";
    }
    struct Mount {
        fs::path path;
        bool mounted;
        Mount(fs::path at, const char* size)
            : path(std::move(at)), mounted(::mount("tmpfs", path.c_str(), "tmpfs", 0, size) == 0) {}
        ~Mount() {
            if (mounted) {
                ::umount2(path.c_str(), MNT_DETACH);
            }
        }
    };
    const Mount home(at("/var/mobile"), "size=40m");
    ASSERT_TRUE(home.mounted);
    device().writeDaemonPreferences({{"EnableSupport", true}});
    // Random bytes weigh in the payload what they take on disk; zeros hardly at all.
    auto bundleWith = [&](const std::string& version, std::size_t bytes, bool random) {
        const fs::path source = device().base() / ("small-" + version);
        writeBundle(source, version, {{"CarrierName", version}});
        std::string bulk(bytes, '\0');
        std::mt19937 generator(7);
        for (char& byte : bulk) {
            byte = random ? static_cast<char>(generator()) : '\0';
        }
        test::writeText(source / "bulk", bulk);
        return pack(source, {"-z"});
    };
    ASSERT_TRUE(client().setTavrixID("id-7", bundleWith("5", 1 << 20, true)));
    EXPECT_EQ(linkedVersion(), "5");

    ASSERT_TRUE(client().setTavrixID("id-7", bundleWith("6", 40 << 20, false)));
    EXPECT_EQ(countLogLinesContaining("stopped:"), 1);
    EXPECT_EQ(linkedVersion(), "5");

    const Mount tmp(at("/tmp"), "size=1m");
    ASSERT_TRUE(tmp.mounted);
    std::string filler(1 << 20, 'x');
    std::ofstream(tmp.path / "filler", std::ofstream::binary).write(filler.data(), filler.size());
    ASSERT_TRUE(client().setTavrixID("id-7", bundleWith("7", 2 << 20, true)));
    EXPECT_EQ(countLogLinesContaining("Failed to write the zipped file"), 1);
    EXPECT_EQ(linkedVersion(), "5");
    EXPECT_EQ(client().copyTavrixValue("CarrierName"), std::optional<plist::Value>("5"));
}

INSTANTIATE_TEST_SUITE_P(Payloads, HostilePayloadTest, testing::ValuesIn(kCases),
                         [](const testing::TestParamInfo<HostileCase>& info) {
                             return std::string(info.param.name);
                         });

}  // namespace
}  // namespace tavrix::integration
