#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "platform/foundation/error.h"
#include "platform/ipc/remote.h"
#include "protocols/content.capnp.h"
#include "protocols/control.capnp.h"
#include "protocols/daemon.capnp.h"
#include "yomber/drive_client.h"

namespace yomber {

/// How the daemon sees the content of an item.
struct ContentState {
  using Local = protocol::Content::State::Local;
  using Upload = protocol::Content::State::Upload;
  Local local = Local::HERE;
  Upload upload = Upload::NONE;
  bool isPinned = false;
  std::uint64_t size = 0;        ///< bytes
  std::uint64_t localBytes = 0;  ///< of blocks on this disk
  NSErrorRef lastFailure;        ///< of what waits to be tried again
};

/// Something that the daemon has under way.
struct Transfer {
  using Kind = protocol::Content::Transfer::Kind;
  std::string path;
  Kind kind = Kind::UPLOAD;
  std::uint64_t total = 0;  ///< bytes
  std::uint64_t done = 0;
  std::uint32_t attempts = 0;
  NSErrorRef failure;
  std::optional<NSDate> nextAttempt;
};
struct Transfers {
  std::vector<Transfer> underWay;
  std::uint64_t waiting = 0;
  std::uint64_t finished = 0;
};

/// The content of items: asked for through the host, looked at in the daemon. What is asked for
/// takes as long as it takes, but ends when host or daemon answer nothing at all.
///
/// Thread-safety: any number of threads at a time.
class DriveContent {
 public:
  /// None and an error when the drive is not up.
  static std::optional<DriveContent> open(DriveClient& client, NSErrorRef* error);
  /// Just what the daemon says of itself; null and an error when it does not answer.
  static NSErrorRef transfers(const ipc::Remote<protocol::Daemon>& daemon, Transfers& transfers);

  /// Waits until the content can be read. While `need` is held, nobody is asked to give it up.
  NSErrorRef provide(const std::string& path, ipc::Remote<protocol::Need>* need = nullptr) const;
  /// Asks for the content to be given up.
  NSErrorRef stopProviding(const std::string& path) const;

  NSErrorRef state(const std::string& path, ContentState& state) const;
  /// Why the daemon does not give the content up; nil when it just has.
  NSErrorRef evict(const std::string& path) const;
  NSErrorRef setPinned(const std::string& path, bool pinned) const;
  NSErrorRef emptyTrash(std::uint64_t& removed) const;
  /// Where the item with that logical location is on this disk.
  NSErrorRef physicalLocation(const std::string& path, std::string& physical) const;

 private:
  DriveContent(ipc::Remote<protocol::Control> control, ipc::Remote<protocol::Daemon> daemon,
               ipc::Remote<protocol::Content> content)
      : control_(std::move(control)), daemon_(std::move(daemon)), content_(std::move(content)) {}

  ipc::Remote<protocol::Control> control_;
  ipc::Remote<protocol::Daemon> daemon_;
  ipc::Remote<protocol::Content> content_;
};

}  // namespace yomber
