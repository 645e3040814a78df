#include "mount/node_table.h"

#include <gtest/gtest.h>

#include "mount/open_files.h"

namespace yomber {
namespace {

struct statx statusOf(std::uint64_t inode, std::uint32_t type = S_IFREG, std::int64_t born = 1) {
  struct statx status{};
  status.stx_mask = kWantedStatus;
  status.stx_ino = inode;
  status.stx_mode = static_cast<__u16>(type | 0644U);
  status.stx_btime.tv_sec = born;
  return status;
}

class NodeTableTest : public ::testing::Test {
 protected:
  Node& folder(Node& above, const char* name, std::uint64_t inode) {
    return nodes_.found(above, name, statusOf(inode, S_IFDIR));
  }
  Node& file(Node& above, const char* name, std::uint64_t inode) {
    return nodes_.found(above, name, statusOf(inode));
  }
  /// "a/b/c"; "gone" when it has no place.
  std::string wayTo(const Node& node) {
    const auto way = nodes_.wayTo(node);
    if (!way) return "gone";
    std::string result;
    for (const auto& step : way->steps) result += (result.empty() ? "" : "/") + step.name;
    return result;
  }

  NodeTable nodes_;
  Node& root_ = nodes_.addBase(0, {.inode = 1, .born = 1});
};

TEST_F(NodeTableTest, AFileIsOneNodeHoweverOftenItIsFound) {
  Node& first = file(root_, "a", 10);
  EXPECT_EQ(&file(root_, "a", 10), &first);
  EXPECT_EQ(wayTo(first), "a");
  nodes_.forget(first, 1);
  EXPECT_EQ(nodes_.inPlace(root_, "a").get(), &first);
  nodes_.forget(first, 1);
  EXPECT_EQ(nodes_.inPlace(root_, "a").get(), nullptr);
  EXPECT_EQ(nodes_.size(), 1U);
}

TEST_F(NodeTableTest, AnInodeNumberThatIsGivenAgainIsAnotherNode) {
  Node& first = file(root_, "a", 10);
  Node& second = nodes_.found(root_, "b", statusOf(10, S_IFREG, 2));
  EXPECT_NE(&first, &second);
  EXPECT_EQ(nodes_.byInode(10).get(), &second);
  nodes_.forget(first, 1);
  EXPECT_EQ(nodes_.byInode(10).get(), &second);
}

TEST_F(NodeTableTest, OfTwoAnswersThatMetTheKernelMayHaveEither) {
  Node& node = file(root_, "a", 10);
  nodes_.noteTold(node, 0);
  nodes_.noteTold(node, 7);
  nodes_.noteTold(node, 7);
  EXPECT_EQ(nodes_.told(node), 7);
  nodes_.noteTold(node, 8);
  EXPECT_NE(nodes_.told(node), 7);
  EXPECT_NE(nodes_.told(node), 8);
  nodes_.noteTold(node, 8);
  EXPECT_NE(nodes_.told(node), 8);
  nodes_.noteTold(node, 0);
  nodes_.noteTold(node, 8);
  EXPECT_EQ(nodes_.told(node), 8);
}

TEST_F(NodeTableTest, AFolderStaysWhileTheKernelKnowsWhatIsInIt) {
  Node& d = folder(root_, "d", 10);
  Node& a = file(d, "a", 11);
  nodes_.forget(d, 1);
  EXPECT_EQ(wayTo(a), "d/a");
  nodes_.forget(a, 1);
  EXPECT_EQ(nodes_.size(), 1U);
}

TEST_F(NodeTableTest, AMoveTakesWhatIsBelowAlong) {
  Node& d = folder(root_, "d", 10);
  Node& a = file(d, "a", 11);
  Node& e = folder(root_, "e", 12);
  nodes_.moved(root_, "d", e, "moved", false);
  EXPECT_EQ(wayTo(a), "e/moved/a");
}

TEST_F(NodeTableTest, WhatAMoveReplacesIsGone) {
  Node& a = file(root_, "a", 10);
  Node& b = file(root_, "b", 11);
  nodes_.moved(root_, "a", root_, "b", false);
  EXPECT_EQ(wayTo(a), "b");
  EXPECT_EQ(wayTo(b), "gone");
}

TEST_F(NodeTableTest, AnExchangeChangesPlaces) {
  Node& a = file(root_, "a", 10);
  Node& d = folder(root_, "d", 11);
  Node& b = file(d, "b", 12);
  nodes_.moved(root_, "a", d, "b", true);
  EXPECT_EQ(wayTo(a), "d/b");
  EXPECT_EQ(wayTo(b), "a");
}

TEST_F(NodeTableTest, FoldersThatHaveChangedPlacesBehindOurBackMakeNoCycle) {
  Node& a = folder(root_, "a", 10);
  Node& b = folder(a, "b", 11);
  // On the disk it is b/a by now, and that is found before b is.
  EXPECT_EQ(&folder(b, "a", 10), &a);
  EXPECT_EQ(wayTo(a), "gone");
  EXPECT_EQ(&folder(root_, "b", 11), &b);
  EXPECT_EQ(wayTo(a), "b/a");
}

TEST_F(NodeTableTest, AFolderThatIsRenamedToOneThatNobodyWatchesIsUnwatched) {
  Node& d = folder(root_, "build", 10);
  EXPECT_FALSE(d.isUnwatched);
  nodes_.moved(root_, "build", root_, "build.nosync", false);
  EXPECT_TRUE(d.isUnwatched);
  EXPECT_TRUE(folder(d, "sub", 11).isUnwatched);
}

TEST_F(NodeTableTest, AMoveOfOneNameOfAFileToAnotherChangesNothing) {
  Node& a = file(root_, "a", 10);
  EXPECT_EQ(&file(root_, "b", 10), &a);
  nodes_.moved(root_, "b", root_, "b", false);
  EXPECT_EQ(wayTo(a), "b");
}

TEST_F(NodeTableTest, AFileWithTwoNamesIsReachedByTheOneThatWasFoundLast) {
  Node& a = file(root_, "a", 10);
  EXPECT_EQ(&file(root_, "b", 10), &a);
  EXPECT_EQ(wayTo(a), "b");
  nodes_.removed(root_, "b");
  EXPECT_EQ(wayTo(a), "gone");
  EXPECT_EQ(&file(root_, "a", 10), &a);
  EXPECT_EQ(wayTo(a), "a");
}

TEST_F(NodeTableTest, WhatIsInUseStaysAlthoughItIsForgotten) {
  Node& a = file(root_, "a", 10);
  {
    const NodeUse use = nodes_.use(a);
    nodes_.forget(a, 1);
    nodes_.removed(root_, "a");
    EXPECT_EQ(use->identity.inode, 10U);
    EXPECT_EQ(nodes_.size(), 2U);
  }
  EXPECT_EQ(nodes_.size(), 1U);
}

TEST_F(NodeTableTest, MoreIsNeverForgottenThanWasTold) {
  Node& a = file(root_, "a", 10);
  const NodeUse use = nodes_.use(a);
  nodes_.forget(a, 1000);
  EXPECT_EQ(&file(root_, "a", 10), &a);
  nodes_.forget(root_, 1000);
  EXPECT_EQ(wayTo(a), "a");
}

TEST_F(NodeTableTest, RemembersWhatTheKernelWasTold) {
  Node& a = file(root_, "a", 10);
  nodes_.noteTold(a, 42);
  EXPECT_EQ(nodes_.told(a), 42);
  (void)file(root_, "a", 10);
  EXPECT_EQ(nodes_.told(a), 0) << "its ctime";
}

TEST_F(NodeTableTest, WhatIsLeftOfARemovedFileIsKeptUntilTheKernelForgetsIt) {
  Node& a = file(root_, "a", 10);
  const auto remains = std::make_shared<const FileDescriptor>();
  nodes_.removed(root_, "a", remains);
  EXPECT_EQ(nodes_.remains(a), remains);
  EXPECT_EQ(remains.use_count(), 2);
  nodes_.forget(a, 1);
  EXPECT_EQ(remains.use_count(), 1);
}

TEST_F(NodeTableTest, AFileThatHasAnotherNameNeedsNoRemains) {
  Node& a = file(root_, "a", 10);
  const auto remains = std::make_shared<const FileDescriptor>();
  nodes_.removed(root_, "a", remains);
  EXPECT_EQ(&file(root_, "b", 10), &a);
  EXPECT_EQ(nodes_.remains(a), nullptr);
  nodes_.forget(a, 2);
  EXPECT_EQ(remains.use_count(), 1);
}

TEST_F(NodeTableTest, WhatIsReplacedByAMoveLeavesRemainsToo) {
  file(root_, "a", 10);
  Node& b = file(root_, "b", 11);
  const auto remains = std::make_shared<const FileDescriptor>();
  nodes_.moved(root_, "a", root_, "b", false, remains);
  EXPECT_EQ(nodes_.remains(b), remains);
}

}  // namespace
}  // namespace yomber
