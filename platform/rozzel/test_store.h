#pragma once

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <functional>
#include <memory>
#include <span>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/foundation/temporary_directory.h"
#include "platform/rozzel/container.h"
#include "platform/rozzel/embedded_engine.h"
#include "platform/rozzel/records_connection.h"

namespace yomber {

inline const RZRecordZoneID kZone("documents");

/// Damages the stored values of the records of that name.
inline void damageRecord(const std::string& storeFolder, const std::string& name) {
  RecordsConnection connection(storeFolder + "/records.db", RecordsConnection::Missing::Fail, 1000);
  const std::string sql =
      "UPDATE record SET body=x'ff00ff' WHERE CAST(name AS TEXT)='" + name + "'";
  connection.execute(sql.c_str());
  ASSERT_EQ(connection.changes(), 1);
}

/// A store in a folder of its own, with a container of the account "ann" and a zone.
class TestStore {
 public:
  explicit TestStore(EmbeddedEngineOptions options = {}) : options_(std::move(options)) {
    EXPECT_EQ(EmbeddedEngine::create(folder()), nullptr);
    reopen();
    EXPECT_EQ(database()->createZone(kZone), nullptr);
  }

  [[nodiscard]] std::string folder() const { return directory_ / "store"; }
  [[nodiscard]] const std::shared_ptr<EmbeddedEngine>& engine() const { return engine_; }
  [[nodiscard]] RZDatabaseRef database(const std::string& account = "ann") const {
    return RZContainer(engine_, "com.example.drive", account).privateCloudDatabase();
  }
  [[nodiscard]] RZDatabaseRef sharedDatabase(const std::string& account) const {
    return RZContainer(engine_, "com.example.drive", account).sharedCloudDatabase();
  }
  /// Before a fork: SQLite's connections must not be carried across.
  void close() { engine_.reset(); }
  /// As a process that has just started would see it.
  void reopen() { engine_ = std::make_shared<EmbeddedEngine>(folder(), options_); }

  [[nodiscard]] std::string pathOf(const RZAsset& asset) const {
    return folder() + "/assets/" + asset.hexHash().substr(0, 2) + "/" + asset.hexHash();
  }

 private:
  TemporaryDirectory directory_;
  const EmbeddedEngineOptions options_;
  std::shared_ptr<EmbeddedEngine> engine_;
};

inline RZRecordID recordID(const std::string& name, const RZRecordZoneID& zone = kZone) {
  return {name, zone};
}

inline std::shared_ptr<RZRecord> newRecord(const std::string& name, RZValues values = {},
                                           const RZRecordZoneID& zone = kZone) {
  auto record = std::make_shared<RZRecord>("document", recordID(name, zone));
  for (auto& [key, value] : values) record->setObject(std::move(value), key);
  return record;
}

inline NSErrorRef save(const RZDatabaseRef& database, std::vector<RZRecordRef> records,
                       RZRecordSavePolicy policy = RZRecordSavePolicy::IfServerRecordUnchanged) {
  std::vector<RZRecordRef> saved;
  return database->modifyRecords({.recordsToSave = std::move(records), .savePolicy = policy},
                                 saved);
}

inline NSErrorRef remove(const RZDatabaseRef& database, const RZRecordID& id) {
  std::vector<RZRecordRef> saved;
  return database->modifyRecords({.recordsToDelete = {{.recordID = id}}}, saved);
}

inline RZRecordRef fetch(const RZDatabaseRef& database, const std::string& name,
                         const RZRecordZoneID& zone = kZone) {
  return database->fetchRecord(recordID(name, zone));
}

/// Saves a copy of the stored record with one key set.
inline NSErrorRef change(const RZDatabaseRef& database, const std::string& name,
                         const std::string& key, RZValue value) {
  const auto copy = std::make_shared<RZRecord>(*fetch(database, name));
  copy->setObject(std::move(value), key);
  return save(database, {copy});
}

inline RZAsset storeText(RZEngine& engine, std::string_view text) {
  RZAsset asset;
  EXPECT_EQ(engine.storeAsset(std::as_bytes(std::span(text)), asset), nullptr);
  return asset;
}

/// Starts `work` in a process of its own; its answer is the exit status. No store may be open here.
inline pid_t startProcess(const std::function<int()>& work) {
  const pid_t child = fork();
  if (child == 0) {
    const rlimit noCore{.rlim_cur = 0, .rlim_max = 0};
    setrlimit(RLIMIT_CORE, &noCore);
    _exit(work());
  }
  return child;
}

/// The exit status of a process; 128 + signal when it was killed.
inline int waitForProcess(pid_t child) {
  int status = 0;
  if (child < 0 || waitpid(child, &status, 0) != child) return -1;
  return WIFSIGNALED(status) ? 128 + WTERMSIG(status) : WEXITSTATUS(status);
}

inline int inAnotherProcess(const std::function<int()>& work) {
  return waitForProcess(startProcess(work));
}

inline FileDescriptor newFile(const std::string& path) {
  return FileDescriptor(open(path.c_str(), O_RDWR | O_CREAT | O_TRUNC | O_CLOEXEC, 0600));
}

inline void writeText(int descriptor, std::string_view text, off_t offset = 0) {
  ASSERT_EQ(pwrite(descriptor, text.data(), text.size(), offset),
            static_cast<ssize_t>(text.size()));
}

inline std::string readText(int descriptor) {
  std::string text;
  std::string buffer(1 << 16, '\0');
  while (true) {
    const ssize_t count =
        pread(descriptor, buffer.data(), buffer.size(), static_cast<off_t>(text.size()));
    if (count <= 0) return text;
    text.append(buffer, 0, static_cast<std::size_t>(count));
  }
}

}  // namespace yomber
