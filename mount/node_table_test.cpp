#include "mount/node_table.h"

#include <gtest/gtest.h>
#include <malloc.h>

#include <string>
#include <vector>

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
  NodeTable::Entry entry(Node& folder, std::string_view name) {
    return {.folder = folder, .name = name, .node = nodes_.inPlace(folder, name).get()};
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

TEST_F(NodeTableTest, AFileIsWhereSomebodyElseHasMovedIt) {
  Node& folder1 = folder(root_, "d", 10);
  Node& below = file(folder1, "f", 11);
  nodes_.removed(entry(root_, "d"));
  EXPECT_EQ(wayTo(below), "gone");
  nodes_.seen(root_, "e", folder1.identity);
  EXPECT_EQ(wayTo(below), "e/f");
  nodes_.seen(root_, "g", below.identity);
  EXPECT_EQ(wayTo(below), "g");
  nodes_.seen(root_, "h", {.inode = 11, .born = 7});
  EXPECT_EQ(wayTo(below), "g") << "that is another file";
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
  nodes_.moved(entry(root_, "d"), entry(e, "moved"), false);
  EXPECT_EQ(wayTo(a), "e/moved/a");
}

TEST_F(NodeTableTest, WhatAMoveReplacesIsGone) {
  Node& a = file(root_, "a", 10);
  Node& b = file(root_, "b", 11);
  nodes_.moved(entry(root_, "a"), entry(root_, "b"), false);
  EXPECT_EQ(wayTo(a), "b");
  EXPECT_EQ(wayTo(b), "gone");
}

TEST_F(NodeTableTest, WhoLooksWhereAFileWasMovedBeforeThatIsToldTakesNothingFromIt) {
  Node& a = file(root_, "a", 10);
  Node& b = file(root_, "b", 11);
  const auto remains = std::make_shared<const FileDescriptor>();
  const auto from = entry(root_, "a");
  const auto to = entry(root_, "b");
  file(root_, "b", 10);
  nodes_.moved(from, to, false, {.descriptor = remains});
  EXPECT_EQ(wayTo(a), "b");
  EXPECT_EQ(nodes_.remains(a), nullptr);
  EXPECT_EQ(wayTo(b), "gone");
  EXPECT_EQ(nodes_.remains(b), remains);
}

TEST_F(NodeTableTest, AFileThatWasFoundUnderAnotherNameMeanwhileKeepsThat) {
  Node& a = file(root_, "a", 10);
  const auto removed = entry(root_, "a");
  file(root_, "b", 10);
  nodes_.removed(removed, {.descriptor = std::make_shared<const FileDescriptor>()});
  EXPECT_EQ(wayTo(a), "b");
  EXPECT_EQ(nodes_.remains(a), nullptr);
}

TEST_F(NodeTableTest, AnExchangeChangesPlaces) {
  Node& a = file(root_, "a", 10);
  Node& d = folder(root_, "d", 11);
  Node& b = file(d, "b", 12);
  nodes_.moved(entry(root_, "a"), entry(d, "b"), true);
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
  nodes_.moved(entry(root_, "build"), entry(root_, "build.nosync"), false);
  EXPECT_TRUE(d.isUnwatched);
  EXPECT_TRUE(folder(d, "sub", 11).isUnwatched);
}

TEST_F(NodeTableTest, WhatIsBelowAFolderIsWatchedOrNotAsTheFolderIs) {
  Node& d = folder(root_, "d", 10);
  Node& sub = folder(d, "sub", 11);
  Node& deep = folder(sub, "deep", 12);
  Node& other = folder(root_, "other", 13);
  nodes_.moved(entry(root_, "d"), entry(root_, "d.part"), false);
  for (const Node* each : {&d, &sub, &deep}) EXPECT_TRUE(each->isUnwatched);
  EXPECT_FALSE(other.isUnwatched);
  nodes_.moved(entry(root_, "d.part"), entry(root_, "d"), false);
  for (const Node* each : {&d, &sub, &deep}) EXPECT_FALSE(each->isUnwatched);
}

TEST_F(NodeTableTest, AMoveOfOneNameOfAFileToAnotherChangesNothing) {
  Node& a = file(root_, "a", 10);
  EXPECT_EQ(&file(root_, "b", 10), &a);
  nodes_.moved(entry(root_, "b"), entry(root_, "b"), false);
  EXPECT_EQ(wayTo(a), "b");
}

TEST_F(NodeTableTest, AFileWithTwoNamesIsReachedByTheOneThatWasFoundLast) {
  Node& a = file(root_, "a", 10);
  EXPECT_EQ(&file(root_, "b", 10), &a);
  EXPECT_EQ(wayTo(a), "b");
  nodes_.removed(entry(root_, "b"));
  EXPECT_EQ(wayTo(a), "gone");
  EXPECT_EQ(&file(root_, "a", 10), &a);
  EXPECT_EQ(wayTo(a), "a");
}

TEST_F(NodeTableTest, WhatIsInUseStaysAlthoughItIsForgotten) {
  Node& a = file(root_, "a", 10);
  {
    const NodeUse use = nodes_.use(a);
    nodes_.forget(a, 1);
    nodes_.removed(entry(root_, "a"));
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
  nodes_.removed(entry(root_, "a"), {.descriptor = remains});
  EXPECT_EQ(nodes_.remains(a), remains);
  EXPECT_EQ(remains.use_count(), 2);
  nodes_.forget(a, 1);
  EXPECT_EQ(remains.use_count(), 1);
}

TEST_F(NodeTableTest, AFileThatHasAnotherNameNeedsNoRemains) {
  Node& a = file(root_, "a", 10);
  const auto remains = std::make_shared<const FileDescriptor>();
  nodes_.removed(entry(root_, "a"), {.descriptor = remains});
  EXPECT_EQ(&file(root_, "b", 10), &a);
  EXPECT_EQ(nodes_.remains(a), nullptr);
  nodes_.forget(a, 2);
  EXPECT_EQ(remains.use_count(), 1);
}

TEST_F(NodeTableTest, OfFilesThatHaveOtherNamesTheLastRemainsAreKept) {
  const auto gone = std::make_shared<const FileDescriptor>();
  Node& removed = file(root_, "removed", 9);
  nodes_.removed(entry(root_, "removed"), {.descriptor = gone});
  std::vector<Node*> named;
  for (std::uint64_t i = 0; i <= NodeTable::kNamedKept; ++i) {
    named.push_back(&file(root_, "a", 10 + i));
    nodes_.removed(entry(root_, "a"),
                   {.descriptor = std::make_shared<const FileDescriptor>(), .hasOtherNames = true});
  }
  EXPECT_EQ(nodes_.remains(*named.front()), nullptr);
  EXPECT_NE(nodes_.remains(*named.at(1)), nullptr);
  EXPECT_NE(nodes_.remains(*named.back()), nullptr);
  EXPECT_EQ(nodes_.remains(removed), gone) << "it has no other name";
}

TEST_F(NodeTableTest, RemainsThatHaveEndedTakeNoOthersAlong) {
  const auto replace = [this](std::uint64_t inode) {
    nodes_.removed(entry(root_, "a"),
                   {.descriptor = std::make_shared<const FileDescriptor>(), .hasOtherNames = true});
    return &file(root_, "a", inode);
  };
  Node& first = file(root_, "a", 10);
  replace(10);  // found again
  const auto gone = std::make_shared<const FileDescriptor>();
  nodes_.removed(entry(root_, "a"), {.descriptor = gone});
  file(root_, "a", 11);
  for (std::uint64_t i = 0; i <= NodeTable::kNamedKept; ++i) replace(12 + i);
  EXPECT_EQ(nodes_.remains(first), gone);
}

TEST_F(NodeTableTest, WhatIsReplacedByAMoveLeavesRemainsToo) {
  file(root_, "a", 10);
  Node& b = file(root_, "b", 11);
  const auto remains = std::make_shared<const FileDescriptor>();
  nodes_.moved(entry(root_, "a"), entry(root_, "b"), false, {.descriptor = remains});
  EXPECT_EQ(nodes_.remains(b), remains);
}

TEST_F(NodeTableTest, NamesOfAnyLengthAreFoundAsTheyWereGiven) {
  const std::string longest(255, 'n');
  for (std::size_t length = 1; length <= longest.size(); ++length) {
    const std::string name = longest.substr(0, length);
    Node& node = file(root_, name.c_str(), 1000 + length);
    EXPECT_EQ(wayTo(node), name);
    EXPECT_EQ(nodes_.inPlace(root_, name).get(), &node);
  }
  nodes_.moved(entry(root_, longest), entry(root_, "short"), false);
  nodes_.moved(entry(root_, "n"), entry(root_, longest + longest), false);
  EXPECT_EQ(nodes_.inPlace(root_, "short")->identity.inode, 1255U);
  EXPECT_EQ(nodes_.inPlace(root_, longest + longest)->identity.inode, 1001U);
  EXPECT_EQ(nodes_.inPlace(root_, "n").get(), nullptr);
}

TEST_F(NodeTableTest, ManyAreFoundUntilTheyAreForgotten) {
  constexpr std::uint64_t kMany = 10'000;
  std::vector<Node*> made;
  for (std::uint64_t i = 0; i < kMany; ++i) {
    made.push_back(&file(root_, std::to_string(i).c_str(), 1000 + 4096 * i));
  }
  EXPECT_EQ(nodes_.all().size(), kMany + 1);
  for (std::uint64_t i = 0; i < kMany; i += 2) nodes_.forget(*made[i], 1);
  EXPECT_EQ(nodes_.size(), kMany / 2 + 1);
  for (std::uint64_t i = 0; i < kMany; ++i) {
    Node* const kept = i % 2 == 0 ? nullptr : made[i];
    EXPECT_EQ(nodes_.byInode(1000 + 4096 * i).get(), kept);
    EXPECT_EQ(nodes_.inPlace(root_, std::to_string(i)).get(), kept);
  }
}

TEST_F(NodeTableTest, ANodeTakesLittleMemory) {
  const auto allocated = [] {
    const struct mallinfo2 info = mallinfo2();
    return info.uordblks + info.hblkhd;
  };
  constexpr std::size_t kMany = 100'000;
  const std::size_t before = allocated();
  for (std::size_t i = 0; i < kMany; ++i) {
    file(root_, ("IMG_" + std::to_string(i) + ".jpg").c_str(), 1000 + i);
  }
  const std::size_t taken = allocated() - before;
  if (taken == 0) GTEST_SKIP() << "this heap does not say what it has allocated";
  EXPECT_LE(taken / kMany, 128U);
}

}  // namespace
}  // namespace yomber
