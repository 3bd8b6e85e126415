#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <cerrno>
#include <string>

#include "TestSupport.h"
#include "bus/HandedPayload.h"
#include "io/UniqueFd.h"

namespace tavrix::bus {
namespace {

std::string text(const std::vector<std::uint8_t>& bytes) {
    return {bytes.begin(), bytes.end()};
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

    std::vector<std::uint8_t> bytes;
    std::string whyNot;
    EXPECT_EQ(readHandedPayload(file.get(), 10, bytes, whyNot), 0) << whyNot;
    EXPECT_EQ(text(bytes), "0123456789");
    EXPECT_EQ(::lseek(file.get(), 0, SEEK_CUR), 4);
    EXPECT_EQ(readHandedPayload(file.get(), 9, bytes, whyNot), EFBIG);
    EXPECT_EQ(whyNot, "the bundle is larger than 9 bytes");
    EXPECT_TRUE(bytes.empty());

    int ends[2];
    ASSERT_EQ(::pipe2(ends, O_CLOEXEC), 0);
    io::UniqueFd reader(ends[0]);
    io::UniqueFd writer(ends[1]);
    ASSERT_EQ(::write(writer.get(), "0123456789", 10), 10);
    writer.reset();
    EXPECT_EQ(readHandedPayload(reader.get(), 9, bytes, whyNot), EFBIG);

    io::UniqueFd writeOnly(::open(path.c_str(), O_WRONLY | O_CLOEXEC));
    EXPECT_EQ(readHandedPayload(writeOnly.get(), 10, bytes, whyNot), EBADF);
    EXPECT_EQ(whyNot, "the descriptor is not open for reading");
}

}  // namespace
}  // namespace tavrix::bus
