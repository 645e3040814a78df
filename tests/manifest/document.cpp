#include "tests/manifest/document.h"

#include <array>
#include <fstream>
#include <random>

#include <fcntl.h>
#include <sys/xattr.h>
#include <unistd.h>

#include "platform/foundation/file_descriptor.h"

namespace yomber::testing {

std::string Version::bytes() const {
  std::string content(size, '\0');
  std::mt19937 random(seed);
  for (std::size_t i = 0; i < size; i += sizeof(std::uint32_t)) {
    const auto word = static_cast<std::uint32_t>(random()) | 0x01010101U;
    for (std::size_t byte = 0; byte < sizeof(word) && i + byte < size; ++byte) {
      content[i + byte] = static_cast<char>(word >> (8 * byte));
    }
  }
  return content;
}

std::string Document::description() const {
  return path + " (" + (id.empty() ? "no id yet" : id) + ", " + std::to_string(versions.size()) +
         " contents" + (durable ? ", safe " + std::to_string(*durable + 1) : "") +
         (isTorn ? ", overwritten since" : "") + ";" + history + ")";
}

bool isMarkedAway(int file, const std::string& boot) {
  if (fgetxattr(file, "user.yomber.fault", nullptr, 0) < 0) return false;
  std::array<char, 64> filled{};
  const ssize_t length = fgetxattr(file, "user.yomber.filled", filled.data(), filled.size());
  return length <= 0 || std::string(filled.data(), static_cast<std::size_t>(length)) != boot;
}

std::string machineBoot() {
  std::string identifier;
  std::ifstream("/proc/sys/kernel/random/boot_id") >> identifier;
  return identifier;
}

Reading readAt(const std::string& path, const std::string& boot) {
  Reading reading;
  const FileDescriptor file(open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
  if (!file) return reading;
  if (isMarkedAway(file.get(), boot)) {
    reading.kind = Reading::Kind::Away;
    return reading;
  }
  reading.kind = Reading::Kind::Content;
  std::array<char, 65536> piece{};
  for (ssize_t length = 0; (length = read(file.get(), piece.data(), piece.size())) > 0;) {
    reading.bytes.append(piece.data(), static_cast<std::size_t>(length));
  }
  return reading;
}

}  // namespace yomber::testing
