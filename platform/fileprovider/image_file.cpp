#include "platform/fileprovider/image_file.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <unistd.h>

#include <cerrno>
#include <string>
#include <utility>

#include "platform/fileprovider/thumbnail.h"
#include "platform/foundation/fault_points.h"
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

/// 0 or an errno value.
int writeAt(int file, std::string_view bytes, std::uint64_t offset) {
  if (noMemory.hit()) return ENOSPC;
  while (!bytes.empty()) {
    const ssize_t count = pwrite(file, bytes.data(), bytes.size(), static_cast<off_t>(offset));
    if (count < 0 && errno != EINTR) return errno;
    if (count <= 0) continue;
    bytes.remove_prefix(static_cast<std::size_t>(count));
    offset += static_cast<std::uint64_t>(count);
  }
  return 0;
}

/// 0 or an errno value; `bytes` are fewer than was asked for where the file ends.
int readAt(int file, ImagePlace place, std::string& bytes) {
  int number = 0;
  bytes.resize_and_overwrite(place.length, [&](char* buffer, std::size_t size) {
    std::size_t done = 0;
    while (done < size) {
      const ssize_t count =
          pread(file, buffer + done, size - done, static_cast<off_t>(place.offset + done));
      if (count == 0) break;
      if (count > 0) {
        done += static_cast<std::size_t>(count);
      } else if (errno != EINTR) {
        number = errno;
        break;
      }
    }
    return done;
  });
  return number;
}

}  // namespace

NSErrorRef imageTooLargeError(std::uint64_t length) {
  return unreadable("the thumbnail has " + std::to_string(length) +
                    " bytes, more than any that is shown");
}

NSErrorRef ImageFile::append(std::string_view image, ImagePlace& place) {
  if (!image.empty() && file_ == nullptr) {
    FileDescriptor made(memfd_create("yomber-images", MFD_CLOEXEC));
    if (!made) return NSError::errorWithErrno(errno);
    file_ = std::make_shared<const FileDescriptor>(std::move(made));
  }
  if (!image.empty()) {
    if (const int number = writeAt(file_->get(), image, length_)) {
      return NSError::errorWithErrno(number);
    }
  }
  place = {.offset = length_, .length = image.size()};
  length_ += image.size();
  return nullptr;
}

NSDataRef ImageFile::read(ImagePlace place, NSErrorRef& error) const {
  if (place.length > kMaximumThumbnailBytes) {
    error = imageTooLargeError(place.length);
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
  std::string bytes;
  const int number = readAt(file_->get(), place, bytes);
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
