#include <fcntl.h>

#include <thread>

#include "zarn/content/content_rows.h"
#include "zarn/content/test_content.h"
#include "zarn/write_transaction.h"

namespace yomber {
namespace {

class ContentUploadsTest : public ContentDrive {};

TEST_F(ContentUploadsTest, AnEditIsUploadedInPlaceOfWhatWasThere) {
  write("a", "first");
  settle();
  write("a", "second edition");
  settle();
  EXPECT_EQ(contentInStore(id("a")), "second edition");
  EXPECT_EQ(state("a").upload, ContentState::Upload::Confirmed);
}

TEST_F(ContentUploadsTest, ASecondEditDuringAnUploadIsUploadedToo) {
  write("a", "first");
  stopAt("zarn.upload.synced");
  scan();
  ASSERT_TRUE(isStopped());
  write("a", "second edition");
  scan();
  go();
  settle();
  EXPECT_EQ(contentInStore(id("a")), "second edition");
  EXPECT_EQ(state("a").upload, ContentState::Upload::Confirmed);
}

TEST_F(ContentUploadsTest, AnEditThatKeepsSizeAndDateIsUploadedToo) {
  write("a", "first");
  settle();
  const struct stat before = status("a");
  write("a", "other");
  const timespec times[2] = {before.st_atim, before.st_mtim};
  ASSERT_EQ(utimensat(AT_FDCWD, at("a").c_str(), times, 0), 0);
  settle();
  EXPECT_EQ(contentInStore(id("a")), "other");
}

TEST_F(ContentUploadsTest, JobsThatCannotBeReadAreLookedForAgain) {
  stopAt("zarn.jobs.unread");
  ASSERT_EQ(FaultPoint::arm("zarn.jobs.read=error,zarn.jobs.unread=pause-until-file:" + gate_),
            nullptr);
  write("a", "text");
  scan();
  ASSERT_TRUE(isStopped());
  FaultPoint::disarmAll();
  go();
  EXPECT_TRUE(waitUntil([&] { return contentInStore(id("a")) == "text"; }));
}

TEST_F(ContentUploadsTest, TheDateOfAccessIsThatOfWhoUsesTheFile) {
  write("a", content(100'000));
  const timespec longAgo{.tv_sec = 1'000'000, .tv_nsec = 0};
  const timespec times[2] = {longAgo, longAgo};
  ASSERT_EQ(utimensat(AT_FDCWD, at("a").c_str(), times, 0), 0);
  settle();
  EXPECT_EQ(contentInStore(id("a")), content(100'000));
  EXPECT_EQ(status("a").st_atim.tv_sec, longAgo.tv_sec);
  // Nor is it a use to compare it with the store.
  setAttribute("a", "user.note", "text");
  ASSERT_EQ(evict("a"), nullptr);
  EXPECT_EQ(status("a").st_atim.tv_sec, longAgo.tv_sec);
}

TEST_F(ContentUploadsTest, ARenameChangesTheRecordAndMovesNoContent) {
  write("a", content(50'000));
  settle();
  const std::uint64_t item = id("a");
  const auto assets = assetFiles();
  rename("a", "b");
  settle();
  EXPECT_EQ(id("b"), item);
  EXPECT_EQ(nameInStore(item), "b");
  EXPECT_EQ(assetFiles(), assets);
  EXPECT_EQ(state("b").upload, ContentState::Upload::Confirmed);
}

TEST_F(ContentUploadsTest, AFaultThatIsRenamedAndMovedKeepsItsContentInTheStore) {
  const std::string text = content(200'000);
  write("a", text);
  makeFolder("folder");
  settle();
  ASSERT_EQ(evict("a"), nullptr);
  rename("a", "folder/b");
  settle();
  EXPECT_EQ(nameInStore(id("folder/b")), "b");
  EXPECT_TRUE(isFault("folder/b"));
  ASSERT_EQ(provide("folder/b"), nullptr);
  EXPECT_EQ(read("folder/b"), text);
}

TEST_F(ContentUploadsTest, WhatIsRemovedLosesItsRecord) {
  write("a", "text");
  settle();
  const std::uint64_t item = id("a");
  ASSERT_NE(record(item), nullptr);
  remove("a");
  settle();
  EXPECT_EQ(record(item), nullptr);
}

TEST_F(ContentUploadsTest, WhatIsRemovedDuringItsUploadLosesItsRecordToo) {
  write("a", "text");
  stopAt("zarn.upload.committed");
  scan();
  ASSERT_TRUE(isStopped());
  const std::uint64_t item = id("a");
  remove("a");
  scan();
  go();
  ASSERT_TRUE(engine->waitUntilIdle(kPatience));
  EXPECT_EQ(record(item), nullptr);
}

TEST_F(ContentUploadsTest, FoldersLinksAndExcludedNamesAreNotUploaded) {
  makeFolder("folder");
  write("folder/.x.swp", "text");
  ASSERT_EQ(symlink("nowhere", at("link").c_str()), 0);
  settle();
  EXPECT_EQ(state("folder").upload, ContentState::Upload::None);
  EXPECT_EQ(state("link").upload, ContentState::Upload::None);
  EXPECT_TRUE(assetFiles().empty());
}

TEST_F(ContentUploadsTest, WithTheStoreOutOfReachJobsWaitWithoutCountingAttempts) {
  goOffline();
  write("a", "text");
  scan();
  ASSERT_TRUE(waitUntil([&] { return engine->transfers().isOffline; }));
  ASSERT_TRUE(engine->waitUntilIdle(kPatience));
  EXPECT_EQ(state("a").upload, ContentState::Upload::Waiting);
  EXPECT_EQ(state("a").lastFailure, nullptr);
  EXPECT_EQ(engine->transfers().waiting, 1U);
  comeBack();
  ASSERT_TRUE(waitUntil([&] { return state("a").upload == ContentState::Upload::Confirmed; }));
  EXPECT_EQ(contentInStore(id("a")), "text");
}

TEST_F(ContentUploadsTest, WhatHadNothingToSaveIsSavedWhenItsRecordWasForgottenMeanwhile) {
  write("a", content(1'000));
  settle();
  stopAt("zarn.upload.committed");
  setAttribute("a", "user.note", "text");
  scan();
  ASSERT_TRUE(isStopped());
  RZRecordBatch batch;
  batch.recordsToDelete.push_back({record(id("a"))->recordID(), {}});
  std::vector<RZRecordRef> saved;
  ASSERT_EQ(records->modifyRecords({QSUbiquitousRozzelContainerIdentifier, "ann"}, batch, saved),
            nullptr);
  const std::uint64_t item = id("a");
  ASSERT_EQ(database->write([&](WriteTransaction& transaction) {
    removeContent(transaction.connection(), item);
    return NSErrorRef();
  }),
            nullptr);
  go();
  ASSERT_TRUE(waitUntil([&] { return record(item) != nullptr; }));
  ASSERT_TRUE(engine->waitUntilIdle(kPatience));
  EXPECT_EQ(contentInStore(item), content(1'000));
}

TEST_F(ContentUploadsTest, OverQuotaTheJobWaitsAndOthersGoOn) {
  ASSERT_EQ(records->setQuota("ann", 100'000), nullptr);
  write("large", content(200'000));
  write("small", content(1'000, 2));
  scan();
  ASSERT_TRUE(waitUntil([&] {
    const ContentState large = state("large");
    return large.lastFailure &&
           large.lastFailure->is(NSCocoaErrorDomain, NSUbiquitousFileNotUploadedDueToQuotaError);
  }));
  ASSERT_TRUE(waitUntil([&] { return state("small").upload == ContentState::Upload::Confirmed; }));
  EXPECT_EQ(evict("large")->code(), QSOstrellErrorCannotEvict);
  ASSERT_EQ(records->setQuota("ann", std::nullopt), nullptr);
  engine->retryNow();
  ASSERT_TRUE(waitUntil([&] { return state("large").upload == ContentState::Upload::Confirmed; }));
}

TEST_F(ContentUploadsTest, WhatDoesNotFitIsNotCopiedToTheStoreAgain) {
  const auto attempts = [&] {
    const auto transfers = engine->transfers().transfers;
    return transfers.empty() ? 0U : transfers.front().attempts;
  };
  ASSERT_EQ(records->setQuota("ann", 100'000), nullptr);
  write("large", content(200'000));
  scan();
  ASSERT_TRUE(waitUntil([&] { return attempts() >= 1; }));
  stopAt("zarn.upload.staged");
  const auto before = attempts();
  ASSERT_TRUE(waitUntil([&] { return attempts() >= before + 3; }));
  EXPECT_FALSE(std::filesystem::exists(gate_ + ".reached"));
  EXPECT_TRUE(state("large").lastFailure->is(NSCocoaErrorDomain,
                                             NSUbiquitousFileNotUploadedDueToQuotaError));
  ASSERT_EQ(records->setQuota("ann", 300'000), nullptr);
  EXPECT_TRUE(isStopped());
  go();
  ASSERT_TRUE(waitUntil([&] { return state("large").upload == ContentState::Upload::Confirmed; }));
  // In place of itself it needs no more than it has.
  write("large", content(200'000, 2));
  settle();
  EXPECT_EQ(state("large").upload, ContentState::Upload::Confirmed);
}

TEST_F(ContentUploadsTest, WhatWasWrittenSinceIsNotConfirmedAlsoBeforeItIsScanned) {
  write("a", "text");
  settle();
  EXPECT_EQ(state("a").upload, ContentState::Upload::Confirmed);
  write("a", "longer text");
  EXPECT_EQ(state("a").upload, ContentState::Upload::Waiting);
  settle();
  EXPECT_EQ(state("a").upload, ContentState::Upload::Confirmed);
  EXPECT_EQ(evict("a"), nullptr);
  EXPECT_EQ(state("a").upload, ContentState::Upload::Confirmed);
}

TEST_F(ContentUploadsTest, WhatNobodyToldOfIsScannedWhenItsStateIsAskedFor) {
  write("a", "text");
  settle();
  engine->stop();
  // It was written long ago, and still nobody has scanned it.
  options.clock = [] { return NSDate::now().nanoseconds() + 60'000'000'000; };
  startEngine();
  write("a", "longer text");
  EXPECT_TRUE(waitUntil([&] { return state("a").upload == ContentState::Upload::Confirmed; }));
  EXPECT_EQ(contentInStore(id("a")), "longer text");
}

TEST_F(ContentUploadsTest, AJobThatFailsIsTriedAgainAndSaysHowOften) {
  ASSERT_EQ(FaultPoint::arm("zarn.upload.read=error"), nullptr);
  write("a", "text");
  scan();
  ASSERT_TRUE(waitUntil([&] {
    const auto transfers = engine->transfers().transfers;
    return transfers.size() == 1 && transfers.front().attempts >= 3;
  }));
  const auto transfer = engine->transfers().transfers.front();
  EXPECT_EQ(transfer.path, at("a"));
  EXPECT_NE(transfer.failure, nullptr);
  FaultPoint::disarmAll();
  ASSERT_TRUE(waitUntil([&] { return state("a").upload == ContentState::Upload::Confirmed; }));
}

TEST_F(ContentUploadsTest, AnUploadThatCannotBeNotedSaysSoAndIsNotedLater) {
  write("a", "text");
  stopAt("zarn.upload.staged");
  scan();
  ASSERT_TRUE(isStopped());
  ASSERT_EQ(FaultPoint::arm("zarn.database.before-commit=error"), nullptr);
  go();
  EXPECT_TRUE(waitUntil([&] { return state("a").lastFailure != nullptr; }));
  EXPECT_NE(state("a").upload, ContentState::Upload::Confirmed);
  FaultPoint::disarmAll();
  ASSERT_TRUE(waitUntil([&] { return state("a").upload == ContentState::Upload::Confirmed; }));
  EXPECT_EQ(state("a").lastFailure, nullptr);
  EXPECT_EQ(contentInStore(id("a")), "text");
}

TEST_F(ContentUploadsTest, PausesBetweenAttemptsGrowByTheClockThatIsGiven) {
  const auto now = std::make_shared<std::atomic<std::int64_t>>(1'000'000'000'000'000);
  engine->stop();
  options.clock = [now] { return now->load(); };
  engine.reset();
  startEngine();
  engine->stop();
  engine.reset();
  options.firstPause = std::chrono::milliseconds(1'000);
  engine = ContentEngine::create(
      store, std::make_shared<Scanner>(store, std::weak_ptr<FolderVisitor>()), [&] {
        auto slow = options;
        slow.firstPause = std::chrono::milliseconds(1'000);
        slow.longestPause = std::chrono::milliseconds(3'000);
        return slow;
      }());
  signIn("ann");
  engine->start();
  ASSERT_EQ(FaultPoint::arm("zarn.upload.read=error"), nullptr);
  write("a", "text");
  scan();
  constexpr std::int64_t kSecond = 1'000'000'000;
  const std::vector<std::int64_t> pauses{1 * kSecond, 2 * kSecond, 3 * kSecond, 3 * kSecond};
  for (std::uint32_t attempt = 1; attempt <= pauses.size(); ++attempt) {
    ContentTransfers found;
    ASSERT_TRUE(waitUntil([&] {
      found = engine->transfers();
      return found.transfers.size() == 1 && !found.transfers.front().isRunning &&
             found.transfers.front().attempts == attempt;
    }));
    ASSERT_TRUE(found.transfers.front().nextAttempt);
    EXPECT_EQ(*found.transfers.front().nextAttempt - now->load(), pauses[attempt - 1]);
    now->store(*found.transfers.front().nextAttempt);
  }
}

/// Changes an hour apart, with a pause of two, by a clock that only the test moves.
class UploadPauseTest : public ContentUploadsTest {
 protected:
  static constexpr std::int64_t kHour = 3'600'000'000'000;

  UploadPauseTest() {
    engine->stop();
    engine.reset();
    options.clock = [this] { return now_.load(); };
    engine = ContentEngine::create(
        store, std::make_shared<Scanner>(store, std::weak_ptr<FolderVisitor>()), [&] {
          auto patient = options;
          patient.uploadPause = std::chrono::hours(2);
          return patient;
        }());
    signIn("ann");
    engine->start();
  }
  ~UploadPauseTest() override { engine->stop(); }

  void change(const std::string& text) {
    write("a", text);
    // Seen as it is, and with the mark that it gets. Or else it would be read once more, to be
    // sure, when its time has come.
    const FileDescriptor file(::open(at("a").c_str(), O_RDONLY | O_CLOEXEC));
    for (int look = 0; look < 2; ++look) {
      ASSERT_TRUE(waitUntil([&] { return lookAtStamp(file.get()).isSettled; }));
      scan();
    }
  }
  void pass(std::int64_t time) {
    now_ += time;
    ASSERT_TRUE(engine->waitUntilIdle(kPatience));
  }
  [[nodiscard]] bool isUploaded() {
    return waitUntil([&] { return state("a").upload == ContentState::Upload::Confirmed; });
  }
  [[nodiscard]] std::uint64_t finished() const { return engine->transfers().finished; }

 private:
  std::atomic<std::int64_t> now_ = 1'000'000 * kHour;
};

TEST_F(UploadPauseTest, WhatIsChangedAgainSoonIsUploadedOnce) {
  change("one");
  pass(kHour);
  change("and two");
  pass(kHour * 3 / 2);
  EXPECT_EQ(engine->transfers().waiting, 1U);
  EXPECT_EQ(finished(), 0U);
  pass(kHour);
  ASSERT_TRUE(isUploaded());
  EXPECT_EQ(finished(), 1U);
  EXPECT_EQ(contentInStore(id("a")), "and two");
}

TEST_F(UploadPauseTest, WhatGoesOnChangingIsUploadedNevertheless) {
  std::string text;
  for (int hour = 0; hour < 20; ++hour) {
    change(text += '+');
    EXPECT_EQ(finished(), 0U);
    pass(kHour);
  }
  ASSERT_TRUE(isUploaded());
  EXPECT_EQ(contentInStore(id("a")), text);
}

TEST_F(UploadPauseTest, WhatIsRemovedMeanwhileIsNeverUploaded) {
  change("one");
  const std::uint64_t item = id("a");
  std::filesystem::remove(at("a"));
  scan();
  pass(3 * kHour);
  EXPECT_EQ(engine->transfers().waiting, 0U);
  EXPECT_EQ(finished(), 0U);
  EXPECT_EQ(record(item, "ann"), nullptr);
}

TEST_F(UploadPauseTest, WhatIsChangedAfterAnUploadPausesAnew) {
  change("one");
  pass(3 * kHour);
  ASSERT_TRUE(isUploaded());
  change("and two");
  pass(kHour);
  EXPECT_EQ(finished(), 1U);
  pass(kHour);
  ASSERT_TRUE(isUploaded());
  EXPECT_EQ(contentInStore(id("a")), "and two");
}

TEST_F(ContentUploadsTest, SignedOutJobsWaitAndNoOtherAccountSeesThem) {
  write("a", "of ann");
  settle();
  engine->setStore(nullptr, {});
  write("b", "of ann, too");
  settle();
  EXPECT_EQ(state("b").upload, ContentState::Upload::Waiting);
  signIn("bob");
  ASSERT_TRUE(engine->waitUntilIdle(kPatience));
  EXPECT_EQ(engine->transfers().waiting, 0U);
  EXPECT_EQ(record(id("b"), "bob"), nullptr);
  EXPECT_EQ(record(id("b"), "ann"), nullptr);
  signIn("ann");
  ASSERT_TRUE(waitUntil([&] { return state("b").upload == ContentState::Upload::Confirmed; }));
  EXPECT_EQ(contentInStore(id("b")), "of ann, too");
}

TEST_F(ContentUploadsTest, AnAccountThatCannotBeStoredAtFirstIsStoredLater) {
  const std::string text = content(100'000);
  makeFault("a", text);
  engine->setStore(nullptr, {});
  write("b", "text");
  scan();
  ASSERT_EQ(FaultPoint::arm("zarn.database.before-commit=error"), nullptr);
  signIn("ann");
  EXPECT_EQ(state("b").upload, ContentState::Upload::Waiting);
  FaultPoint::disarmAll();
  ASSERT_TRUE(waitUntil([&] { return state("b").upload == ContentState::Upload::Confirmed; }));
  EXPECT_EQ(provide("a"), nullptr);
  EXPECT_TRUE(read("a") == text);
}

TEST_F(ContentUploadsTest, WhatWasMadeBeforeAnybodySignedInIsTheFirstAccounts) {
  engine->stop();
  engine.reset();
  startEngine("");
  write("a", "text");
  settle();
  EXPECT_EQ(state("a").upload, ContentState::Upload::Waiting);
  signIn("ann");
  ASSERT_TRUE(waitUntil([&] { return state("a").upload == ContentState::Upload::Confirmed; }));
}

TEST_F(ContentUploadsTest, DocumentsOfARebuiltDatabaseAreGivenJobs) {
  write("a", "text");
  const std::string away = content(100'000);
  write("b", away);
  settle();
  ASSERT_EQ(evict("b"), nullptr);
  const std::uint64_t item = id("b");
  engine->stop();
  engine.reset();
  close();
  for (const char* suffix : {"", "-wal", "-shm"}) {
    std::filesystem::remove(layout.databasePath() + suffix);
  }
  open();
  startEngine();
  scan();
  stampAll();
  engine->sweep();
  ASSERT_TRUE(waitUntil([&] {
    return state("a").upload == ContentState::Upload::Confirmed &&
           state("b").upload == ContentState::Upload::Confirmed;
  }));
  EXPECT_EQ(id("b"), item);
  ASSERT_EQ(provide("b"), nullptr);
  EXPECT_EQ(read("b"), away);
  const NSErrorRef refusal = evict("b");
  EXPECT_EQ(refusal, nullptr) << refusal->description();
}

/// A tree that was there before the drive: the first scan finds it, and its files are marked later.
class FirstUploadsTest : public ContentUploadsTest {
 protected:
  static constexpr std::uint64_t kDocuments = 5;

  FirstUploadsTest() {
    engine->stop();
    engine.reset();
    close();
    for (const char* suffix : {"", "-wal", "-shm"}) {
      std::filesystem::remove(layout.databasePath() + suffix);
    }
    for (std::uint64_t i = 0; i < kDocuments; ++i) write("document " + std::to_string(i), "text");
    open();
    startEngine();
    scan();
  }
  [[nodiscard]] std::uint64_t finished() const { return engine->transfers().finished; }
};

TEST_F(FirstUploadsTest, DocumentsWaitBeforeThereAreJobsForThem) {
  EXPECT_EQ(engine->transfers().waiting, kDocuments);
}

TEST_F(FirstUploadsTest, ADocumentIsUploadedWhenItsFileIsMarked) {
  engine->sweep();
  std::uint32_t count = 0;
  ASSERT_EQ(scanner->stampSome(3, count), nullptr);  // the root, the trash and a document
  engine->didStamp();
  ASSERT_TRUE(waitUntil([&] { return finished() > 0; }));
  ASSERT_TRUE(engine->waitUntilIdle(kPatience));
  EXPECT_EQ(finished(), 1U);
  EXPECT_EQ(engine->transfers().waiting, kDocuments - 1);
  stampAll();
  engine->didStamp();
  ASSERT_TRUE(waitUntil([&] { return finished() == kDocuments; }));
}

TEST_F(FirstUploadsTest, ItsMarkIsNoChangeThatIsUploadedAgain) {
  stampAll();
  engine->sweep();
  ASSERT_TRUE(
      waitUntil([&] { return finished() >= kDocuments && engine->transfers().waiting == 0; }));
  for (std::uint64_t i = 0; i < kDocuments; ++i) {
    ASSERT_TRUE(scanner->scanLocation(at("document " + std::to_string(i))));
  }
  EXPECT_EQ(engine->transfers().waiting, 0U);
  EXPECT_EQ(finished(), kDocuments);
}

}  // namespace
}  // namespace yomber
