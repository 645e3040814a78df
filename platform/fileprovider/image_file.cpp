#include "platform/fileprovider/image_file.h"

#include <fcntl.h>
#include <sys/mman.h>

#include <cerrno>
#include <string>
#include <utility>

#include "platform/fileprovider/thumbnail.h"
#include "platform/foundation/fault_points.h"
#include "platform/foundation/whole_transfer.h"
#include "platform/ipc/unix_socket.h"

namespace yomber {
namespace {

FaultPoint noMemory("fileprovider.images.write");
FaultPoint outOfDescriptors("fileprovider.images.receive");

class Server final : public protocol::ImageFile::Server {
 public:
  explicit Server(std::shared_ptr<const FileDescriptor> file) : file_(std::move(file)) {}
  kj::Maybe<int> getFd() override { return file_->get(); }

 private:
  const std::shared_ptr<const FileDescriptor> file_;
};

/// Reading anything else might wait for ever.
bool isFileOfMemory(int descriptor) { return fcntl(descriptor, F_GET_SEALS) >= 0; }

NSErrorRef unreadable(const std::string& why) {
  return NSError::errorWithDomain(NSCocoaErrorDomain, NSFileReadCorruptFileError,
                                  {{NSLocalizedDescriptionKey, why}});
}

NSErrorRef tooLarge(std::uint64_t length) {
  return unreadable("the thumbnail has " + std::to_string(length) +
                    " bytes, more than any that is shown");
}

}  // namespace

NSErrorRef ImageFile::append(std::string_view image, ImagePlace& place) {
  if (image.size() > kMaximumThumbnailBytes) return tooLarge(image.size());
  place = {.offset = length_, .length = image.size()};
  if (image.empty()) return nullptr;
  if (file_ == nullptr) {
    FileDescriptor made(memfd_create("yomber-images", MFD_CLOEXEC));
    if (!made) return NSError::errorWithErrno(errno);
    file_ = std::make_shared<const FileDescriptor>(std::move(made));
  }
  const int number = noMemory.hit() ? ENOSPC : writeWhole(file_->get(), image, length_);
  if (number != 0) return NSError::errorWithErrno(number);
  length_ += image.size();
  return nullptr;
}

NSDataRef ImageFile::read(ImagePlace place, NSErrorRef& error) const {
  if (place.length > kMaximumThumbnailBytes) {
    error = tooLarge(place.length);
    return nullptr;
  }
  if (place.length == 0) return NSData::dataWithString("");
  if (file_ == nullptr) {
    error = unreadable(
        "the thumbnail's image did not arrive with it: a process on its way may have too many "
        "files "
        "open");
    return nullptr;
  }
  int number = 0;
  std::string bytes;
  bytes.resize_and_overwrite(place.length, [&](char* buffer, std::size_t size) {
    std::size_t done = 0;
    number = readWhole(file_->get(), {buffer, size}, place.offset, done);
    return done;
  });
  if (bytes.size() == place.length) return std::make_shared<const NSData>(std::move(bytes));
  error = number != 0 ? NSError::errorWithErrno(number)
                      : unreadable("the thumbnail's image is not whole");
  return nullptr;
}

protocol::ImageFile::Client ImageFile::capability() const { return kj::heap<Server>(file_); }

kj::Promise<ImageFile> ImageFile::fromCapability(protocol::ImageFile::Client capability) {
  auto descriptor = capability.getFd();
  return descriptor.then([capability = kj::mv(capability)](kj::Maybe<int> fd) {
    ImageFile images;
    KJ_IF_MAYBE (shared, fd) {
      ipc::UniqueFd own;
      if (!outOfDescriptors.hit()) own = ipc::duplicateDescriptor(*shared);
      if (own && isFileOfMemory(own.get())) {
        images.file_ = std::make_shared<const FileDescriptor>(own.release());
      }
    }
    return images;
  });
}

}  // namespace yomber
