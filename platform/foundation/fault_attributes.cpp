#include "platform/foundation/fault_attributes.h"

#include <sys/xattr.h>

#include <array>
#include <fstream>

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

bool isFaultAtPath(const std::string& path) {
  if (lgetxattr(path.c_str(), kFaultAttribute, nullptr, 0) < 0) return false;
  std::array<char, 64> filled{};
  const ssize_t length = lgetxattr(path.c_str(), kFilledAttribute, filled.data(), filled.size());
  if (length <= 0) return true;
  const std::string_view boot(filled.data(), static_cast<std::size_t>(length));
  return bootIdentifier().empty() || boot != bootIdentifier();
}

}  // namespace yomber
