#include "platform/fileprovider/thumbnail_batch.h"

#include <utility>

#include "platform/fileprovider/item_codec.h"
#include "platform/ipc/error_codec.h"

namespace yomber {
namespace {

/// What a thumbnail takes besides its image.
constexpr std::size_t kOverhead = 256;

}  // namespace

void ThumbnailBatch::add(ItemThumbnail thumbnail) {
  const NSDataRef image = std::exchange(thumbnail.image, nullptr);
  Entry& entry = entries_.emplace_back(Entry{std::move(thumbnail), std::nullopt});
  bytes_ += kOverhead;
  if (image == nullptr) return;
  ImagePlace place;
  if (NSErrorRef error = images_.append(image->bytes(), place)) {
    entry.thumbnail.error = std::move(error);
    return;
  }
  entry.image = place;
  bytes_ += image->length();
}

ItemThumbnail ThumbnailBatch::at(std::size_t index) const {
  const Entry& entry = entries_.at(index);
  ItemThumbnail thumbnail = entry.thumbnail;
  if (entry.image) thumbnail.image = images_.read(*entry.image, thumbnail.error);
  return thumbnail;
}

void ThumbnailBatch::encode(protocol::ThumbnailReceiver::DidFetchParams::Builder params) const {
  auto list = params.initThumbnails(static_cast<unsigned>(entries_.size()));
  for (unsigned i = 0; i < list.size(); ++i) {
    const auto& [thumbnail, image] = entries_[i];
    auto builder = list[i];
    builder.setIdentifier(wireText(thumbnail.identifier));
    if (image) {
      auto place = builder.getImage().initPlace();
      place.setOffset(image->offset);
      place.setLength(image->length);
    }
    if (thumbnail.contentType) builder.setContentType(wireText(*thumbnail.contentType));
    if (thumbnail.error != nullptr) ipc::encodeOptional(thumbnail.error, builder.initFailure());
  }
  if (images_.exists()) params.setImages(images_.capability());
}

ThumbnailBatch::Entry ThumbnailBatch::decodeEntry(protocol::Thumbnail::Reader reader) {
  Entry entry;
  entry.thumbnail.identifier = stringFromWire(reader.getIdentifier());
  const auto image = reader.getImage();
  if (image.isPlace()) {
    entry.image = {.offset = image.getPlace().getOffset(), .length = image.getPlace().getLength()};
  }
  if (reader.getContentType().size() > 0) {
    entry.thumbnail.contentType = stringFromWire(reader.getContentType());
  }
  entry.thumbnail.error = ipc::decodeOptional(reader.getFailure());
  return entry;
}

kj::Promise<ThumbnailBatch> ThumbnailBatch::decode(
    protocol::ThumbnailReceiver::DidFetchParams::Reader params) {
  ThumbnailBatch batch;
  for (const auto each : params.getThumbnails()) batch.entries_.push_back(decodeEntry(each));
  kj::Promise<ImageFile> images =
      params.hasImages() ? ImageFile::fromCapability(params.getImages()) : ImageFile();
  return images.then([batch = std::move(batch)](ImageFile file) mutable {
    batch.images_ = std::move(file);
    return std::move(batch);
  });
}

}  // namespace yomber
