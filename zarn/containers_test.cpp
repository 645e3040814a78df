#include "zarn/containers.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <chrono>
#include <filesystem>
#include <fstream>

#include "platform/foundation/lock.h"
#include "platform/ostrell/constants.h"

namespace yomber {
namespace {

using testing::ElementsAre;

class ContainersTest : public testing::Test {
 protected:
  ContainersTest() {
    char directory[] = "/tmp/yomber-containers-XXXXXX";
    base_ = mkdtemp(directory);
    for (const char* name : {"/user", "/system"}) {
      directories_.push_back(base_ + name);
      std::filesystem::create_directory(base_ + name);
    }
  }
  ~ContainersTest() override { std::filesystem::remove_all(base_); }

  void install(const std::string& file, const std::string& keys) {
    std::filesystem::create_directories(std::filesystem::path(base_ + "/" + file).parent_path());
    std::ofstream(base_ + "/" + file) << "[Desktop Entry]\n" << keys;
  }
  std::vector<ContainerRecord> read() const {
    auto list = readContainers(directories_, layout());
    list.erase(list.begin(), list.begin() + 3);
    return list;
  }
  TreeLayout layout() const { return TreeLayout(base_ + "/home"); }

  std::string base_;
  std::vector<std::string> directories_;
};

TEST_F(ContainersTest, TheDrivesOwnComeFirst) {
  const auto list = readContainers({}, layout());
  ASSERT_EQ(list.size(), 3U);
  EXPECT_EQ(list[0].containerID, QSUbiquitousDefaultContainerID);
  EXPECT_EQ(list[0].documents, layout().root());
  EXPECT_EQ(list[1].documents, layout().root() + "/Documents");
  EXPECT_EQ(list[2].containerID, QSUbiquitousDesktopContainerID);
}

TEST_F(ContainersTest, AnApplicationsContainerHasItsNameIconAndFolder) {
  install(
      "system/sub/org.notes.desktop",
      "Name=Notes\nIcon=notes\nX-Yomber-Container=org.notes\nX-Yomber-Container-Name=My/Notes\n");
  EXPECT_THAT(read(), ElementsAre(ContainerRecord{.containerID = "org.notes",
                                                  .displayName = "My-Notes",
                                                  .documents = layout().documents("org.notes"),
                                                  .applicationID = "sub-org.notes",
                                                  .iconName = "notes"}));
}

TEST_F(ContainersTest, TheUsersFileStandsInForTheSystems) {
  install("system/a.desktop", "Name=System\nX-Yomber-Container=org.a\n");
  install("user/a.desktop", "Name=User\nX-Yomber-Container=org.a\n");
  ASSERT_EQ(read().size(), 1U);
  EXPECT_EQ(read()[0].displayName, "User");
  install("user/a.desktop", "Hidden=true\n");
  EXPECT_TRUE(read().empty());
}

TEST_F(ContainersTest, NobodyTakesAnothersContainerOrTheDrivesOwn) {
  install("user/a.desktop", "Name=First\nX-Yomber-Container=org.shared\n");
  install("system/b.desktop", std::string("Name=Second\nX-Yomber-Containers=org.shared;org.b;") +
                                  QSUbiquitousDefaultContainerID + "\n");
  const auto list = read();
  ASSERT_EQ(list.size(), 2U);
  EXPECT_EQ(list[0].containerID, "org.b");
  EXPECT_EQ(list[1].displayName, "First");
}

TEST_F(ContainersTest, NamesThatCannotBeAFoldersAreReplaced) {
  install("user/a.desktop", "Name=..\nX-Yomber-Container=org.a\n");
  install("user/b.desktop", "X-Yomber-Container=org.b\n");
  install("user/c.desktop", "Name=" + std::string(199, 'x') + "ä\nX-Yomber-Container=org.c\n");
  const auto list = read();
  ASSERT_EQ(list.size(), 3U);
  EXPECT_EQ(list[0].displayName, "org.a");
  EXPECT_EQ(list[1].displayName, "org.b");
  EXPECT_EQ(list[2].displayName, std::string(199, 'x'));
}

TEST_F(ContainersTest, WhatIsNoFileIsPassedOver) {
  ASSERT_EQ(mkfifo((base_ + "/user/pipe.desktop").c_str(), 0600), 0);
  std::filesystem::create_directory(base_ + "/user/folder.desktop");
  EXPECT_TRUE(read().empty());
}

class FollowedContainersTest : public ContainersTest {
 protected:
  void start(Containers& containers) {
    ASSERT_EQ(containers.start({.apply =
                                    [this](const std::vector<ContainerFolder>& folders) {
                                      LockGuard guard(mutex_);
                                      applied_.push_back(folders.size());
                                      changed_.notifyAll();
                                      return std::exchange(failure_, nullptr);
                                    },
                                .didChange =
                                    [this] {
                                      LockGuard guard(mutex_);
                                      ++changes_;
                                      changed_.notifyAll();
                                    }}),
              nullptr);
  }
  bool waitForChanges(int count) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    LockGuard guard(mutex_);
    while (changes_ < count) {
      if (!changed_.waitUntil(mutex_, deadline)) return false;
    }
    return true;
  }
  bool waitForApplied(std::size_t count) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    LockGuard guard(mutex_);
    while (applied_.size() < count) {
      if (!changed_.waitUntil(mutex_, deadline)) return false;
    }
    return true;
  }

  Mutex mutex_;
  Condition changed_;
  int changes_ GUARDED_BY(mutex_) = 0;
  std::vector<std::size_t> applied_ GUARDED_BY(mutex_);
  NSErrorRef failure_ GUARDED_BY(mutex_);
};

TEST_F(FollowedContainersTest, FollowsWhatIsInstalledAndRemoved) {
  install("user/a.desktop", "Name=A\nX-Yomber-Container=org.a\n");
  Containers containers(directories_, layout());
  start(containers);
  const auto first = containers.list();
  EXPECT_EQ(first->containers.size(), 4U);
  install("system/b.desktop", "Name=B\nX-Yomber-Container=org.b\n");
  ASSERT_TRUE(waitForChanges(2));
  EXPECT_EQ(containers.list()->containers.size(), 5U);
  EXPECT_GT(containers.list()->generation, first->generation);
  std::filesystem::remove(base_ + "/user/a.desktop");
  ASSERT_TRUE(waitForChanges(3));
  EXPECT_EQ(containers.list()->containers.size(), 4U);
  LockGuard guard(mutex_);
  EXPECT_THAT(applied_, ElementsAre(1U, 2U, 1U));
}

TEST_F(FollowedContainersTest, AListThatCannotBeStoredIsNotShownUntilItWas) {
  Containers containers(directories_, layout());
  start(containers);
  {
    LockGuard guard(mutex_);
    failure_ = NSError::errorWithErrno(ENOSPC);
  }
  install("user/a.desktop", "Name=A\nX-Yomber-Container=org.a\n");
  ASSERT_TRUE(waitForApplied(2));
  EXPECT_EQ(containers.list()->containers.size(), 3U);
  install("user/b.desktop", "Name=B\n");  // tried again at the next change
  ASSERT_TRUE(waitForChanges(1));
  EXPECT_EQ(containers.list()->containers.size(), 4U);
}

}  // namespace
}  // namespace yomber
