#pragma once

#include <cstddef>
#include <optional>
#include <utility>
#include <vector>

#include "platform/fileprovider/image_file.h"
#include "platform/fileprovider/thumbnail.h"
#include "protocols/thumbnails.capnp.h"

namespace yomber {

/// The thumbnails of one call, with their images in a file.
///
/// Ownership: copies share the file of images.
/// Thread-safety: one thread at a time; for reading, any.
class ThumbnailBatch {
 public:
  /// Images are put into `images`, behind those that are there.
  explicit ThumbnailBatch(ImageFile images = {}) : images_(std::move(images)) {}

  /// An image that is too large, or finds no memory, becomes an error.
  void add(ItemThumbnail thumbnail);
  [[nodiscard]] std::size_t size() const { return entries_.size(); }
  /// What the thumbnails take; bytes, about.
  [[nodiscard]] std::size_t bytes() const { return bytes_; }
  /// Copies the image out of the file. One that is not there becomes an error.
  [[nodiscard]] ItemThumbnail at(std::size_t index) const;
  [[nodiscard]] const ImageFile& images() const { return images_; }

  // Loop thread only.
  void encode(protocol::ThumbnailReceiver::DidFetchParams::Builder params) const;
  /// As it came from a peer; the parameters may go before the promise is there.
  static kj::Promise<ThumbnailBatch> decode(
      protocol::ThumbnailReceiver::DidFetchParams::Reader params);

 private:
  struct Entry {
    ItemThumbnail thumbnail;  ///< without its image
    std::optional<ImagePlace> image;
  };

  static Entry decodeEntry(protocol::Thumbnail::Reader reader);

  std::vector<Entry> entries_;
  ImageFile images_;
  std::size_t bytes_ = 0;
};

}  // namespace yomber
