#include "platform/foundation/whole_transfer.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/mman.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <string>

#include "platform/foundation/file_descriptor.h"

namespace yomber {
namespace {

class WholeTransferTest : public ::testing::Test {
 protected:
  /// What can be read there, of that many bytes.
  std::string read(std::uint64_t offset, std::size_t size) {
    std::string bytes(size, '?');
    std::size_t done = 0;
    EXPECT_EQ(readWhole(file_.get(), bytes, offset, done), 0);
    return bytes.substr(0, done);
  }

  const FileDescriptor file_{memfd_create("test", MFD_CLOEXEC)};
};

TEST_F(WholeTransferTest, WhatIsWrittenSomewhereIsReadThere) {
  ASSERT_EQ(writeWhole(file_.get(), "first"), 0);
  ASSERT_EQ(writeWhole(file_.get(), "second", 5), 0);
  EXPECT_EQ(read(0, 11), "firstsecond");
  EXPECT_EQ(read(5, 3), "sec");
  EXPECT_EQ(lseek(file_.get(), 0, SEEK_CUR), 0) << "the descriptor's own position has moved";
}

TEST_F(WholeTransferTest, AReadEndsWithTheFile) {
  ASSERT_EQ(writeWhole(file_.get(), "text"), 0);
  EXPECT_EQ(read(2, 100), "xt");
  EXPECT_EQ(read(4, 1), "");
  EXPECT_EQ(read(1000, 1), "");
}

TEST_F(WholeTransferTest, ManyBytesFarInsideAreMovedAllTheSame) {
  constexpr std::uint64_t kFar = std::uint64_t{5} << 30U;
  const std::string bytes(3'000'000, 'x');
  ASSERT_EQ(writeWhole(file_.get(), bytes, kFar), 0);
  EXPECT_TRUE(read(kFar, bytes.size()) == bytes);
}

TEST_F(WholeTransferTest, FailuresAreErrnoValuesAndNothingIsDone) {
  std::string bytes(4, '?');
  std::size_t done = 7;
  EXPECT_EQ(readWhole(-1, bytes, 0, done), EBADF);
  EXPECT_EQ(done, 0U);
  EXPECT_EQ(writeWhole(-1, "text"), EBADF);
  EXPECT_EQ(writeWhole(file_.get(), "text", std::uint64_t{1} << 63U), EINVAL);
}

}  // namespace
}  // namespace yomber
