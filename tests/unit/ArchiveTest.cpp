#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cmath>
#include <filesystem>
#include <map>

#include "ArchiveFixtures.h"
#include "TestSupport.h"
#include "payload/Archive.h"
#include "payload/PayloadUnpack.h"

namespace tavrix::payload {
namespace {

namespace fs = std::filesystem;
using test::randomBytes;
using test::readText;
using test::TempDir;
using test::writeText;

test::ReadArchive readBack(const Archive& archive) {
    return test::readArchive(archive.archiveData().data(), archive.archiveData().size());
}

std::vector<std::string> entryNames(const test::ReadArchive& read) {
    std::vector<std::string> names;
    for (const auto& entry : read.entries) {
        names.push_back(entry.path);
    }
    return names;
}

void setModificationTime(const std::string& path, std::time_t seconds) {
    struct timespec times[2] = {{seconds, 0}, {seconds, 0}};
    ASSERT_EQ(::utimensat(AT_FDCWD, path.c_str(), times, 0), 0);
}

// What the writer produces is a payload the unpacker restores byte for byte: regular files only,
// mode 0644, the source's modification time, no owner, gzip over tar.
TEST(Archive, PackedFilesExtractBackIdentical) {
    TempDir dir;
    const std::string large = randomBytes(200000, 11);
    const std::string text(50000, 'a');
    writeText(dir / "in/large.bin", large);
    writeText(dir / "in/text.txt", text);
    writeText(dir / "in/empty", "");
    ::chmod((dir / "in/large.bin").c_str(), 0600);
    setModificationTime(dir / "in/text.txt", 1234567890);

    auto archive = Archive::initWithMaxUncompressedSize(1000000, "bundle.tgz");
    ASSERT_NE(archive, nullptr);
    EXPECT_EQ(archive->identifier(), "bundle.tgz");
    EXPECT_TRUE(std::isnan(archive->compressionPercent()));
    ASSERT_TRUE(archive->addFile(dir / "in/large.bin", "Default.bundle/data/large.bin"));
    ASSERT_TRUE(archive->addFile(dir / "in/text.txt"));
    ASSERT_TRUE(archive->addFile(dir / "in/empty"));
    ASSERT_TRUE(archive->close());
    EXPECT_EQ(archive->uncompressedSize(), large.size() + text.size());
    EXPECT_EQ(archive->files(), (std::vector<std::string>{dir / "in/large.bin", dir / "in/text.txt",
                                                          dir / "in/empty"}));
    EXPECT_GT(archive->compressionPercent(), 0.0f);
    EXPECT_LT(archive->compressionPercent(), 100.0f);

    test::ReadArchive read = readBack(*archive);
    EXPECT_EQ(read.filter, ARCHIVE_FILTER_GZIP);
    ASSERT_EQ(read.entries.size(), 3u);
    for (const auto& entry : read.entries) {
        SCOPED_TRACE(entry.path);
        EXPECT_EQ(entry.type, static_cast<mode_t>(AE_IFREG));
        EXPECT_EQ(entry.permissions, 0644u);
        EXPECT_FALSE(entry.hasOwnerNames);
        EXPECT_EQ(entry.uid, 0);
    }
    EXPECT_EQ(read.entries[1].mtime, 1234567890);
    EXPECT_EQ(read.entries[2].size, 0);

    EXPECT_FALSE(archive->writeToFile(dir / "missing/bundle.tgz"));
    ASSERT_TRUE(archive->writeToFile(dir / "bundle.tgz"));
    ASSERT_TRUE(extractArchive(dir / "bundle.tgz", dir / "extracted", ExtractionSafety::PathSafe));
    EXPECT_EQ(readText(dir / "extracted/Default.bundle/data/large.bin"), large);
    EXPECT_EQ(readText(dir / "extracted/text.txt"), text);
    EXPECT_TRUE(fs::is_regular_file(dir / "extracted/empty"));
    EXPECT_EQ(fs::file_size(dir / "extracted/empty"), 0u);
}

// bzip2 archives are written as asked, but they are no payload the unpacker takes; other types
// make no archive.
TEST(Archive, Bzip2IsWrittenButIsNoPayload) {
    EXPECT_EQ(Archive::initWithArchiveType(0, "x"), nullptr);
    EXPECT_EQ(Archive::initWithMaxUncompressedSize(10, 3, "x"), nullptr);
    TempDir dir;
    writeText(dir / "a.txt", "a");
    auto archive = Archive::initWithArchiveType(kArchiveTypeBzip2, "x.tbz");
    ASSERT_NE(archive, nullptr);
    EXPECT_EQ(archive->maxUncompressedSize(), 10000000u);
    ASSERT_TRUE(archive->addFile(dir / "a.txt"));
    ASSERT_TRUE(archive->close());
    test::ReadArchive read = readBack(*archive);
    EXPECT_EQ(read.filter, ARCHIVE_FILTER_BZIP2);
    EXPECT_EQ(entryNames(read), std::vector<std::string>{"a.txt"});

    ASSERT_TRUE(archive->writeToFile(dir / "x.tbz"));
    EXPECT_FALSE(extractArchive(dir / "x.tbz", dir / "out"));
}

// The cap is inclusive; a refused file leaves the archive as it was and still usable.
TEST(Archive, SizeCapIsInclusiveAndRefusalsChangeNothing) {
    TempDir dir;
    writeText(dir / "six", "666666");
    writeText(dir / "four", "4444");
    writeText(dir / "one", "1");
    writeText(dir / "eleven", "11111111111");
    writeText(dir / "empty", "");

    auto archive = Archive::initWithMaxUncompressedSize(10, kArchiveTypeGzip, "capped.tgz");
    ASSERT_NE(archive, nullptr);
    EXPECT_FALSE(archive->addFile(dir / "eleven"));
    EXPECT_TRUE(archive->addFile(dir / "six"));
    EXPECT_TRUE(archive->addFile(dir / "four"));
    EXPECT_EQ(archive->uncompressedSize(), 10u);
    EXPECT_FALSE(archive->addFile(dir / "one"));
    EXPECT_EQ(archive->uncompressedSize(), 10u);
    EXPECT_TRUE(archive->addFile(dir / "empty"));
    ASSERT_TRUE(archive->close());
    EXPECT_EQ(archive->files(),
              (std::vector<std::string>{dir / "six", dir / "four", dir / "empty"}));
    EXPECT_EQ(entryNames(readBack(*archive)), (std::vector<std::string>{"six", "four", "empty"}));
}

// Paths that are no readable regular file are refused without blocking (a FIFO would).
TEST(Archive, TakesReadableRegularFilesByPathOrFileURL) {
    TempDir dir;
    ASSERT_EQ(::mkfifo((dir / "fifo").c_str(), 0644), 0);
    fs::create_directories(dir / "directory");
    auto archive = Archive::initWithMaxUncompressedSize(1000, "x");
    ASSERT_NE(archive, nullptr);
    for (const std::string& path :
         {dir / "fifo", dir / "directory", dir / "missing", std::string()}) {
        SCOPED_TRACE(path);
        EXPECT_FALSE(archive->addFile(path));
    }
    EXPECT_TRUE(archive->files().empty());
    EXPECT_EQ(Archive::sizeOnDiskForPath(dir / "missing"), 0u);

    // Entries are named by the last path component; file URLs are decoded to their path.
    writeText(dir / "x/y/z.plist", "z");
    writeText(dir / "with space%.txt", "s");
    EXPECT_TRUE(archive->addFile(dir / "x/y/z.plist"));
    EXPECT_TRUE(archive->addFileURL("file://" + dir.path().string() + "/with%20space%25.txt"));
    EXPECT_TRUE(archive->addFileURL("file://localhost" + dir.path().string() + "/x/y/z.plist"));
    EXPECT_FALSE(archive->addFileURL("file://elsewhere" + dir.path().string() + "/x/y/z.plist"));
    EXPECT_FALSE(archive->addFileURL("http://localhost" + dir.path().string() + "/x/y/z.plist"));
    EXPECT_FALSE(archive->addFileURL("file://" + dir.path().string() + "/x/y/z.plis%"));
    ASSERT_TRUE(archive->close());
    EXPECT_EQ(entryNames(readBack(*archive)),
              (std::vector<std::string>{"z.plist", "with space%.txt", "z.plist"}));
}

// One level of a directory: regular files are packed, the rest left out.
TEST(ArchiveDirectory, PacksTheFilesOfOneLevel) {
    TempDir dir;
    writeText(dir / "in/a.plist", "a");
    writeText(dir / "in/b.plist", "b");
    writeText(dir / "in/sub/c.plist", "c");

    archiveDirectory(dir / "in", dir / "packed.tgz");
    auto bytes = copyDataFromFile(dir / "packed.tgz");
    ASSERT_TRUE(bytes.has_value());
    auto names = entryNames(test::readArchive(bytes->data(), bytes->size()));
    std::sort(names.begin(), names.end());
    EXPECT_EQ(names, (std::vector<std::string>{"a.plist", "b.plist"}));
    EXPECT_FALSE(copyDataFromFile(dir / "missing").has_value());
}

}  // namespace
}  // namespace tavrix::payload
