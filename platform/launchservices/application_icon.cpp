#include "platform/launchservices/application_icon.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cmath>
#include <cstdint>
#include <string_view>
#include <utility>

#include "platform/drawing/picture_drawer.h"
#include "platform/foundation/file_descriptor.h"
#include "platform/foundation/log.h"
#include "platform/launchservices/icon_themes.h"

namespace yomber {
namespace {

constexpr off_t kMaximumFileSize = off_t{4} * 1024 * 1024;
constexpr std::string_view kPNGStart = "\x89PNG\r\n\x1a\n";
constexpr std::size_t kHeaderLength = 24;  // up to width and height
constexpr double kLargestSide = 4096;

FileDescriptor openPicture(const std::string& path) {
  FileDescriptor file(open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
  struct stat status{};
  const bool isFitting = file && fstat(file.get(), &status) == 0 && S_ISREG(status.st_mode) &&
                         status.st_size <= kMaximumFileSize;
  return isFitting ? std::move(file) : FileDescriptor();
}

std::string readWhole(int file) {
  std::string text;
  std::array<char, 65536> buffer;
  while (std::cmp_less_equal(text.size(), kMaximumFileSize)) {
    const ssize_t length =
        pread(file, buffer.data(), buffer.size(), static_cast<off_t>(text.size()));
    if (length <= 0) break;
    text.append(buffer.data(), static_cast<std::size_t>(length));
  }
  return text;
}

std::uint32_t bigEndian(std::string_view bytes) {
  std::uint32_t result = 0;
  for (const char byte : bytes.substr(0, 4))
    result = result << 8 | static_cast<unsigned char>(byte);
  return result;
}

/// Of a PNG picture, by its header alone; 0 for what is none.
std::uint32_t largerSide(std::string_view png) {
  if (png.size() < kHeaderLength || !png.starts_with(kPNGStart)) return 0;
  return std::max(bigEndian(png.substr(16)), bigEndian(png.substr(20)));
}

/// PNG, drawn by another process.
NSDataRef drawn(const std::string& path, int file, std::uint32_t side) {
  // Never destroyed: threads may ask while the process ends.
  static auto* const drawer = new PictureDrawer;
  NSErrorRef error;
  const auto picture = drawer->draw(file, side, drawing::Form::Png, &error);
  if (picture) return NSData::dataWithString(readWhole(picture->file.get()));
  log_error(defaultLog(), "[ERROR] the icon %s cannot be drawn: %@", path, error);
  return nullptr;
}

}  // namespace

std::optional<ApplicationIcon> bestFittingIcon(const std::string& iconName, double side) {
  if (!(side >= 1)) return std::nullopt;
  const int pixels = static_cast<int>(std::ceil(std::min(side, kLargestSide)));
  const auto icon = IconThemes::system().find(iconName, pixels);
  if (!icon) return std::nullopt;
  const FileDescriptor file = openPicture(icon->path);
  if (!file) return std::nullopt;
  const std::string bytes = readWhole(file.get());
  const std::uint32_t own = largerSide(bytes);
  const bool fits = own > 0 && own <= static_cast<std::uint32_t>(pixels);
  NSDataRef data = fits ? NSData::dataWithString(bytes)
                        : drawn(icon->path, file.get(), static_cast<std::uint32_t>(pixels));
  if (!data) return std::nullopt;
  return ApplicationIcon{std::move(data), !icon->isThemed || iconName.ends_with("-symbolic")};
}

}  // namespace yomber
