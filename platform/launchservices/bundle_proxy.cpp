#include "platform/launchservices/bundle_proxy.h"

#include <algorithm>
#include <utility>

#include "platform/launchservices/desktop_files.h"

namespace yomber {

std::optional<NSPropertyValue> LSPropertyValues::objectForKey(const std::string& key) const {
  const auto found = values_.find(key);
  return found == values_.end() ? std::nullopt : std::optional(found->second);
}

LSBundleProxy::LSBundleProxy(std::string identifier, const DesktopEntry& entry)
    : identifier_(std::move(identifier)) {
  entitlements_["application-identifier"] = identifier_;
  const auto addList = [this](const char* key, const std::vector<std::string>& list) {
    if (!list.empty()) entitlements_[key] = list;
  };
  addList("X-Yomber-Services", entry.services);
  addList("X-Yomber-Containers", entry.containerIDs);
  addList("X-Yomber-Shared-Containers", entry.sharedContainerIDs);
}

LSBundleProxyRef LSBundleProxy::bundleProxyForIdentifier(const std::string& identifier) {
  const auto files = desktopFiles(applicationDirectories());
  const auto found = std::ranges::find(files, identifier, &DesktopFile::id);
  if (found == files.end()) return nullptr;
  const auto entry = parseDesktopEntry(desktopFileText(found->path));
  if (!entry || entry->isHidden) return nullptr;
  return std::make_shared<LSBundleProxy>(identifier, *entry);
}

LSPropertyValues LSBundleProxy::entitlementValuesForKeys(const std::set<std::string>& keys) const {
  std::map<std::string, NSPropertyValue> values;
  for (const auto& [key, value] : entitlements_) {
    if (keys.contains(key)) values.emplace(key, value);
  }
  return LSPropertyValues(std::move(values));
}

}  // namespace yomber
