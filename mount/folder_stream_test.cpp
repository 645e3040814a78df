#include "mount/folder_stream.h"

#include <fcntl.h>
#include <gtest/gtest.h>

#include <cstddef>
#include <fstream>
#include <set>
#include <string>
#include <utility>

#include "platform/foundation/temporary_directory.h"

namespace yomber {
namespace {

class FolderStreamTest : public ::testing::Test {
 protected:
  void make(int count) {
    for (int i = 0; i < count; ++i) std::ofstream(directory_.path() + "/" + std::to_string(i));
  }
  [[nodiscard]] FolderStream stream() const {
    return {FileDescriptor(open(directory_.path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC)),
            {{.name = "Trash", .base = 1}, {.name = "Notes", .base = 2}}};
  }
  static std::string nameOf(const FolderStream::Entry& entry) { return entry.name; }

  const TemporaryDirectory directory_;
};

/// The kernel may ask for every entry anew, at the position behind the one before.
TEST_F(FolderStreamTest, EveryEntryIsFoundAtThePositionBehindTheOneBefore) {
  constexpr int kEntries = 300;
  make(kEntries);
  FolderStream folder = stream();
  std::set<std::string> names;
  off_t position = 0;
  for (;;) {
    ASSERT_EQ(folder.seek(0), 0);  // so that it has to find the position
    FolderStream::Entry entry;
    ASSERT_EQ(folder.look(entry), 0);
    ASSERT_EQ(folder.seek(position), 0);
    ASSERT_EQ(folder.look(entry), 0);
    if (entry.name == nullptr) break;
    ASSERT_TRUE(names.insert(nameOf(entry)).second) << entry.name;
    position = entry.next;
  }
  EXPECT_TRUE(names.contains("Trash"));
  EXPECT_TRUE(names.contains("Notes"));
  EXPECT_TRUE(names.contains("0"));
  EXPECT_EQ(names.size(), std::size_t{kEntries} + 4);  // with "." and ".."
}

TEST_F(FolderStreamTest, WhatIsShownComesBehindAnEmptyFoldersOwn) {
  FolderStream folder = stream();
  ASSERT_EQ(folder.seek(0), 0);
  std::set<std::string> names;
  for (FolderStream::Entry entry; folder.look(entry) == 0 && entry.name != nullptr;) {
    names.insert(nameOf(entry));
    folder.take(entry);
  }
  EXPECT_EQ(names, (std::set<std::string>{".", "..", "Trash", "Notes"}));
}

}  // namespace
}  // namespace yomber
