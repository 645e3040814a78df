#include "platform/fileprovider/staging_folder.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <csignal>
#include <filesystem>
#include <fstream>
#include <thread>
#include <vector>

#include "platform/foundation/file_manager.h"
#include "platform/foundation/temporary_directory.h"

namespace yomber {
namespace {

std::size_t count(const TemporaryDirectory& directory) {
  return NSFileManager::defaultManager().contentsOfDirectoryAtPath(directory.path())->size();
}

TEST(StagingFolder, GoesWithAllThatIsInIt) {
  const TemporaryDirectory parent;
  {
    const auto staging = StagingFolder::make(parent.path());
    ASSERT_NE(staging, nullptr);
    std::filesystem::create_directories(staging->content() + "/inner");
    chmod(staging->content().c_str(), 0500);
    EXPECT_EQ(count(parent), 1U);
  }
  EXPECT_EQ(count(parent), 0U);
}

TEST(StagingFolder, StaysWhileItIsUsed) {
  const TemporaryDirectory parent;
  const auto first = StagingFolder::make(parent.path());
  const auto second = StagingFolder::make(parent.path());
  ASSERT_NE(second, nullptr);
  EXPECT_NE(first->path(), second->path());
  EXPECT_TRUE(std::filesystem::exists(first->path()));
}

TEST(StagingFolder, RemovesWhatADeadProcessLeftAndNothingElse) {
  const TemporaryDirectory parent;
  std::ofstream(parent / "somebody's file") << "kept";
  EXPECT_EXIT(
      {
        const auto staging = StagingFolder::make(parent.path());
        std::ofstream(staging->content()) << "left";
        (void)raise(SIGKILL);
      },
      testing::KilledBySignal(SIGKILL), "");
  EXPECT_EQ(count(parent), 2U);
  {
    const auto next = StagingFolder::make(parent.path());
  }
  EXPECT_EQ(count(parent), 1U);
}

TEST(StagingFolder, IsSaidToBeImpossibleWhereThereIsNoFolder) {
  const TemporaryDirectory parent;
  EXPECT_EQ(StagingFolder::make(parent / "nothing"), nullptr);
  EXPECT_EQ(errno, ENOENT);
}

TEST(StagingFolder, ManyAreMadeBesideEachOther) {
  const TemporaryDirectory parent;
  std::atomic<int> failures{0};
  std::vector<std::thread> threads;
  for (int i = 0; i < 8; ++i) {
    threads.emplace_back([&] {
      for (int round = 0; round < 50; ++round) {
        const auto staging = StagingFolder::make(parent.path());
        if (staging == nullptr) {
          ++failures;
          continue;
        }
        std::ofstream(staging->content()) << "x";
        if (!std::filesystem::exists(staging->content())) ++failures;
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(failures, 0);
  EXPECT_EQ(count(parent), 0U);
}

}  // namespace
}  // namespace yomber
