#include "platform/foundation/data.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <span>

#include "platform/foundation/file_descriptor.h"
#include "platform/foundation/hexadecimal.h"
#include "platform/foundation/whole_transfer.h"

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
  std::string bytes;
  bytes.resize_and_overwrite(length, [&](char* buffer, std::size_t size) {
    std::size_t done = 0;
    (void)readWhole(file.get(), {buffer, size}, 0, done);
    return done;
  });
  return bytes.size() == length ? std::make_shared<const NSData>(std::move(bytes)) : nullptr;
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
