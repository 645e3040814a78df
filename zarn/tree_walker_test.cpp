#include "zarn/tree_walker.h"

#include <dirent.h>

#include <functional>
#include <map>
#include <set>

#include "zarn/test_drive.h"

namespace yomber {
namespace {

class TreeWalkerTest : public TestDrive {
 protected:
  static TreeWalker walker(std::weak_ptr<FolderVisitor> visitor = {}) {
    return TreeWalker({std::move(visitor), [] { return std::uint64_t{0}; }, false});
  }
  static std::size_t openDescriptors() {
    std::size_t count = 0;
    for ([[maybe_unused]] const auto& entry :
         std::filesystem::directory_iterator("/proc/self/fd")) {
      ++count;
    }
    return count;
  }
  /// A chain of folders too deep for any path; a file at its end.
  void makeDeep(int depth) const {
    FileDescriptor folder(::open(layout.root().c_str(), O_RDONLY | O_DIRECTORY));
    for (int i = 0; i < depth; ++i) {
      ASSERT_EQ(mkdirat(folder.get(), kLevelName.c_str(), 0700), 0);
      folder = FileDescriptor(openat(folder.get(), kLevelName.c_str(), O_RDONLY | O_DIRECTORY));
      ASSERT_TRUE(folder);
    }
    const FileDescriptor file(openat(folder.get(), "end", O_CREAT | O_WRONLY, 0600));
    ASSERT_TRUE(file);
  }
  inline static const std::string kLevelName = "a folder that lies in another one of the same name";
};

TEST_F(TreeWalkerTest, ReachesBeyondTheLongestPathWithFewDescriptors) {
  constexpr int kDepth = 3000;
  makeDeep(kDepth);
  const std::size_t before = openDescriptors();
  std::size_t most = 0;
  std::size_t folders = 0;
  bool sawEnd = false;
  EXPECT_TRUE(walker().walk(openFolder(layout.root()), TreeWalker::nextVisit(),
                            [&](std::unique_ptr<FolderSnapshot> snapshot) {
                              EXPECT_TRUE(snapshot->isReadable);
                              if (folders++ % 100 == 0) most = std::max(most, openDescriptors());
                              sawEnd = sawEnd || snapshot->names == "end";
                              return true;
                            }));
  EXPECT_EQ(folders, kDepth + 1U);
  EXPECT_TRUE(sawEnd);
  EXPECT_LE(most, before + 100);
  EXPECT_EQ(openDescriptors(), before);

  // The whole engine gets there as well.
  EXPECT_EQ(scan().entries, kDepth + 1U);
  std::uint64_t folder = kRootID;
  for (int i = 0; i < kDepth; ++i) folder = store->itemByName(folder, kLevelName)->id;
  EXPECT_EQ(names(folder), std::vector<std::string>{"end"});
  ASSERT_EQ(scanner->scanFolders({folder}), nullptr);
  EXPECT_EQ(store->ancestors(folder).size(), static_cast<std::size_t>(kDepth));
  EXPECT_EQ(scan().changes, 0U);
}

TEST_F(TreeWalkerTest, WideAndDeepTreesAreReadToTheEnd) {
  std::set<std::string> wanted;
  for (int i = 0; i < 20; ++i) {
    std::string path = "branch " + std::to_string(i);
    makeFolder(path);
    for (int level = 0; level < 100; ++level) {
      path += "/" + std::to_string(level);
      makeFolder(path);
      if (level % 50 == 49) write(path + "/leaf " + std::to_string(i));
    }
  }
  std::size_t folders = 0;
  std::size_t files = 0;
  walker().walk(openFolder(layout.root()), TreeWalker::nextVisit(),
                [&](std::unique_ptr<FolderSnapshot> snapshot) {
                  EXPECT_TRUE(snapshot->isReadable);
                  ++folders;
                  for (const FolderEntry& entry : snapshot->entries) {
                    files += entry.type == EntryType::File ? 1 : 0;
                  }
                  return true;
                });
  EXPECT_EQ(folders, 1U + 20U + 2000U);
  EXPECT_EQ(files, 40U);
}

TEST_F(TreeWalkerTest, SurvivesFoldersThatVanishOnTheWay) {
  for (const char* name : {"a", "b", "c"}) {
    makeFolder(name);
    write(std::string(name) + "/x");
  }
  std::size_t unreadable = 0;
  bool isFirst = true;
  EXPECT_TRUE(walker().walk(openFolder(layout.root()), TreeWalker::nextVisit(),
                            [&](std::unique_ptr<FolderSnapshot> snapshot) {
                              if (std::exchange(isFirst, false)) {
                                remove("a");
                                remove("b");
                                remove("c");
                              }
                              unreadable += snapshot->isReadable ? 0 : 1;
                              return true;
                            }));
  EXPECT_EQ(unreadable, 3U);
}

TEST_F(TreeWalkerTest, StopsWhenToldTo) {
  makeFolder("a");
  std::size_t folders = 0;
  EXPECT_FALSE(walker().walk(openFolder(layout.root()), TreeWalker::nextVisit(),
                             [&](std::unique_ptr<FolderSnapshot>) { return ++folders == 0; }));
  EXPECT_EQ(folders, 1U);
}

/// Notes the folders that it is told of, and checks that each is open when it is.
class NotingVisitor : public FolderVisitor {
 public:
  void willReadFolder(std::uint64_t visit, int descriptor) override {
    LockGuard guard(mutex_);
    struct stat status{};
    EXPECT_EQ(fstat(descriptor, &status), 0);
    inodes_[visit] = status.st_ino;
  }
  void didIdentifyFolder(std::uint64_t visit, std::uint64_t id) override {
    LockGuard guard(mutex_);
    EXPECT_TRUE(inodes_.contains(visit));
    inodeOfID_[id] = inodes_[visit];
  }
  void didNotReadFolder(std::uint64_t) override {}
  std::map<std::uint64_t, std::uint64_t> takeInodes() {
    LockGuard guard(mutex_);
    return std::exchange(inodeOfID_, {});
  }

 private:
  Mutex mutex_;
  std::map<std::uint64_t, std::uint64_t> inodes_ GUARDED_BY(mutex_);
  std::map<std::uint64_t, std::uint64_t> inodeOfID_ GUARDED_BY(mutex_);
};

TEST_F(TreeWalkerTest, VisitorsLearnWhichFolderEachVisitRead) {
  makeFolder("a");
  makeFolder("a/b");
  const auto visitor = std::make_shared<NotingVisitor>();
  Scanner visited(store, visitor);
  const auto expectRight = [&](std::set<std::string> paths) {
    const auto inodes = visitor->takeInodes();
    std::set<std::uint64_t> ids;
    for (const std::string& path : paths) {
      struct stat status{};
      ASSERT_EQ(stat(at(path).c_str(), &status), 0);
      const auto found = inodes.find(id(path));
      ASSERT_NE(found, inodes.end()) << path;
      EXPECT_EQ(found->second, status.st_ino);
    }
  };
  ASSERT_EQ(visited.scanAll(), nullptr);
  expectRight({"", "a", "a/b"});
  ASSERT_EQ(visited.scanAll(), nullptr);
  expectRight({"", "a", "a/b"});
  makeFolder("new");
  makeFolder("new/sub");
  ASSERT_EQ(visited.scanFolders({kRootID}), nullptr);
  expectRight({"", "new", "new/sub"});
  makeFolder("located");
  makeFolder("located/sub");
  ASSERT_TRUE(visited.scanLocation(at("located")));
  expectRight({"located", "located/sub"});
}

}  // namespace
}  // namespace yomber
