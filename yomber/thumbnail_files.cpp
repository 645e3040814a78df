#include "yomber/thumbnail_files.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <filesystem>
#include <system_error>

#include "platform/foundation/bounced_name.h"
#include "platform/foundation/file_descriptor.h"
#include "platform/foundation/whole_transfer.h"

namespace yomber {

namespace {

/// An item's name as a name of a file, whatever the drive calls it.
std::string fileNameFor(const std::string& itemName, std::string_view suffix) {
  std::string name = itemName;
  std::ranges::replace(name, '/', '_');
  std::ranges::replace(name, '\0', '_');
  if (name.empty()) name = "item";
  if (name.starts_with('.')) name.insert(0, 1, '_');
  if (name.ends_with(suffix)) return name;
  constexpr std::size_t longest = kMaximumNameLength - 16;
  if (name.size() + suffix.size() > longest) name.resize(longest - suffix.size());
  return name + std::string(suffix);
}

}  // namespace

std::string_view pictureSuffix(std::string_view picture) {
  if (picture.starts_with("\x89PNG\r\n")) return ".png";
  if (picture.starts_with("\xff\xd8\xff")) return ".jpg";
  if (picture.starts_with("GIF8")) return ".gif";
  if (picture.starts_with("RIFF") && picture.substr(0, 12).ends_with("WEBP")) return ".webp";
  if (picture.starts_with("<svg") || picture.starts_with("<?xml")) return ".svg";
  return ".img";
}

NSErrorRef ThumbnailFiles::open() const {
  std::error_code failure;
  std::filesystem::create_directories(folder_, failure);
  return failure ? NSError::errorWithErrno(failure.value(), folder_) : nullptr;
}

NSErrorRef ThumbnailFiles::write(const std::string& itemName, std::string_view picture,
                                 std::string& path) {
  FileDescriptor file;
  int number = 0;
  std::uint64_t tried = 0;
  const auto isTaken = [&](const std::string& name) {
    ++tried;
    path = folder_ + "/" + name;
    file = FileDescriptor(::open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0666));
    number = file ? 0 : errno;
    return number == EEXIST;
  };
  const std::string fileName = fileNameFor(itemName, pictureSuffix(picture));
  std::uint64_t& next = nextNumbers_.try_emplace(fileName, 2).first->second;
  (void)bouncedName(fileName, isTaken, kMaximumNameLength, next);
  next += tried - 1;
  if (number == 0) {
    number = writeWhole(file.get(), picture);
    if (number != 0) (void)unlink(path.c_str());
  }
  return number != 0 ? NSError::errorWithErrno(number, path) : nullptr;
}

}  // namespace yomber
