#include "platform/ostrell/reading_options.h"

#include <array>
#include <cstdint>
#include <utility>

#include "platform/foundation/log_format.h"

namespace yomber {
namespace {

constexpr std::array kNames{
    std::pair(NSFileCoordinatorReadingWithoutChanges, "WithoutChanges"),
    std::pair(NSFileCoordinatorReadingResolvesSymbolicLink, "ResolvesSymbolicLink"),
    std::pair(NSFileCoordinatorReadingImmediatelyAvailableMetadataOnly,
              "ImmediatelyAvailableMetadataOnly"),
    std::pair(NSFileCoordinatorReadingForUploading, "ForUploading"),
    std::pair(QSFileCoordinatorReadingForcesProviding, "ForcesProviding"),
};

}  // namespace

std::string QSFileCoordinatorReadingOptionsPrettyPrint(NSFileCoordinatorReadingOptions options) {
  std::string text;
  const auto add = [&text](const std::string& name) { text += (text.empty() ? "" : "|") + name; };
  for (const auto& [bit, name] : kNames) {
    if ((options & bit) == 0) continue;
    add(name);
    options &= ~bit;
  }
  static constexpr LogFormat<std::uint64_t> kHexadecimal("0x%llx");
  if (options != 0) add(kHexadecimal.render(options));
  return text.empty() ? "none" : text;
}

}  // namespace yomber
