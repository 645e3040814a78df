#include "platform/foundation/fault_attributes.h"

#include <sys/xattr.h>

#include <array>
#include <cerrno>
#include <fstream>

#include "platform/foundation/descriptor_path.h"

namespace yomber {

const std::string& bootIdentifier() {
  static const std::string identifier = [] {
    std::string line;
    std::ifstream file("/proc/sys/kernel/random/boot_id");
    std::getline(file, line);
    return line;
  }();
  return identifier;
}

namespace {

/// `length` is what reading the attribute of a filled fault answered.
bool isFilledInThisBoot(const std::array<char, 64>& value, ssize_t length) {
  if (length <= 0 || bootIdentifier().empty()) return false;
  return std::string_view(value.data(), static_cast<std::size_t>(length)) == bootIdentifier();
}

}  // namespace

bool isFaultAtPath(const std::string& path) {
  if (lgetxattr(path.c_str(), kFaultAttribute, nullptr, 0) < 0) return false;
  std::array<char, 64> filled{};
  return !isFilledInThisBoot(
      filled, lgetxattr(path.c_str(), kFilledAttribute, filled.data(), filled.size()));
}

ssize_t readAttribute(int descriptor, const char* name, void* value, std::size_t size) {
  const ssize_t length = fgetxattr(descriptor, name, value, size);
  if (length >= 0 || errno != EBADF) return length;
  return getxattr(pathOfDescriptor(descriptor).c_str(), name, value, size);
}

bool isFault(int descriptor) {
  if (readAttribute(descriptor, kFaultAttribute, nullptr, 0) < 0) return false;
  std::array<char, 64> filled{};
  return !isFilledInThisBoot(
      filled, readAttribute(descriptor, kFilledAttribute, filled.data(), filled.size()));
}

}  // namespace yomber
