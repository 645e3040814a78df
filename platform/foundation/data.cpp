#include "platform/foundation/data.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstring>
#include <span>

#include "platform/foundation/file_descriptor.h"
#include "platform/foundation/hexadecimal.h"

namespace yomber {

NSDataRef NSData::dataWithBytes(const void* bytes, std::size_t length) {
  return std::make_shared<const NSData>(std::string(static_cast<const char*>(bytes), length));
}

NSDataRef NSData::dataWithString(std::string_view bytes) {
  return std::make_shared<const NSData>(std::string(bytes));
}

NSDataRef NSData::dataWithContentsOfFile(const std::string& path, std::size_t maximumLength) {
  const FileDescriptor file(open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK));
  struct stat status{};
  if (!file || fstat(file.get(), &status) != 0 || !S_ISREG(status.st_mode)) return nullptr;
  const auto length = static_cast<std::uint64_t>(status.st_size);
  if (length > maximumLength) return nullptr;
  bool isWhole = true;
  std::string bytes;
  bytes.resize_and_overwrite(length, [&](char* buffer, std::size_t size) {
    std::size_t done = 0;
    while (done < size) {
      const ssize_t count = read(file.get(), buffer + done, size - done);
      if (count < 0 && errno == EINTR) continue;
      if (count <= 0) break;
      done += static_cast<std::size_t>(count);
    }
    isWhole = done == size;
    return done;
  });
  return isWhole ? std::make_shared<const NSData>(std::move(bytes)) : nullptr;
}

void NSData::getBytes(void* buffer, std::size_t length) const {
  const std::size_t count = std::min(length, bytes_.size());
  if (count > 0) std::memcpy(buffer, bytes_.data(), count);
}

bool NSData::isEqualToData(const NSDataRef& other) const {
  return other != nullptr && bytes_ == other->bytes_;
}

std::string NSData::description() const {
  return "<" + hexadecimal(std::as_bytes(std::span(bytes_))) + ">";
}

}  // namespace yomber
