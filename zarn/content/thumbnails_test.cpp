#include <gtest/gtest.h>
#include <sys/mman.h>

#include <filesystem>

#include "platform/drawing/picture_drawer.h"
#include "platform/foundation/temporary_directory.h"
#include "platform/glimmet/installed_thumbnailers.h"
#include "zarn/content/document_drawer.h"
#include "zarn/content/test_content.h"

namespace yomber {
namespace {

constexpr std::int64_t kTwoMonths = std::int64_t{62} * 24 * 3'600'000'000'000;

class ThumbnailsTest : public ContentDrive {
 protected:
  ThumbnailsTest() { useDrawer({}); }

  /// `program`: empty for the one that is built.
  void useDrawer(const std::string& program) {
    engine->stop();
    engine.reset();
    DocumentDrawer::Options drawing;
    drawing.pictures.program = program;
    drawing.pictures.patience = kDrawingPatience;
    drawing.thumbnailers = thumbnailers_;
    options.drawer = std::make_shared<DocumentDrawer>(drawing);
    options.drawingPatience = std::chrono::minutes(2);
    reopen();
    startEngine();
  }

  static std::string sample(const std::string& name) {
    std::ifstream file(YOMBER_PICTURES "/" + name, std::ios::binary);
    return {std::istreambuf_iterator<char>(file), {}};
  }

  /// Installs a thumbnailer of videos.
  void installThumbnailer(const std::string& command) const {
    std::ofstream(thumbnailerFiles_ / "films.thumbnailer")
        << "[Thumbnailer Entry]\nExec=" << command << "\nMimeType=video/mp4;\n";
  }

  [[nodiscard]] std::optional<RZAsset> thumbnail(const std::string& path) const {
    const auto found = record(id(path));
    const auto* const asset =
        found ? found->valueForKey<RZAsset>(kQSRecordKeyThumbnail1024x1024) : nullptr;
    return asset != nullptr ? std::optional(*asset) : std::nullopt;
  }
  [[nodiscard]] std::optional<Job> thumbnailJob(const std::string& path) const {
    std::optional<Job> job;
    EXPECT_EQ(database->read([&](Connection& connection) {
      job = findJob(connection, id(path), JobKind::Thumbnail);
    }),
              nullptr);
    return job;
  }
  [[nodiscard]] std::string thumbnailBytes(const std::string& path) const {
    const auto asset = thumbnail(path);
    std::string bytes;
    if (asset) {
      EXPECT_EQ(records->readAsset(*asset, 1 << 20, bytes), nullptr);
    }
    return bytes;
  }

  /// The thumbnail's pixels, drawn once more.
  [[nodiscard]] std::optional<DrawnPicture> drawnThumbnail(const std::string& path) const {
    constexpr std::uint32_t kLarger = 2048;  // nothing is enlarged
    const FileDescriptor file(memfd_create("thumbnail", MFD_CLOEXEC));
    const std::string bytes = thumbnailBytes(path);
    EXPECT_EQ(::write(file.get(), bytes.data(), bytes.size()), std::ssize(bytes));
    PictureDrawer::Options patient;
    patient.patience = kDrawingPatience;
    return PictureDrawer(patient).draw(file.get(), kLarger, drawing::Form::Png);
  }
  /// A picture without a thumbnail gets one in the background, and the store goes out of reach when
  /// that comes to the fault point. It has to get it all the same.
  void expectThumbnailThoughTheStoreGoesAt(const std::string& point) {
    useDrawer("/nowhere/yomber-thumbnailer");
    write("photo.jpg", sample("quarters.jpg"));
    settle();
    ASSERT_FALSE(thumbnail("photo.jpg"));
    stopAt(point);
    useDrawer({});
    ASSERT_TRUE(isStopped());
    goOffline();
    go();
    EXPECT_TRUE(waitUntil([&] { return engine->transfers().isOffline; }));
    comeBack();
    EXPECT_TRUE(waitUntil([&] { return thumbnail("photo.jpg").has_value(); }));
  }

  static constexpr std::chrono::seconds kDrawingPatience{60};  // under sanitizers, when busy
  const TemporaryDirectory thumbnailerFiles_;
  const std::shared_ptr<InstalledThumbnailers> thumbnailers_ =
      std::make_shared<InstalledThumbnailers>(std::vector{thumbnailerFiles_.path()});
};

TEST_F(ThumbnailsTest, APictureIsUploadedWithItsThumbnail) {
  write("photo.jpg", sample("quarters.jpg"));
  write("icon.png", sample("translucent.png"));
  write("paper.pdf", sample("quarters.pdf"));
  settle();
  EXPECT_TRUE(thumbnailBytes("photo.jpg").starts_with("\xff\xd8\xff"));
  EXPECT_TRUE(thumbnailBytes("icon.png").starts_with("\x89PNG"));
  EXPECT_TRUE(thumbnailBytes("paper.pdf").starts_with("\xff\xd8\xff"));
  EXPECT_EQ(state("photo.jpg").upload, ContentState::Upload::Confirmed);
}

TEST_F(ThumbnailsTest, AThumbnailIsNoMoreThan1024PixelsHighAndWide) {
  write("drawing.svg", sample("quarters.svg"));
  write("high.svg",
        "<svg xmlns=\"http://www.w3.org/2000/svg\" width=\"1\" height=\"4\">"
        "<rect width=\"1\" height=\"4\"/></svg>");
  write("paper.pdf", sample("quarters.pdf"));
  write("small.jpg", sample("quarters.jpg"));
  settle();
  const auto sizeOf = [&](const std::string& path) {
    const auto drawn = drawnThumbnail(path);
    return drawn ? std::pair(drawn->width, drawn->height) : std::pair(0U, 0U);
  };
  EXPECT_EQ(sizeOf("drawing.svg").first, 1024U);
  EXPECT_EQ(sizeOf("high.svg"), std::pair(256U, 1024U));
  EXPECT_EQ(sizeOf("paper.pdf").first, 1024U);
  EXPECT_EQ(sizeOf("small.jpg"), std::pair(48U, 32U)) << "pixels are not enlarged";
}

TEST_F(ThumbnailsTest, AVideoIsDrawnByTheThumbnailerThatIsInstalled) {
  write("before.mp4", sample("green.mp4"));
  settle();
  EXPECT_FALSE(thumbnail("before.mp4"));
  installThumbnailer("ffmpegthumbnailer -i %i -o %o -s %s");
  write("after.mp4", sample("green.mp4"));
  settle();
  EXPECT_TRUE(thumbnailBytes("after.mp4").starts_with("\xff\xd8\xff"));
}

TEST_F(ThumbnailsTest, WhatWasUploadedBeforeAThumbnailerWasInstalledIsDrawnAfterTheNextStart) {
  write("film.mp4", sample("green.mp4"));
  settle();
  installThumbnailer("ffmpegthumbnailer -i %i -o %o -s %s");
  restartEngine();
  ASSERT_TRUE(waitUntil([&] { return thumbnail("film.mp4").has_value(); }));
  EXPECT_TRUE(thumbnailBytes("film.mp4").starts_with("\xff\xd8\xff"));
}

TEST_F(ThumbnailsTest, APictureIsKnownByItsStartWhereItsNameTellsNothing) {
  write("photo", sample("quarters.jpg"));
  write("drawing", sample("quarters.svg"));
  write("film", sample("green.mp4"));
  write("noise", std::string(5000, '\xee'));
  settle();
  EXPECT_TRUE(thumbnailBytes("photo").starts_with("\xff\xd8\xff"));
  EXPECT_TRUE(thumbnail("drawing"));
  EXPECT_FALSE(thumbnail("film"));
  EXPECT_FALSE(thumbnail("noise"));
  installThumbnailer("ffmpegthumbnailer -i %i -o %o -s %s");
  rename("film", "film.mp4");
  settle();
  EXPECT_TRUE(thumbnail("film.mp4"));
}

TEST_F(ThumbnailsTest, WhatOneThumbnailerCannotDrawIsTriedWithTheNextVersion) {
  installThumbnailer("false");
  restartEngine();
  write("film.mp4", sample("green.mp4"));
  settle();
  EXPECT_FALSE(thumbnail("film.mp4"));
  installThumbnailer("ffmpegthumbnailer -i %i -o %o -s %s");
  restartEngine();
  EXPECT_TRUE(waitUntil([&] { return thumbnail("film.mp4").has_value(); }));
}

TEST_F(ThumbnailsTest, ACopyWhoseNameTellsNothingDoesNotKeepAVideoFromBeingDrawn) {
  installThumbnailer("ffmpegthumbnailer -i %i -o %o -s %s");
  write("film", sample("green.mp4"));
  write("film.mp4", sample("green.mp4"));
  settle();
  EXPECT_FALSE(thumbnail("film"));
  EXPECT_TRUE(thumbnail("film.mp4"));
}

TEST_F(ThumbnailsTest, AThumbnailerThatFailsOrDrawsRubbishCostsTheThumbnailOnly) {
  installThumbnailer("false");
  write("first.mp4", sample("green.mp4"));
  settle();
  installThumbnailer("cp %i %o");
  write("second.mp4", sample("green.mp4") + "more");
  settle();
  for (const char* name : {"first.mp4", "second.mp4"}) {
    EXPECT_FALSE(thumbnail(name)) << name;
    EXPECT_EQ(state(name).upload, ContentState::Upload::Confirmed) << name;
  }
}

TEST_F(ThumbnailsTest, WhatIsNoPictureIsUploadedWithout) {
  write("notes.txt", sample("quarters.jpg"));
  write("broken.jpg", sample("quarters.jpg").substr(0, 100));
  write("lie.png", "text");
  write("empty.png", "");
  settle();
  for (const char* name : {"notes.txt", "broken.jpg", "lie.png", "empty.png"}) {
    EXPECT_FALSE(thumbnail(name)) << name;
    EXPECT_EQ(state(name).upload, ContentState::Upload::Confirmed) << name;
  }
}

TEST_F(ThumbnailsTest, AnotherVersionGetsAnotherThumbnailOrLosesIt) {
  write("photo.jpg", sample("quarters.jpg"));
  settle();
  const auto first = thumbnail("photo.jpg");
  write("photo.jpg", sample("wide-gamut.jpg"));
  settle();
  const auto second = thumbnail("photo.jpg");
  ASSERT_TRUE(second);
  EXPECT_NE(first, second);
  write("photo.jpg", "no picture any more");
  settle();
  EXPECT_FALSE(thumbnail("photo.jpg"));
}

TEST_F(ThumbnailsTest, TheSameContentIsDrawnOnce) {
  write("photo.jpg", sample("quarters.jpg"));
  settle();
  ASSERT_EQ(FaultPoint::arm("drawing.sent=error"), nullptr);
  write("copy.jpg", sample("quarters.jpg"));
  settle();
  EXPECT_EQ(thumbnail("copy.jpg"), thumbnail("photo.jpg"));
  EXPECT_TRUE(thumbnail("copy.jpg"));
}

TEST_F(ThumbnailsTest, AThumbnailThatTheStoreHasDroppedIsDrawnAgain) {
  write("photo.jpg", sample("quarters.jpg"));
  settle();
  const auto dropped = thumbnail("photo.jpg");
  ASSERT_TRUE(dropped);
  remove("photo.jpg");
  settle();
  EmbeddedEngineOptions later;
  later.clock = [] { return NSDate::fromNanoseconds(NSDate::now().nanoseconds() + kTwoMonths); };
  RZGarbageReport report;
  ASSERT_EQ(EmbeddedEngine(storePath, later).collectGarbage(report), nullptr);
  std::string file;
  ASSERT_NE(records->localFile(*dropped, file), nullptr);
  write("copy.jpg", sample("quarters.jpg"));
  settle();
  EXPECT_TRUE(thumbnailBytes("copy.jpg").starts_with("\xff\xd8\xff"));
}

TEST_F(ThumbnailsTest, ARenamedPictureKeepsItsThumbnailAndADocumentCanBecomeOne) {
  write("photo.jpg", sample("quarters.jpg"));
  write("data.txt", sample("quarters.png"));
  settle();
  EXPECT_FALSE(thumbnail("data.txt"));
  rename("photo.jpg", "beach.jpg");
  rename("data.txt", "data.png");
  settle();
  EXPECT_TRUE(thumbnail("beach.jpg"));
  EXPECT_TRUE(thumbnail("data.png"));
}

TEST_F(ThumbnailsTest, AnOldDrivesPicturesGetTheirsLaterFaultsToo) {
  useDrawer("/nowhere/yomber-thumbnailer");
  write("here.jpg", sample("quarters.jpg"));
  write("away.jpg", sample("wide-gamut.jpg") + std::string(20'000, 'x'));
  write("notes.txt", "text");
  settle();
  ASSERT_EQ(evict("away.jpg"), nullptr);
  EXPECT_FALSE(thumbnail("here.jpg"));
  EXPECT_EQ(state("here.jpg").upload, ContentState::Upload::Confirmed);
  useDrawer({});
  ASSERT_TRUE(waitUntil([&] { return thumbnail("here.jpg") && thumbnail("away.jpg"); }));
  settle();
  EXPECT_TRUE(isFault("away.jpg"));
  EXPECT_FALSE(thumbnail("notes.txt"));
  EXPECT_EQ(state("here.jpg").upload, ContentState::Upload::Confirmed);
}

TEST_F(ThumbnailsTest, AMakerThatDiesOfItCostsTheThumbnailOnly) {
  ASSERT_EQ(FaultPoint::arm("drawing.sent=error"), nullptr);
  write("photo.jpg", sample("quarters.jpg"));
  settle();
  EXPECT_EQ(state("photo.jpg").upload, ContentState::Upload::Confirmed);
  // Tried twice, then left alone, also by the next process.
  ASSERT_TRUE(waitUntil([&] { return engine->waitUntilIdle(std::chrono::milliseconds(0)); }));
  FaultPoint::disarmAll();
  restartEngine();
  settle();
  EXPECT_EQ(state("photo.jpg").upload, ContentState::Upload::Confirmed);
}

TEST_F(ThumbnailsTest, AMakerThatCannotWorkHereIsAsGoodAsNone) {
  useDrawer("/bin/false");
  write("photo.jpg", sample("quarters.jpg"));
  settle();
  EXPECT_EQ(state("photo.jpg").upload, ContentState::Upload::Confirmed);
  EXPECT_FALSE(thumbnail("photo.jpg"));
  useDrawer({});
  EXPECT_TRUE(waitUntil([&] { return thumbnail("photo.jpg").has_value(); }));
}

TEST_F(ThumbnailsTest, WhatTheStoreDoesNotTakeIsTriedUntilItDoes) {
  ASSERT_EQ(FaultPoint::arm("zarn.thumbnail.drawn=error"), nullptr);
  write("photo.jpg", sample("quarters.jpg"));
  scan();
  ASSERT_TRUE(
      waitUntil([&] { return state("photo.jpg").upload == ContentState::Upload::Confirmed; }));
  // More than once, so that it counts.
  ASSERT_TRUE(waitUntil([&] {
    const auto job = thumbnailJob("photo.jpg");
    return job && job->attempts > 2;
  }));
  FaultPoint::disarmAll();
  engine->retryNow();
  EXPECT_TRUE(waitUntil([&] { return thumbnail("photo.jpg").has_value(); }));
}

TEST_F(ThumbnailsTest, WhatFailedIsTriedAtOnceWhenSomebodyAsks) {
  engine->stop();
  engine.reset();
  ASSERT_EQ(FaultPoint::arm("zarn.thumbnail.drawn=error"), nullptr);
  reopen();
  options.firstPause = options.longestPause = std::chrono::hours(1);
  engine = ContentEngine::create(
      store, std::make_shared<Scanner>(store, std::weak_ptr<FolderVisitor>()), options);
  signIn("ann");
  engine->start();
  write("photo.jpg", sample("quarters.jpg"));
  scan();
  ASSERT_TRUE(waitUntil([&] {
    const auto job = thumbnailJob("photo.jpg");
    return job && job->attempts == 1;
  }));
  FaultPoint::disarmAll();
  ASSERT_TRUE(engine->waitUntilIdle(kPatience));
  engine->retryNow();
  EXPECT_TRUE(waitUntil([&] { return thumbnail("photo.jpg").has_value(); }));
}

TEST_F(ThumbnailsTest, WhatIsNotStoredInTimeIsMadeLater) {
  stopAt("zarn.thumbnail.drawn");
  write("photo.jpg", sample("quarters.jpg"));
  scan();
  ASSERT_TRUE(isStopped());
  ASSERT_EQ(FaultPoint::arm("zarn.thumbnail.saved=error"), nullptr);
  go();
  settle();
  FaultPoint::disarmAll();
  EXPECT_TRUE(thumbnail("photo.jpg"));
}

TEST_F(ThumbnailsTest, AStoreThatGoesBeforeItTakesAThumbnailGetsItWhenItIsBack) {
  expectThumbnailThoughTheStoreGoesAt("zarn.thumbnail.drawn");
}

TEST_F(ThumbnailsTest, AStoreThatGoesBeforeTheRecordHasItsThumbnailSavesItWhenItIsBack) {
  expectThumbnailThoughTheStoreGoesAt("zarn.thumbnail.made");
}

TEST_F(ThumbnailsTest, AQuotaWithoutRoomForItTakesTheDocument) {
  const std::string photo = sample("wide-gamut.jpg");
  write("small.txt", "text");
  settle();
  RZQuota quota;
  ASSERT_EQ(records->fetchQuota("ann", quota), nullptr);
  // The record itself takes some; the thumbnail takes as much as the picture.
  ASSERT_EQ(records->setQuota("ann", quota.used + photo.size() + 400), nullptr);
  write("photo.jpg", photo);
  settle();
  EXPECT_EQ(state("photo.jpg").upload, ContentState::Upload::Confirmed);
  EXPECT_EQ(contentInStore(id("photo.jpg")), photo);
  EXPECT_FALSE(thumbnail("photo.jpg"));
}

}  // namespace
}  // namespace yomber
