#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "platform/fileprovider/item.h"
#include "platform/foundation/error.h"
#include "platform/ipc/remote.h"
#include "protocols/changes.capnp.h"
#include "yomber/drive_client.h"

namespace yomber {

/// What a change came to.
struct ChangeResult {
  std::optional<ItemFields> item;  ///< after the change; not every change answers one
  NSErrorRef error;
};

/// Changes of items, through the host. Each waits for as long as the change takes, unless the host
/// answers nothing at all.
///
/// Thread-safety: any number of threads at a time.
class DriveChanges {
 public:
  /// Nil changes and an error when the drive is not up.
  static std::optional<DriveChanges> open(DriveClient& client, NSErrorRef* error);

  [[nodiscard]] ChangeResult importDocument(const std::string& path,
                                            const std::string& parent) const;
  [[nodiscard]] ChangeResult createDirectory(const std::string& name,
                                             const std::string& parent) const;
  [[nodiscard]] ChangeResult rename(const std::string& identifier, const std::string& name) const;
  /// Keeps the name without a new one.
  [[nodiscard]] ChangeResult reparent(const std::string& identifier, const std::string& parent,
                                      const std::optional<std::string>& newName) const;
  [[nodiscard]] ChangeResult trash(const std::string& identifier) const;
  /// Back to where it came from without a parent.
  [[nodiscard]] ChangeResult untrash(const std::string& identifier,
                                     const std::string& parent) const;
  [[nodiscard]] ChangeResult remove(const std::string& identifier) const;
  [[nodiscard]] ChangeResult setLastUsedDate(const std::string& identifier,
                                             std::optional<NSDate> date) const;
  [[nodiscard]] ChangeResult setTags(const std::string& identifier,
                                     const std::vector<std::string>& labels) const;
  [[nodiscard]] ChangeResult setFavoriteRank(const std::string& identifier,
                                             std::optional<std::int64_t> rank) const;
  /// An empty bundle is the drive itself.
  [[nodiscard]] ChangeResult defaultApplicationContainer(const std::string& bundle) const;

 private:
  DriveChanges(ipc::Remote<protocol::Control> control, ipc::Remote<protocol::Changes> remote)
      : control_(std::move(control)), remote_(std::move(remote)) {}
  template <typename Method, typename Fill>
  ChangeResult change(Method method, const Fill& fill) const;

  ipc::Remote<protocol::Control> control_;
  ipc::Remote<protocol::Changes> remote_;
};

/// The item in the way, where the error is a clash of names; `isClash` says whether it is one.
struct Clash {
  bool isClash = false;
  std::optional<ItemFields> item;
};
[[nodiscard]] Clash clashIn(const NSErrorRef& error);

}  // namespace yomber
