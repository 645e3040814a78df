#include "platform/fileprovider/thumbnail_batch.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/mman.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdint>
#include <functional>
#include <limits>
#include <string>
#include <utility>
#include <vector>

#include "platform/fileprovider/thumbnail_taker.h"
#include "platform/foundation/fault_points.h"
#include "platform/foundation/file_descriptor.h"
#include "platform/ipc/call.h"

namespace yomber {
namespace {

using protocol::ThumbnailReceiver;
using testing::SizeIs;
using Params = ThumbnailReceiver::DidFetchParams::Builder;

/// What somebody who takes thumbnails is told by a peer that says what `fill` does.
std::vector<ItemThumbnail> taken(const std::function<void(Params)>& fill) {
  std::vector<ItemThumbnail> told;  // the call is over when it is read
  const ThumbnailTaker taker("test", [&](const ItemThumbnail& each) { told.push_back(each); });
  ipc::Remote<ThumbnailReceiver> remote;
  ipc::EventLoop::shared().runAndWait(
      [&] { remote = ipc::Remote<ThumbnailReceiver>(taker.receiver()); });
  EXPECT_EQ(ipc::callAndWait(remote, &ThumbnailReceiver::Client::didFetchRequest, fill,
                             [](const auto&) {}),
            nullptr);
  return told;
}

std::vector<ItemThumbnail> taken(const ThumbnailBatch& batch) {
  return taken([&](Params params) { batch.encode(params); });
}

ItemThumbnail picture(const std::string& identifier, const std::string& image) {
  return {identifier, NSData::dataWithString(image), std::nullopt, nullptr};
}

void expectError(const ItemThumbnail& thumbnail) {
  EXPECT_EQ(thumbnail.image, nullptr) << thumbnail.identifier;
  EXPECT_NE(thumbnail.error, nullptr) << thumbnail.identifier;
}

/// A file of images that is whatever descriptor the test says.
class ForeignFile final : public protocol::ImageFile::Server {
 public:
  explicit ForeignFile(FileDescriptor file) : file_(std::move(file)) {}
  kj::Maybe<int> getFd() override {
    if (!file_) return nullptr;
    return file_.get();
  }

 private:
  const FileDescriptor file_;
};

/// Says of "a" that it has four bytes of the file that the descriptor is.
void tellOf(Params params, FileDescriptor file) {
  auto thumbnail = params.initThumbnails(1)[0];
  thumbnail.setIdentifier("a");
  thumbnail.getImage().initPlace().setLength(4);
  params.setImages(kj::heap<ForeignFile>(std::move(file)));
}

class ThumbnailBatchTest : public testing::Test {
 protected:
  ~ThumbnailBatchTest() override { FaultPoint::disarmAll(); }
};

TEST_F(ThumbnailBatchTest, WhatIsAddedArrivesInItsOrder) {
  ThumbnailBatch batch;
  batch.add(picture("first", "an image"));
  batch.add({"none", nullptr, std::nullopt, nullptr});
  batch.add({"failed", nullptr, std::nullopt, NSError::errorWithErrno(EIO)});
  batch.add(picture("empty", ""));
  batch.add({"last", NSData::dataWithString("another"), "x/bare", nullptr});
  const auto told = taken(batch);
  ASSERT_THAT(told, SizeIs(5));
  EXPECT_EQ(told[0].identifier, "first");
  EXPECT_EQ(told[0].image->bytes(), "an image");
  EXPECT_EQ(told[0].contentType, std::nullopt);
  EXPECT_EQ(told[1].image, nullptr);
  EXPECT_EQ(told[1].error, nullptr);
  EXPECT_TRUE(told[2].error->is(NSPOSIXErrorDomain, EIO));
  EXPECT_EQ(told[3].image->length(), 0U);
  EXPECT_EQ(told[4].image->bytes(), "another");
  EXPECT_EQ(told[4].contentType, "x/bare");
}

TEST_F(ThumbnailBatchTest, EmptyImagesNeedNoFile) {
  ThumbnailBatch batch;
  batch.add(picture("empty", ""));
  const auto told = taken(batch);
  ASSERT_THAT(told, SizeIs(1));
  EXPECT_EQ(told[0].image->length(), 0U);
}

TEST_F(ThumbnailBatchTest, AnImageThatFindsNoMemoryBecomesAnErrorAndTheOthersArrive) {
  ThumbnailBatch batch;
  batch.add(picture("a", "before"));
  ASSERT_EQ(FaultPoint::arm("fileprovider.images.write=error"), nullptr);
  batch.add(picture("b", "meanwhile"));
  FaultPoint::disarmAll();
  batch.add(picture("c", "after"));
  const auto told = taken(batch);
  ASSERT_THAT(told, SizeIs(3));
  EXPECT_EQ(told[0].image->bytes(), "before");
  expectError(told[1]);
  EXPECT_TRUE(told[1].error->is(NSPOSIXErrorDomain, ENOSPC));
  EXPECT_EQ(told[2].image->bytes(), "after");
}

TEST_F(ThumbnailBatchTest, ImagesForWhichThereIsNoDescriptorAreErrors) {
  ThumbnailBatch batch;
  batch.add(picture("a", "image"));
  batch.add({"none", nullptr, std::nullopt, nullptr});
  ASSERT_EQ(FaultPoint::arm("fileprovider.images.receive=error"), nullptr);
  const auto told = taken(batch);
  ASSERT_THAT(told, SizeIs(2));
  expectError(told[0]);
  EXPECT_EQ(told[1].error, nullptr);
}

TEST_F(ThumbnailBatchTest, PlacesOutsideOfTheFileAreErrors) {
  constexpr auto kLargest = std::numeric_limits<std::uint64_t>::max();
  const std::vector<ImagePlace> places{{.offset = 1, .length = 4},
                                       {.offset = 0, .length = 5},
                                       {.offset = 1000, .length = 1},
                                       {.offset = std::uint64_t{1} << 63U, .length = 1},
                                       {.offset = kLargest - 1, .length = 4},
                                       {.offset = 0, .length = kMaximumThumbnailBytes + 1},
                                       {.offset = 0, .length = kLargest}};
  ThumbnailBatch batch;
  batch.add(picture("a", "four"));
  for (const ImagePlace& place : places) {
    const auto told = taken([&](Params params) {
      batch.encode(params);
      auto wire = params.getThumbnails()[0].getImage().getPlace();
      wire.setOffset(place.offset);
      wire.setLength(place.length);
    });
    ASSERT_THAT(told, SizeIs(1));
    expectError(told[0]);
  }
}

TEST_F(ThumbnailBatchTest, AnImageThatIsLargerThanAnyIsAnErrorAlsoWhereTheFileHasIt) {
  FileDescriptor file(memfd_create("test", MFD_CLOEXEC));
  ASSERT_EQ(ftruncate(file.get(), kMaximumThumbnailBytes + 1), 0);
  const auto told = taken([&](Params params) {
    tellOf(params, std::move(file));
    params.getThumbnails()[0].getImage().getPlace().setLength(kMaximumThumbnailBytes + 1);
  });
  ASSERT_THAT(told, SizeIs(1));
  expectError(told[0]);
}

TEST_F(ThumbnailBatchTest, AFileThatIsNoneIsAnError) {
  std::array<int, 2> ends{};
  ASSERT_EQ(pipe(ends.data()), 0);
  const FileDescriptor writer(ends[1]);
  const auto ofPipe = taken([&](Params params) { tellOf(params, FileDescriptor(ends[0])); });
  ASSERT_THAT(ofPipe, SizeIs(1));
  expectError(ofPipe[0]);
  const auto ofDevice = taken([](Params params) {
    tellOf(params, FileDescriptor(open("/dev/zero", O_RDONLY | O_CLOEXEC)));
  });
  ASSERT_THAT(ofDevice, SizeIs(1));
  expectError(ofDevice[0]);
  const auto ofNothing = taken([](Params params) { tellOf(params, FileDescriptor()); });
  ASSERT_THAT(ofNothing, SizeIs(1));
  expectError(ofNothing[0]);
}

TEST_F(ThumbnailBatchTest, ATooLargeImageIsNotKept) {
  ThumbnailBatch batch;
  batch.add(picture("a", std::string(kMaximumThumbnailBytes + 1, 'x')));
  EXPECT_LT(batch.bytes(), 1000U);
  expectError(batch.at(0));
}

}  // namespace
}  // namespace yomber
