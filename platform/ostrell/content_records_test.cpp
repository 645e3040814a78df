#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <string>

#include "platform/ostrell/awaited.h"
#include "platform/ostrell/constants.h"
#include "platform/ostrell/daemon_connection.h"
#include "platform/ostrell/downloads.h"
#include "platform/ostrell/record_store.h"
#include "platform/ostrell/scripted_daemon.h"
#include "platform/rozzel/container.h"
#include "platform/rozzel/embedded_engine.h"

namespace yomber {
namespace {

using testing::IsEmpty;

class ContentRecordsCallTest : public testing::Test {
 protected:
  static QSFileObjectIDRef objectID(const std::string& text) {
    return QSFileObjectID::fileObjectIDWithString(text);
  }
  QSContentRecordIDsRef resolve(const std::vector<QSFileObjectIDRef>& ids,
                                NSErrorRef* error = nullptr) {
    const auto proxy = QSDaemonConnection::defaultConnection().newSyncProxy();
    proxy->resolveFileObjectIDsToContentRecordIDs(
        ids, [&](const QSContentRecordIDsRef& found, const NSErrorRef& failure) {
          proxy->setObjResult(found, failure);
        });
    storeError(error, proxy->error());
    return std::dynamic_pointer_cast<const QSContentRecordIDs>(proxy->result());
  }

  ScriptedDaemon daemon;
};

TEST_F(ContentRecordsCallTest, AnswersTheRecordsThatTheDaemonKnows) {
  const RZRecordID record("5", RZRecordZoneID("zone", "somebody"));
  daemon.script([&](ScriptedDaemon::Answers& answers) {
    answers.contentRecords = [&](const std::vector<std::string>&) {
      return ScriptedDaemon::Records{.records = {{"d:5", record}}, .error = nullptr};
    };
  });
  const auto found = resolve({objectID("d:5"), objectID("d:6")});
  ASSERT_NE(found, nullptr);
  ASSERT_EQ(found->recordIDs().size(), 1U);
  EXPECT_EQ(found->recordIDs().at(objectID("d:5")), record);
  EXPECT_EQ(found->description(), "{d:5 = 5 in zone (somebody)}");
  EXPECT_EQ(daemon.calls().back(), (ScriptedDaemon::Call{"contentRecords", {"d:5", "d:6"}}));
}

TEST_F(ContentRecordsCallTest, NothingKnownIsAnEmptyResultAndAFailureIsNone) {
  ASSERT_NE(resolve({objectID("d:5")}), nullptr);
  EXPECT_THAT(resolve({objectID("d:5")})->recordIDs(), IsEmpty());
  const auto refusal = NSError::errorWithDomain(QSOstrellErrorDomain, QSOstrellErrorLoggedOut);
  daemon.script([&](ScriptedDaemon::Answers& answers) {
    answers.contentRecords = [&](const std::vector<std::string>&) {
      return ScriptedDaemon::Records{.records = {}, .error = refusal};
    };
  });
  NSErrorRef error;
  EXPECT_EQ(resolve({objectID("d:5")}, &error), nullptr);
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(QSOstrellErrorDomain, QSOstrellErrorLoggedOut));
}

TEST_F(ContentRecordsCallTest, ADownloadIsAnsweredWhenItHasBegunOrCannot) {
  Awaited<NSErrorRef> answers;
  const auto url = NSURL::fileURLWithPath(daemon.root() + "/a.jpg");
  const auto answer = [&](const NSErrorRef& error) { answers.add(error); };
  QSStartDownloadForItemsWithOptions({url}, QSStartDownloadNotUserInitiated, answer);
  EXPECT_EQ(answers.wait(), std::vector<NSErrorRef>{nullptr});
  EXPECT_EQ(daemon.calls().back(), (ScriptedDaemon::Call{"startDownloading", {url->path(), "4"}}));
  daemon.scriptContent([](ScriptedContentAnswers& content) {
    content.startDownloading = [](const std::vector<std::string>&, std::uint64_t) {
      return NSError::errorWithDomain(NSCocoaErrorDomain, NSFileNoSuchFileError);
    };
  });
  QSStartDownloadForItemsWithOptions({url}, 0, answer);
  ASSERT_EQ(answers.wait(2).size(), 2U);
  EXPECT_NE(answers.values()[1], nullptr);
  daemon.stop();
  QSStartDownloadForItemsWithOptions({url}, 0, answer);
  ASSERT_EQ(answers.wait(3).size(), 3U);
  EXPECT_NE(answers.values()[2], nullptr);
}

TEST_F(ContentRecordsCallTest, ContainersAreThoseOfTheSignedInAccountInTheDrivesOwnStore) {
  const std::string store = daemon.home() + "/store";
  ASSERT_EQ(EmbeddedEngine::create(store), nullptr);
  const auto engine = std::make_shared<EmbeddedEngine>(store);
  RZContainer theirs(engine, QSUbiquitousRozzelContainerIdentifier, "someone");
  ASSERT_EQ(theirs.privateCloudDatabase()->createZone(RZRecordZoneID("zone")), nullptr);
  const auto ours = RZContainer::containerWithIdentifier(QSUbiquitousRozzelContainerIdentifier);
  EXPECT_EQ(ours->accountName(), "someone");
  std::vector<RZRecordZone> zones;
  ASSERT_EQ(ours->privateCloudDatabase()->fetchZones(zones), nullptr);
  EXPECT_EQ(zones.size(), 1U);
  EXPECT_EQ(qs_downloadThumbnailsUserInitiated()->name(), "download-thumbnails-user-initiated");
}

}  // namespace
}  // namespace yomber
