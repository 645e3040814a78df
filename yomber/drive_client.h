#pragma once

#include <functional>
#include <string>
#include <vector>

#include "platform/fileprovider/item.h"
#include "platform/foundation/drive_paths.h"
#include "platform/foundation/error.h"
#include "platform/ipc/connection.h"
#include "platform/ipc/remote.h"
#include "protocols/control.capnp.h"
#include "protocols/daemon.capnp.h"

namespace yomber {

/// The command line's connections: to the host, for everything by item, and to the daemon, for what
/// is about the drive as a whole. Each is made on first use.
///
/// Used on the main thread only; every call blocks until its answer, its failure or its time limit.
class DriveClient {
 public:
  explicit DriveClient(DrivePaths paths) : paths_(std::move(paths)) {}

  [[nodiscard]] const DrivePaths& paths() const { return paths_; }

  /// Nil and an error that says what to do when nobody answers there.
  ipc::Remote<protocol::Control> control(NSErrorRef* error);
  ipc::Remote<protocol::Daemon> daemon(NSErrorRef* error);

  /// The connection under `control`; nil before its first use.
  [[nodiscard]] const std::shared_ptr<ipc::Connection>& controlConnection() const {
    return controlConnection_;
  }

  /// What a command was given for an item: nothing or "/" (the root), an identifier ("i:42"), a
  /// location inside the drive's tree, or a path from the drive's root ("Documents/Plans").
  NSErrorRef identifierFor(const std::string& argument, NSFileProviderItemIdentifier& identifier);
  NSErrorRef item(const NSFileProviderItemIdentifier& identifier, ItemFields& item);
  NSErrorRef location(const NSFileProviderItemIdentifier& identifier, std::string& path);
  NSErrorRef identifierAt(const std::string& path, NSFileProviderItemIdentifier& identifier);

  /// Pages of a listing, in order, until `onPage` answers false.
  NSErrorRef list(const NSFileProviderItemIdentifier& container, protocol::SortOrder order,
                  const std::function<bool(const std::vector<ItemFields>& page)>& onPage);

 private:
  /// One call on the host whose `result` is a value or an error.
  template <typename Method, typename Fill, typename Take>
  NSErrorRef ask(Method method, const Fill& fill, const Take& take);

  const DrivePaths paths_;
  std::shared_ptr<ipc::Connection> controlConnection_;
  std::shared_ptr<ipc::Connection> daemonConnection_;
};

}  // namespace yomber
