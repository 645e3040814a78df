#include "platform/fileprovider/tags_data.h"

namespace yomber {

std::optional<std::string> FPTag::valueForKey(std::string_view key) const {
  if (key == "label") return label_;
  return std::nullopt;
}

std::vector<FPTagRef> FPGetTagsFromTagsData(const NSDataRef& data) {
  std::vector<FPTagRef> tags;
  std::string_view rest = data != nullptr ? data->bytes() : std::string_view();
  if (!rest.empty() && rest.back() != '\0') return {};
  while (!rest.empty()) {
    const std::size_t end = rest.find('\0');
    if (end == 0) return {};
    tags.push_back(std::make_shared<FPTag>(std::string(rest.substr(0, end))));
    rest.remove_prefix(end + 1);
  }
  return tags;
}

NSDataRef FPTagsDataFromLabels(const std::vector<std::string>& labels) {
  std::string bytes;
  for (const auto& label : labels) bytes.append(label).push_back('\0');
  return NSData::dataWithString(bytes);
}

}  // namespace yomber
