#include "zarn/database.h"

#include <SQLiteCpp/Database.h>
#include <sys/wait.h>

#include <atomic>
#include <chrono>
#include <future>
#include <thread>
#include <utility>

#include "platform/foundation/fault_points.h"
#include "zarn/bulk_load.h"
#include "zarn/connection.h"
#include "zarn/row_queries.h"
#include "zarn/schema.h"
#include "zarn/test_drive.h"
#include "zarn/write_transaction.h"

namespace yomber {
namespace {

ItemRow document(const std::string& name, std::uint64_t parent = kRootID) {
  ItemRow row;
  row.parent = parent;
  row.name = name;
  return row;
}

class DatabaseTest : public TestDrive {
 protected:
  ~DatabaseTest() override { FaultPoint::disarmAll(); }

  NSErrorRef insert(const std::string& name) {
    return database->write([&](WriteTransaction& transaction) -> NSErrorRef {
      ItemRow row = document(name);
      row.id = transaction.issueID();
      transaction.insert(row);
      return nullptr;
    });
  }
  std::vector<std::string> damagedFiles() const {
    std::vector<std::string> result;
    for (const auto& entry : std::filesystem::directory_iterator(layout.home())) {
      const std::string name = entry.path().filename();
      if (name.starts_with("zarn.db.damaged-") && !name.ends_with("-wal") &&
          !name.ends_with("-shm")) {
        result.push_back(name);
      }
    }
    return result;
  }
};

TEST_F(DatabaseTest, AReadTransactionSeesOneStateWhateverIsWrittenMeanwhile) {
  ASSERT_EQ(insert("a"), nullptr);
  const auto sees = [](Connection& connection, const char* name) {
    return findByName(connection, kRootID, name).has_value();
  };
  const NSErrorRef error = database->read([&](Connection& connection) {
    {
      const ReadTransaction outer(connection);
      EXPECT_TRUE(sees(connection, "a"));
      ASSERT_EQ(insert("b"), nullptr);
      {
        const ReadTransaction inner(connection);
        EXPECT_FALSE(sees(connection, "b"));
      }
      EXPECT_FALSE(sees(connection, "b")) << "the inner one ended the outer";
    }
    EXPECT_TRUE(sees(connection, "b"));
  });
  EXPECT_EQ(error, nullptr);
}

TEST_F(DatabaseTest, WaitsForTheWritersLockAlsoWhenAChangeReadsFirst) {
  // As a reader does that meets a half-written header of the log.
  Connection other(layout.databasePath(), Connection::Mode::Write);
  other.execute("BEGIN IMMEDIATE");
  std::promise<void> tried;
  std::promise<NSErrorRef> ended;
  database->writeLater(
      [&](WriteTransaction& transaction) {
        EXPECT_FALSE(findByName(transaction.connection(), kRootID, "a").has_value());
        struct Notice {
          std::promise<void>& promise;
          ~Notice() { promise.set_value(); }
        } const notice{tried};
        ItemRow row = document("a");
        row.id = transaction.issueID();
        transaction.insert(row);
        return NSErrorRef();
      },
      [&](const NSErrorRef& error) { ended.set_value(error); });
  // It must not get that far; if it did, it would have failed by then.
  EXPECT_EQ(tried.get_future().wait_for(std::chrono::milliseconds(200)),
            std::future_status::timeout);
  other.execute("COMMIT");
  EXPECT_EQ(ended.get_future().get(), nullptr);
}

TEST_F(DatabaseTest, RanksGrowOverRestarts) {
  const std::uint64_t start = database->currentRank();
  ASSERT_EQ(insert("a"), nullptr);
  ASSERT_EQ(insert("b"), nullptr);
  EXPECT_EQ(database->currentRank(), start + 2);
  const std::uint64_t identity = database->identity();
  reopen();
  EXPECT_EQ(database->currentRank(), start + 2);
  EXPECT_EQ(database->identity(), identity);
  ASSERT_EQ(insert("c"), nullptr);
  EXPECT_EQ(store->itemByName(kRootID, "c")->rank, start + 3);
}

TEST_F(DatabaseTest, SinksAreToldOfEveryChangeInOrder) {
  ASSERT_EQ(insert("a"), nullptr);
  const auto before = store->itemByName(kRootID, "a");
  ASSERT_EQ(database->write([&](WriteTransaction& transaction) -> NSErrorRef {
    ItemRow after = *before;
    after.name = "b";
    transaction.update(*before, after);
    transaction.remove(after);
    return nullptr;
  }),
            nullptr);
  const auto changes = sink->take();
  ASSERT_EQ(changes.size(), 3U);
  EXPECT_TRUE(changes[0].isNew);
  EXPECT_EQ(changes[1].nameBefore, "a");
  EXPECT_EQ(changes[1].row.name, "b");
  EXPECT_TRUE(changes[2].isDead());
  EXPECT_LT(changes[1].row.rank, changes[2].row.rank);
  EXPECT_FALSE(store->itemByName(kRootID, "b"));
}

TEST_F(DatabaseTest, ItsLastReferenceMayGoOnItsOwnThread) {
  ASSERT_EQ(insert("kept"), nullptr);
  std::promise<void> others;
  std::promise<void> over;
  Database& all = *database;
  all.writeLater([](WriteTransaction&) { return NSErrorRef(); },
                 [last = std::exchange(database, nullptr), &over,
                  gone = others.get_future().share()](NSErrorRef) mutable {
                   gone.wait();
                   last.reset();
                   over.set_value();
                 });
  close();
  others.set_value();
  over.get_future().wait();
  open();
  EXPECT_TRUE(store->itemByName(kRootID, "kept"));
  EXPECT_EQ(insert("another"), nullptr);
}

TEST_F(DatabaseTest, AFailingJobUndoesOnlyItself) {
  // Both wait behind a job that is held, so that they share a transaction.
  std::promise<void> gate;
  auto open = gate.get_future().share();
  database->writeLater(
      [open](WriteTransaction&) -> NSErrorRef {
        open.wait();
        return nullptr;
      },
      {});
  std::promise<NSErrorRef> first;
  std::promise<NSErrorRef> second;
  const auto job = [](const char* name, bool fails) {
    return [name, fails](WriteTransaction& transaction) -> NSErrorRef {
      ItemRow row = document(name);
      row.id = transaction.issueID();
      transaction.insert(row);
      if (fails) return NSError::errorWithErrno(EIO);
      return nullptr;
    };
  };
  database->writeLater(job("bad", true), [&](NSErrorRef error) { first.set_value(error); });
  database->writeLater(job("good", false), [&](NSErrorRef error) { second.set_value(error); });
  gate.set_value();
  EXPECT_NE(first.get_future().get(), nullptr);
  EXPECT_EQ(second.get_future().get(), nullptr);
  EXPECT_FALSE(store->itemByName(kRootID, "bad"));
  EXPECT_TRUE(store->itemByName(kRootID, "good"));
  const auto changes = sink->take();
  ASSERT_EQ(changes.size(), 1U);
  EXPECT_EQ(changes[0].row.name, "good");
  EXPECT_EQ(changes[0].row.rank, database->currentRank());
}

TEST_F(DatabaseTest, AFailedCommitIsAnErrorAndChangesNothing) {
  const std::uint64_t rank = database->currentRank();
  ASSERT_EQ(FaultPoint::arm("zarn.database.before-commit=error"), nullptr);
  const NSErrorRef error = insert("a");
  FaultPoint::disarmAll();
  ASSERT_NE(error, nullptr);
  EXPECT_EQ(error->domain(), kDatabaseErrorDomain);
  EXPECT_EQ(database->currentRank(), rank);
  EXPECT_FALSE(store->itemByName(kRootID, "a"));
  EXPECT_EQ(insert("a"), nullptr);
}

TEST_F(DatabaseTest, AKillBeforeTheCommitLosesTheJobAndAfterItNothing) {
  close();
  for (const auto& [point, survives] : {std::pair("zarn.database.before-commit", false),
                                        std::pair("zarn.database.after-commit", true)}) {
    const std::string name = survives ? "after" : "before";
    const pid_t child = fork();
    if (child == 0) {
      open();
      if (FaultPoint::arm(std::string(point) + "=abort")) _exit(3);
      (void)insert(name);
      _exit(4);
    }
    int status = 0;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    ASSERT_TRUE(WIFSIGNALED(status)) << status;
    open();
    EXPECT_EQ(store->itemByName(kRootID, name).has_value(), survives) << point;
    close();
  }
}

TEST_F(DatabaseTest, SetsADamagedFileAside) {
  ASSERT_EQ(insert("a"), nullptr);
  const std::uint64_t rank = database->currentRank();
  const std::uint64_t identity = database->identity();
  close();
  std::ofstream(layout.databasePath(), std::ios::binary) << std::string(8192, 'x');
  open();
  EXPECT_TRUE(database->needsFirstScan());
  EXPECT_GT(database->currentRank(), rank);
  EXPECT_NE(database->identity(), identity);
  EXPECT_EQ(damagedFiles().size(), 1U);
  EXPECT_EQ(insert("b"), nullptr);
}

TEST_F(DatabaseTest, ChecksAFileThatWasFoundDamagedWhileInUse) {
  for (int i = 0; i < 200; ++i) ASSERT_EQ(insert("item " + std::to_string(i)), nullptr);
  close();
  // The last pages are overwritten, which hold items and are not read on opening.
  const auto size = std::filesystem::file_size(layout.databasePath());
  std::fstream file(layout.databasePath(), std::ios::in | std::ios::out | std::ios::binary);
  const auto begin = size - size / 8;
  file.seekp(static_cast<std::streamoff>(begin));
  file << std::string(size - begin, '\x5a');
  file.close();
  NSErrorRef error;
  database = Database::open(layout.databasePath(), &error);
  ASSERT_NE(database, nullptr) << error->description();
  store = std::make_shared<ItemStore>(database, layout);
  NSErrorRef failure;
  for (int i = 0; i < 200 && failure == nullptr; ++i) {
    (void)store->itemByName(kRootID, "item " + std::to_string(i), &failure);
  }
  EXPECT_NE(failure, nullptr);
  EXPECT_TRUE(damagedFiles().empty()) << "what is in use stays where it is";
  close();
  open();
  EXPECT_EQ(damagedFiles().size(), 1U);
  EXPECT_EQ(insert("b"), nullptr);
}

TEST_F(DatabaseTest, RefusesAFileOfANewerProgramAndLeavesIt) {
  ASSERT_EQ(insert("a"), nullptr);
  close();
  SQLite::Database(layout.databasePath(), SQLite::OPEN_READWRITE).exec("PRAGMA user_version=99");
  NSErrorRef error;
  EXPECT_EQ(Database::open(layout.databasePath(), &error), nullptr);
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(kDatabaseErrorDomain, kDatabaseTooNew));
  EXPECT_TRUE(damagedFiles().empty());
  SQLite::Database(layout.databasePath(), SQLite::OPEN_READWRITE)
      .exec("PRAGMA user_version=" + std::to_string(kSchemaVersion));
  open();
  EXPECT_TRUE(store->itemByName(kRootID, "a"));
}

TEST_F(DatabaseTest, SaysWhyItCannotOpen) {
  NSErrorRef error;
  EXPECT_EQ(Database::open(layout.home() + "/no/such/folder/zarn.db", &error), nullptr);
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(kDatabaseErrorDomain, kDatabaseFailure));
}

TEST_F(DatabaseTest, ARebuildThatFailsLeavesEverythingAsItWas) {
  ASSERT_EQ(insert("a"), nullptr);
  EXPECT_NE(database->rebuild([](BulkLoad&) { return NSError::errorWithErrno(EIO); }), nullptr);
  EXPECT_TRUE(store->itemByName(kRootID, "a"));
  ASSERT_EQ(FaultPoint::arm("zarn.database.before-swap=error"), nullptr);
  EXPECT_NE(database->rebuild([](BulkLoad&) -> NSErrorRef { return nullptr; }), nullptr);
  FaultPoint::disarmAll();
  EXPECT_TRUE(store->itemByName(kRootID, "a"));
  EXPECT_TRUE(database->needsFirstScan());
  EXPECT_FALSE(std::filesystem::exists(layout.databasePath() + ".new"));
}

TEST_F(DatabaseTest, ARebuildTakesPlaceUnderReaders) {
  std::atomic<bool> isDone = false;
  std::thread reader([&] {
    while (!isDone) (void)store->itemByID(kRootID);
  });
  const std::uint64_t rank = database->currentRank();
  const NSErrorRef error = database->rebuild([](BulkLoad& load) -> NSErrorRef {
    ItemRow row = document("a");
    row.id = 5000;
    load.add(row, "key");
    return nullptr;
  });
  isDone = true;
  reader.join();
  ASSERT_EQ(error, nullptr);
  EXPECT_TRUE(store->itemByID(5000));
  EXPECT_FALSE(database->needsFirstScan());
  EXPECT_GT(database->currentRank(), rank);
}

TEST_F(DatabaseTest, SortKeysAreMadeAnewForAnotherCollation) {
  ASSERT_EQ(insert("b"), nullptr);
  close();
  {
    SQLite::Database raw(layout.databasePath(), SQLite::OPEN_READWRITE);
    raw.exec(
        "UPDATE item SET name_key=x'00'; UPDATE meta SET value='0/older' WHERE key='collation'");
  }
  open();
  EXPECT_TRUE(store->itemByName(kRootID, "b"));
}

class DatabaseLogTest : public DatabaseTest {
 protected:
  DatabaseLogTest() : before_(sizeOfFile()) {}

  std::uintmax_t sizeOfFile() const { return std::filesystem::file_size(layout.databasePath()); }
  std::uintmax_t sizeOfLog() const {
    return std::filesystem::file_size(layout.databasePath() + "-wal");
  }
  void insertMany(int count) {
    ASSERT_EQ(database->write([&](WriteTransaction& transaction) -> NSErrorRef {
      for (int i = 0; i < count; ++i) {
        ItemRow row = document("item " + std::to_string(++number_));
        row.id = transaction.issueID();
        transaction.insert(row);
      }
      return nullptr;
    }),
              nullptr);
  }
  [[nodiscard]] bool isWrittenBackSoon() const {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(60);
    while (sizeOfFile() < before_ + 1'000'000 && std::chrono::steady_clock::now() < deadline) {
      std::this_thread::yield();
    }
    return sizeOfFile() > before_ + 1'000'000;
  }

  const std::uintmax_t before_;
  int number_ = 0;
};

TEST_F(DatabaseLogTest, IsWrittenBackBesideTheWriter) {
  // Beyond the pages that bring it about, well below those that make the writer do it.
  while (sizeOfLog() < 5'000U * 4096U && sizeOfFile() < before_ + 1'000'000) insertMany(400);
  EXPECT_TRUE(isWrittenBackSoon());
  EXPECT_LT(sizeOfLog(), 20'000U * 4096U);
  EXPECT_EQ(store->counts().items, static_cast<std::uint64_t>(number_));
}

TEST_F(DatabaseLogTest, IsWrittenBackWhenCommitsPause) {
  // Well below the pages that bring it about while commits go on.
  while (sizeOfLog() < 2'000U * 4096U) insertMany(400);
  EXPECT_TRUE(isWrittenBackSoon());
  EXPECT_LT(sizeOfLog(), 3'000U * 4096U);
  EXPECT_EQ(store->counts().items, static_cast<std::uint64_t>(number_));
}

TEST_F(DatabaseTest, PrunesTombstonesBeyondTheBound) {
  ASSERT_EQ(database->write([](WriteTransaction& transaction) -> NSErrorRef {
    StatementUse statement(transaction.connection().prepared(
        "WITH RECURSIVE n(i) AS (SELECT 1 UNION ALL SELECT i+1 FROM n WHERE i<?1) "
        "INSERT INTO working(id,rank,kind,member) SELECT i+100000,i,0,0 FROM n"));
    statement->bindInteger(1, kMaximumTombstones);
    statement->step();
    return nullptr;
  }),
            nullptr);
  EXPECT_EQ(database->oldestAnswerableRank(), 0U);
  // Removing members adds departures, and removing enough items brings the pruning about.
  ASSERT_EQ(database->write([](WriteTransaction& transaction) -> NSErrorRef {
    for (int i = 0; i < 1100; ++i) {
      ItemRow row = document("item " + std::to_string(i));
      row.id = transaction.issueID();
      row.flags = row_flag::kShared;
      transaction.insert(row);
      transaction.remove(row);
    }
    return nullptr;
  }),
            nullptr);
  EXPECT_EQ(database->oldestAnswerableRank(), 1100U);
  reopen();
  EXPECT_EQ(database->oldestAnswerableRank(), 1100U);
}

}  // namespace
}  // namespace yomber
