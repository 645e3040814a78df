#include "platform/foundation/temporary_directory.h"
#include "platform/glimmet/installed_thumbnailers.h"
#include "zarn/content/document_drawer.h"
#include "zarn/content/test_sharing.h"
#include "zarn/schema.h"

namespace yomber {
namespace {

/// A picture of Ann's that has a thumbnail, in a folder that she shares with Bob.
class SharedThumbnailsTest : public TwoDrives {
 protected:
  void sharePicture(const RZShareParticipant& participant) {
    ann->makeFolder("Photos");
    std::filesystem::copy(YOMBER_PICTURES "/quarters.jpg", ann->at("Photos/photo.jpg"));
    ann->settle();
    ASSERT_NE(pictureOf(recordOfPhoto()), nullptr);
    share = ann->share("Photos", {participant});
    const NSErrorRef error = bob->accept(share);
    ASSERT_EQ(error, nullptr) << error->description();
    ASSERT_NE(pictureOf(recordOfPhoto()), nullptr);
  }

  [[nodiscard]] RZRecordRef recordOfPhoto() const {
    const RZRecordZoneID zone =
        share ? share->recordID().zoneID() : RZRecordZoneID(QSUbiquitousDefaultContainerID);
    std::vector<RZFetchedRecord> found;
    EXPECT_EQ(records->fetchRecords({QSUbiquitousRozzelContainerIdentifier, "ann"},
                                    {RZRecordID(std::to_string(ann->id("Photos/photo.jpg")), zone)},
                                    std::nullopt, found),
              nullptr);
    return found.at(0).record;
  }
  static const RZAsset* pictureOf(const RZRecordRef& record) {
    return record ? record->valueForKey<RZAsset>(kQSRecordKeyThumbnail1024x1024) : nullptr;
  }

  /// Has Bob's drive look through all that it has, as another thumbnailer was installed.
  void lookThroughBobs() {
    std::ofstream(thumbnailerFiles_.path() + "/other.thumbnailer")
        << "[Thumbnailer Entry]\nExec=true\nMimeType=video/mp4;\n";
    bob->engine->stop();
    bob->engine.reset();
    DocumentDrawer::Options drawing;
    drawing.pictures.patience = SharingDrive::kPatience;
    drawing.thumbnailers =
        std::make_shared<InstalledThumbnailers>(std::vector{thumbnailerFiles_.path()});
    ContentEngine::Options options;
    options.firstPause = options.longestPause = std::chrono::milliseconds(5);
    options.sharesPause = std::chrono::hours(1);
    options.drawer = std::make_shared<DocumentDrawer>(drawing);
    ASSERT_EQ(FaultPoint::arm("zarn.thumbnail.made=pause-until-file:" + gate()), nullptr);
    bob->engine = ContentEngine::create(bob->store, bob->scanner, options);
    bob->engine->setStore(std::make_shared<ContentStore>(records, "bob"), "bob");
    bob->engine->start();
    ASSERT_TRUE(waitUntil([&] { return std::filesystem::exists(gate() + ".reached"); }));
    EXPECT_TRUE(hasJob());
    std::ofstream(gate()).put('x');
    FaultPoint::disarmAll();
  }
  [[nodiscard]] bool hasJob() const {
    bool isThere = false;
    EXPECT_EQ(bob->database->read([&](Connection& connection) {
      isThere = findJob(connection, bob->id("Photos/photo.jpg"), JobKind::Thumbnail).has_value();
    }),
              nullptr);
    return isThere;
  }

 private:
  [[nodiscard]] std::string gate() const { return storePath + "-drawn"; }

  const TemporaryDirectory thumbnailerFiles_;
};

TEST_F(SharedThumbnailsTest, WhoMayOnlyReadMakesNone) {
  sharePicture(viewer("bob"));
  const std::string tag = recordOfPhoto()->changeTag();
  lookThroughBobs();
  EXPECT_TRUE(waitUntil([&] { return !hasJob(); }));
  EXPECT_EQ(recordOfPhoto()->changeTag(), tag);
}

TEST_F(SharedThumbnailsTest, WhatHasItsThumbnailFromAnotherKeepsThat) {
  sharePicture(editor("bob"));
  const std::string tag = recordOfPhoto()->changeTag();
  lookThroughBobs();
  EXPECT_TRUE(waitUntil([&] { return !hasJob(); }));
  EXPECT_EQ(recordOfPhoto()->changeTag(), tag);
}

TEST_F(SharedThumbnailsTest, WhatHasNoneGetsItFromWhoMayWrite) {
  sharePicture(editor("bob"));
  auto changed = std::make_shared<RZRecord>(*recordOfPhoto());
  changed->removeObjectForKey(kQSRecordKeyThumbnail1024x1024);
  RZRecordBatch batch;
  batch.recordsToSave.push_back(changed);
  std::vector<RZRecordRef> saved;
  ASSERT_EQ(records->modifyRecords({QSUbiquitousRozzelContainerIdentifier, "ann"}, batch, saved),
            nullptr);
  ASSERT_EQ(bob->follow(), nullptr);
  lookThroughBobs();
  EXPECT_TRUE(waitUntil([&] { return pictureOf(recordOfPhoto()) != nullptr; }));
  EXPECT_TRUE(waitUntil([&] { return !hasJob(); }));
}

}  // namespace
}  // namespace yomber
