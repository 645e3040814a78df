#pragma once

#include <cstdint>
#include <memory>
#include <string_view>

#include "platform/foundation/data.h"
#include "platform/foundation/error.h"
#include "platform/foundation/file_descriptor.h"
#include "protocols/thumbnails.capnp.h"

namespace yomber {

/// Where an image is in a file of images; bytes.
struct ImagePlace {
  std::uint64_t offset = 0;
  std::uint64_t length = 0;
};

/// Images one after another in a file of memory. The file travels as its descriptor, so that the
/// processes on the way copy no image.
///
/// Ownership: copies share the file; the memory goes with the last of them, in whatever process.
/// Thread-safety: one thread at a time; for reading, any.
class ImageFile {
 public:
  /// Puts the image behind those that are there. With an error it is not there: it is too large for
  /// a thumbnail, or finds no memory.
  [[nodiscard]] NSErrorRef append(std::string_view image, ImagePlace& place);
  /// The image at a place that somebody else tells of; nil with an error when there is none, or one
  /// that is too large for a thumbnail.
  [[nodiscard]] NSDataRef read(ImagePlace place, NSErrorRef& error) const;
  /// Of what was appended; bytes.
  [[nodiscard]] std::uint64_t length() const { return length_; }
  /// Forgets the images and keeps the memory for the next ones. Whoever has been sent the file must
  /// have read it.
  void clear() { length_ = 0; }
  /// Whether there is a file: it is made with the first image that has bytes.
  [[nodiscard]] bool exists() const { return file_ != nullptr; }

  // Loop thread only.
  [[nodiscard]] protocol::ImageFile::Client capability() const;
  /// Without a file where no file of memory came along: there may have been no descriptor left.
  static kj::Promise<ImageFile> fromCapability(protocol::ImageFile::Client capability);

 private:
  std::shared_ptr<const FileDescriptor> file_;
  std::uint64_t length_ = 0;
};

}  // namespace yomber
