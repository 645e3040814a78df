#pragma once

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <memory>
#include <string>
#include <vector>

#include "platform/foundation/lock.h"
#include "platform/foundation/temporary_directory.h"
#include "zarn/database.h"
#include "zarn/item_attributes.h"
#include "zarn/item_store.h"
#include "zarn/scanner.h"
#include "zarn/tree_layout.h"

namespace yomber {

/// Collects what is committed.
class RecordingSink : public ChangeSink {
 public:
  void committed(const std::vector<ItemChange>& changes) override {
    LockGuard guard(mutex_);
    changes_.insert(changes_.end(), changes.begin(), changes.end());
  }
  std::vector<ItemChange> take() {
    LockGuard guard(mutex_);
    return std::exchange(changes_, {});
  }

 private:
  Mutex mutex_;
  std::vector<ItemChange> changes_ GUARDED_BY(mutex_);
};

/// A real drive in a temporary place: tree, database and scanner. Paths of its operations are below
/// the root folder.
class TestDrive : public testing::Test {
 protected:
  TestDrive() : layout(directory_.path() + "/home") {
    EXPECT_EQ(layout.createFolders(), 0);
    open();
  }

  void open() {
    NSErrorRef error;
    database = Database::open(layout.databasePath(), &error);
    ASSERT_NE(database, nullptr) << error->description();
    store = std::make_shared<ItemStore>(database, layout);
    scanner = std::make_unique<Scanner>(store, std::weak_ptr<FolderVisitor>());
    sink = std::make_shared<RecordingSink>();
    database->addSink(sink);
  }
  void close() {
    scanner.reset();
    store.reset();
    database.reset();
  }
  void reopen() {
    close();
    open();
  }
  ScanReport scan() {
    ScanReport report;
    const NSErrorRef error = scanner->scanAll(&report);
    EXPECT_EQ(error, nullptr) << error->description();
    return report;
  }
  /// Writes all ids that a first scan left unwritten.
  void stampAll() {
    for (std::uint32_t count = 1; count != 0;) {
      const NSErrorRef error = scanner->stampSome(100, count);
      ASSERT_EQ(error, nullptr) << error->description();
    }
  }

  [[nodiscard]] std::string at(const std::string& path) const {
    return path.empty() ? layout.root() : layout.root() + "/" + path;
  }
  void write(const std::string& path, const std::string& content = "text") const {
    std::ofstream(at(path), std::ios::binary) << content;
    ASSERT_TRUE(std::filesystem::exists(std::filesystem::symlink_status(at(path)))) << path;
  }
  void makeFolder(const std::string& path) const {
    ASSERT_EQ(mkdir(at(path).c_str(), 0700), 0) << path;
  }
  void rename(const std::string& from, const std::string& to) const {
    ASSERT_EQ(::rename(at(from).c_str(), at(to).c_str()), 0) << from << " " << to;
  }
  void remove(const std::string& path) const { std::filesystem::remove_all(at(path)); }
  void setAttribute(const std::string& path, const char* name, const std::string& value) const {
    ASSERT_EQ(lsetxattr(at(path).c_str(), name, value.data(), value.size(), 0), 0) << path;
  }
  void removeAttribute(const std::string& path, const char* name) const {
    ASSERT_EQ(lremovexattr(at(path).c_str(), name), 0) << path;
  }
  [[nodiscard]] std::optional<std::uint64_t> idOnDisk(const std::string& path) const {
    return readItemAttributes(at(path).c_str()).id;
  }
  [[nodiscard]] std::optional<ItemRow> row(const std::string& path) const {
    NSErrorRef error;
    auto result = store->itemAtPath(at(path), &error);
    EXPECT_EQ(error, nullptr);
    return result;
  }
  /// 0 when there is no such item.
  [[nodiscard]] std::uint64_t id(const std::string& path) const {
    const auto found = row(path);
    return found ? found->id : 0;
  }
  [[nodiscard]] std::vector<std::string> names(std::uint64_t folder = kRootID) const {
    std::vector<std::string> result;
    for (const ItemRow& child : store->children(folder)) result.push_back(child.name);
    std::sort(result.begin(), result.end());
    return result;
  }
  NSErrorRef scanFolders(const std::vector<std::string>& paths) {
    std::vector<std::uint64_t> ids;
    for (const std::string& path : paths) ids.push_back(id(path));
    return scanner->scanFolders(ids);
  }

 private:
  TemporaryDirectory directory_;

 protected:
  TreeLayout layout;
  std::shared_ptr<Database> database;
  std::shared_ptr<ItemStore> store;
  std::unique_ptr<Scanner> scanner;
  std::shared_ptr<RecordingSink> sink;
};

}  // namespace yomber
