#pragma once

#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>

#include "platform/foundation/property_value.h"
#include "platform/launchservices/desktop_entry.h"

namespace yomber {

class LSBundleProxy;
using LSBundleProxyRef = std::shared_ptr<const LSBundleProxy>;

/// Values by key, as an application declares them.
class LSPropertyValues {
 public:
  explicit LSPropertyValues(std::map<std::string, NSPropertyValue> values)
      : values_(std::move(values)) {}

  /// Nothing when the key is absent.
  [[nodiscard]] std::optional<NSPropertyValue> objectForKey(const std::string& key) const;

 private:
  std::map<std::string, NSPropertyValue> values_;
};

/// An installed application, by its identifier: the desktop file id ("org.example.Notes").
///
/// Ownership: shared, immutable: what the application's `.desktop` file said when it was asked for.
/// Thread-safety: immutable; the class operation may be called on any thread and reads files.
class LSBundleProxy {
 public:
  LSBundleProxy(std::string identifier, const DesktopEntry& entry);

  /// Nil for an application that is not installed, or hidden.
  static LSBundleProxyRef bundleProxyForIdentifier(const std::string& identifier);

  [[nodiscard]] const std::string& bundleIdentifier() const { return identifier_; }
  /// The values of those keys that the application declares: "application-identifier" (a string),
  /// and the lists that its file has under "X-Yomber-Services", "X-Yomber-Containers" and
  /// "X-Yomber-Shared-Containers".
  [[nodiscard]] LSPropertyValues entitlementValuesForKeys(const std::set<std::string>& keys) const;
  /// All of them.
  [[nodiscard]] const std::map<std::string, NSPropertyValue>& entitlements() const {
    return entitlements_;
  }

 private:
  const std::string identifier_;
  std::map<std::string, NSPropertyValue> entitlements_;
};

}  // namespace yomber
