#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <string>

#include "ArchiveFixtures.h"
#include "TestDoubles.h"
#include "TestSupport.h"
#include "UnitTestRoot.h"
#include "bundle/BundleManager.h"
#include "bus/HandedPayload.h"
#include "io/UniqueFd.h"
#include "payload/PayloadUnpack.h"

namespace tavrix::payload {
namespace {

namespace fs = std::filesystem;
using test::ArchiveItem;
using test::buildArchive;
using test::Compression;
using test::Container;
using test::randomBytes;
using test::readText;
using test::snapshotTree;
using test::TempDir;
using test::Tree;
using test::writeText;

struct stat statOf(const std::string& path) {
    struct stat info {};
    EXPECT_EQ(::lstat(path.c_str(), &info), 0) << path;
    return info;
}

class PayloadExtraction : public testing::Test {
  protected:
    TempDir dir;
    std::string destination = dir / "dest";
    CapturingLogSink log;
    ScopedLogSink logGuard{log};

    // Writes bytes as the archive file and extracts it into destination.
    bool extract(const std::string& bytes, ExtractionSafety safety = ExtractionSafety::AsArchived) {
        writeText(dir / "payload", bytes);
        return extractArchive(dir / "payload", destination, safety);
    }
};

struct FormatCase {
    const char* name;
    Container container;
    Compression compression;
    friend void PrintTo(const FormatCase& c, std::ostream* out) { *out << c.name; }
};

class PayloadFormats : public PayloadExtraction, public testing::WithParamInterface<FormatCase> {};

// Every format a sender may use unpacks to the same layout, bytes, modes and times, and the
// process's working directory is left alone. The client's own entries are written where they
// point, outside the destination too.
TEST_P(PayloadFormats, ExtractLayoutBytesModesAndTimes) {
    const std::string binary = randomBytes(70000, 7);
    const fs::path before = fs::current_path();
    const std::string absolute = dir / "absolute/placed.txt";
    ASSERT_TRUE(extract(buildArchive(
        {test::directoryItem("sub", 0750, 1400000000),
         test::fileItem("sub/data.bin", binary, 0600, 1300000000),
         test::fileItem("Info.plist", "<plist/>", 0644),
         test::fileItem("run.sh", "#!/bin/sh\n", 0755), test::fileItem("deep/er/empty", "", 0640),
         test::symlinkItem("link", "Info.plist"), test::fileItem("../beside.txt", "beside"),
         test::fileItem(absolute, "absolute")},
        GetParam().container, GetParam().compression)));

    EXPECT_EQ(snapshotTree(destination), (Tree{{"sub", "/"},
                                               {"sub/data.bin", binary},
                                               {"Info.plist", "<plist/>"},
                                               {"run.sh", "#!/bin/sh\n"},
                                               {"deep", "/"},
                                               {"deep/er", "/"},
                                               {"deep/er/empty", ""},
                                               {"link", "-> Info.plist"}}));
    EXPECT_EQ(readText(dir / "beside.txt"), "beside");
    EXPECT_EQ(readText(absolute), "absolute");
    EXPECT_EQ(statOf(dir / "dest/sub/data.bin").st_mode & 07777, 0600u);
    EXPECT_EQ(statOf(dir / "dest/sub/data.bin").st_mtime, 1300000000);
    EXPECT_EQ(statOf(dir / "dest/run.sh").st_mode & 07777, 0755u);
    EXPECT_EQ(statOf(dir / "dest/deep/er/empty").st_mode & 07777, 0640u);
    // Directory times are restored after their contents were written.
    EXPECT_EQ(statOf(dir / "dest/sub").st_mode & 07777, 0750u);
    EXPECT_EQ(statOf(dir / "dest/sub").st_mtime, 1400000000);
    EXPECT_EQ(fs::current_path(), before);
}

INSTANTIATE_TEST_SUITE_P(
    SenderFormats, PayloadFormats,
    testing::Values(FormatCase{"TarGzip", Container::Tar, Compression::Gzip},
                    FormatCase{"CpioGzip", Container::Cpio, Compression::Gzip},
                    FormatCase{"TarCompress", Container::Tar, Compression::Compress},
                    FormatCase{"CpioCompress", Container::Cpio, Compression::Compress}),
    [](const testing::TestParamInfo<FormatCase>& info) { return std::string(info.param.name); });

// Bytes that are no readable archive answer false with an empty destination; damage part way
// keeps the entries before it (false); an entry that cannot be created is skipped (true). The
// working directory stays where it was.
TEST_F(PayloadExtraction, DamagedPayloadsKeepWhatCameBeforeTheDamage) {
    const fs::path before = fs::current_path();
    std::string truncated = buildArchive({test::fileItem("first.txt", "first"),
                                          test::fileItem("large.bin", randomBytes(300000, 3)),
                                          test::fileItem("last.txt", "last")});
    truncated.resize(truncated.size() / 2);
    const std::vector<std::tuple<const char*, std::string, bool, Tree>> cases{
        {"empty", "", false, {}},
        {"not an archive", "this is plainly not an archive\n" + randomBytes(3000, 1), false, {}},
        {"gzip header alone", "\x1f\x8b\x08", false, {}},
        {"truncated", truncated, false, {{"first.txt", "first"}}},
        {"entry that cannot be created",
         buildArchive({test::fileItem("before.txt", "before"),
                       test::hardlinkItem("orphan", "no-such-target"),
                       test::hardlinkItem("linked.txt", "before.txt"),
                       test::fileItem("after.txt", "after")}),
         true,
         {{"before.txt", "before"}, {"linked.txt", "before"}, {"after.txt", "after"}}},
    };
    for (const auto& [name, bytes, extracted, kept] : cases) {
        SCOPED_TRACE(name);
        fs::remove_all(destination);
        EXPECT_EQ(extract(bytes), extracted);
        EXPECT_TRUE(fs::is_directory(destination));
        Tree tree = snapshotTree(destination);
        tree.erase("large.bin");  // the entry the damage cut short
        EXPECT_EQ(tree, kept);
    }
    EXPECT_FALSE(extractArchive(dir / "missing.tgz", destination));
    EXPECT_EQ(fs::current_path(), before);
}

// Network archives hold only files, directories and links that stay inside. The first entry that
// could reach outside (or is no such thing) stops the extraction: nothing after it is written, and
// nothing outside changes.
TEST_F(PayloadExtraction, PathSafeStopsAtTheFirstEntryThatCouldLeave) {
    const std::string outside = dir / "outside";
    writeText(outside + "/secret", "secret");
    const std::vector<std::tuple<const char*, std::vector<ArchiveItem>>> cases{
        {"dot-dot path", {test::fileItem("sub/../../up.txt", "up")}},
        {"absolute path", {test::fileItem(outside + "/absolute.txt", "absolute")}},
        {"hard link inside", {test::hardlinkItem("hard", "first.txt")}},
        {"hard link outside", {test::hardlinkItem("hard", "../outside/secret")}},
        {"absolute symlink",
         {test::symlinkItem("escape", outside), test::fileItem("escape/x.txt", "x")}},
        {"climbing symlink",
         {test::directoryItem("a"), test::symlinkItem("a/escape", "../../outside")}},
        {"chain of symlinks",
         {test::symlinkItem("self", "."), test::symlinkItem("escape", "self/../outside")}},
        {"fifo", {test::fifoItem("pipe")}},
    };
    for (const auto& [name, hostile] : cases) {
        SCOPED_TRACE(name);
        fs::remove_all(destination);
        std::vector<ArchiveItem> items{test::fileItem("first.txt", "first")};
        items.insert(items.end(), hostile.begin(), hostile.end());
        items.push_back(test::fileItem("last.txt", "last"));

        EXPECT_FALSE(extract(buildArchive(items), ExtractionSafety::PathSafe));
        EXPECT_EQ(snapshotTree(outside), (Tree{{"secret", "secret"}}));
        EXPECT_EQ(snapshotTree(dir.path()).count("up.txt"), 0u);
        EXPECT_EQ(readText(dir / "dest/first.txt"), "first");
        EXPECT_FALSE(fs::exists(fs::symlink_status(dir / "dest/last.txt")));
    }
    // Links that stay inside, however they are spelled, are taken as they are, and a destination
    // reached through a link of the caller's is fine.
    fs::create_directories(dir / "real");
    fs::create_directory_symlink(dir / "real", dir / "via");
    destination = dir / "via/bundle";
    EXPECT_TRUE(extract(
        buildArchive({test::fileItem("data.txt", "data"), test::directoryItem("a/b"),
                      test::symlinkItem("a/b/up", "../../data.txt"),
                      test::symlinkItem("a/here", "./b/."), test::symlinkItem("top", "a/here/up")},
                     Container::Cpio),
        ExtractionSafety::PathSafe));
    EXPECT_EQ(readText(dir / "real/bundle/top"), "data");
}

// Every limit stops a payload where it is reached, whichever way its entries are trusted: what
// is written stays within the cap, the rest is never written, and one line says why.
TEST_F(PayloadExtraction, LimitsCutBombsShortWithOneLine) {
    const std::string zeros(3u << 20, '\0');  // compresses to a few kilobytes
    std::vector<ArchiveItem> manyFiles;
    for (int index = 0; index < 40; ++index) {
        manyFiles.push_back(test::fileItem("f" + std::to_string(index), std::string(100, 'x')));
    }
    const std::vector<
        std::tuple<const char*, std::vector<ArchiveItem>, ExtractionLimits, const char*>>
        cases{
            {"one large entry",
             {test::fileItem("small", "s"), test::fileItem("bomb", zeros)},
             {1u << 20, 100, 0, false},
             "expands to more than 1048576 bytes"},
            {"many entries", manyFiles, {1u << 20, 10, 0, false}, "holds more than 10 entries"},
            {"many small files adding up",
             manyFiles,
             {2000, 100, 0, false},
             "more than 2000 bytes"},
            {"directories a deep path implies",
             {test::fileItem("a/b/c/d/e/f/g/h/i/j", "x")},
             {1u << 20, 5, 0, false},
             "more than 5 entries"},
            {"no free space left",
             {test::fileItem("small", "s")},
             {1u << 20, 100, UINT64_MAX / 2, false},
             "bytes free"},
        };
    for (ExtractionSafety safety : {ExtractionSafety::AsArchived, ExtractionSafety::PathSafe}) {
        for (const auto& [name, items, limits, reason] : cases) {
            SCOPED_TRACE(name);
            fs::remove_all(destination);
            log.clear();
            writeText(dir / "payload", buildArchive(items));
            EXPECT_FALSE(extractArchive(dir / "payload", destination, safety, limits));
            std::uintmax_t written = 0;
            std::size_t entries = 0;
            for (const auto& entry : fs::recursive_directory_iterator(destination)) {
                written += entry.is_regular_file() ? entry.file_size() : 0;
                ++entries;
            }
            EXPECT_LE(written, limits.maxExpandedBytes);
            EXPECT_LE(entries, limits.maxEntries);
            ASSERT_EQ(log.messages().size(), 1u);
            EXPECT_NE(log.messages().front().find("stopped: "), std::string::npos);
            EXPECT_NE(log.messages().front().find(reason), std::string::npos)
                << log.messages().front();
        }
    }
}

class BundleInstall : public testing::Test {
  protected:
    const fs::path root = test::unitTestRoot();
    const fs::path bundle = root / "var/mobile/Library/TavrixBundles/Default.bundle";
    const fs::path staged = root / "tmp/behaviorbundle_zipped.tgz";

    void install(const std::string& bytes) {
        (void)BundleManager::sharedInstance().installBehaviorBundleData(
            plist::Data(bytes.begin(), bytes.end()));
    }
};

// Each payload replaces the user bundle completely and the staged file is gone afterwards.
TEST_F(BundleInstall, EachPayloadReplacesTheUserBundle) {
    // A client's payload may hold a FIFO: it is created, and neither opened nor refused.
    install(buildArchive({test::fileItem("Info.plist", "two"), test::fifoItem("pipe")}));
    EXPECT_EQ(readText(bundle / "Info.plist"), "two");
    EXPECT_TRUE(fs::is_fifo(bundle / "pipe"));

    // An empty payload still removes the old bundle and leaves an empty one.
    install("");
    EXPECT_TRUE(fs::is_directory(bundle));
    EXPECT_TRUE(fs::is_empty(bundle));
    EXPECT_FALSE(fs::exists(staged));
}

// The old bundle leaves the name in one step: one that cannot be removed whole (here a mount in
// it; a crash while removing is the other way) must not be left behind in part, under the name
// or mixed into the next payload.
TEST_F(BundleInstall, TheOldBundleNeverStaysInPart) {
    const fs::path staging = bundle.parent_path() / ".Default.bundle.incoming";
    install(buildArchive({test::fileItem("Info.plist", "one"), test::fileItem("a/old", "old"),
                          test::directoryItem("busy")}));
    test::TmpfsMount busy(bundle / "busy", "size=64k");
    if (!busy.mounted) {
        GTEST_SKIP() << "mounting needs root";
    }
    const std::string second = buildArchive({test::fileItem("Info.plist", "two")});
    install(second);
    EXPECT_EQ(snapshotTree(bundle), (Tree{{"Info.plist", "two"}}));

    // The old tree stays aside while it cannot go; no payload is mixed into it meanwhile.
    install(second);
    EXPECT_EQ(snapshotTree(bundle), (Tree{{"Info.plist", "two"}}));
    ::umount2((staging / "busy").c_str(), MNT_DETACH);
    install(buildArchive({test::fileItem("Info.plist", "3")}));
    EXPECT_EQ(snapshotTree(bundle), (Tree{{"Info.plist", "3"}}));
    EXPECT_FALSE(fs::exists(staging));
}

// The daemon's own earlier file is replaced, what is unpacked is what was written, and the file
// goes with the staging; a directory where others could rename the file refuses the payload.
TEST(StagePayload, WritesItsOwnFileAndRefusesAnUnsafeDirectory) {
    TempDir dir;
    const std::string path = dir / "staged.tgz";
    writeText(path, "older and longer content");
    {
        auto staged = stagePayload(plist::Data{'n', 'e', 'w'}, path);
        ASSERT_TRUE(staged) << staged.reason();
        EXPECT_EQ(snapshotTree(dir.path()), (Tree{{"staged.tgz", "new"}}));
        char bytes[8] = {};
        EXPECT_EQ(::read(staged->fd(), bytes, sizeof bytes), 3);
    }
    EXPECT_TRUE(fs::is_empty(dir.path()));

    fs::permissions(dir.path(), fs::perms::all);
    auto refused = stagePayload(plist::Data{'x'}, path);
    ASSERT_FALSE(refused);
    EXPECT_THAT(refused.reason(),
                ::testing::HasSubstr("others may write in it and it is not sticky"));
    EXPECT_FALSE(fs::exists(path));
}

// A regular file is read whole whatever the client's offset, and leaves that offset alone; the
// bound holds for files and pipes alike, to the byte; a descriptor open only for writing is
// refused rather than failing half-way.
TEST(HandedPayload, FilesAreReadWholeAndEveryDescriptorWithinTheBound) {
    test::TempDir directory;
    const std::string path = (directory.path() / "bundle").string();
    test::writeText(path, "0123456789");
    io::UniqueFd file(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
    ASSERT_TRUE(file);
    ASSERT_EQ(::lseek(file.get(), 4, SEEK_SET), 4);

    auto whole = bus::readHandedPayload(file.get(), 10);
    ASSERT_TRUE(whole) << whole.reason();
    EXPECT_EQ(std::string(whole->begin(), whole->end()), "0123456789");
    EXPECT_EQ(::lseek(file.get(), 0, SEEK_CUR), 4);
    EXPECT_EQ(bus::readHandedPayload(file.get(), 9).reason(), "the bundle is larger than 9 bytes");

    int ends[2];
    ASSERT_EQ(::pipe2(ends, O_CLOEXEC), 0);
    io::UniqueFd reader(ends[0]);
    io::UniqueFd writer(ends[1]);
    ASSERT_EQ(::write(writer.get(), "0123456789", 10), 10);
    writer.reset();
    EXPECT_EQ(bus::readHandedPayload(reader.get(), 9).reason(),
              "the bundle is larger than 9 bytes");

    io::UniqueFd writeOnly(::open(path.c_str(), O_WRONLY | O_CLOEXEC));
    EXPECT_EQ(bus::readHandedPayload(writeOnly.get(), 10).reason(),
              "the descriptor is not open for reading");
}

}  // namespace
}  // namespace tavrix::payload
