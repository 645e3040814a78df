#pragma once

#include <functional>
#include <string>
#include <vector>

#include "platform/foundation/data.h"
#include "platform/foundation/error.h"
#include "platform/ipc/connection.h"
#include "platform/ipc/remote.h"
#include "protocols/control.capnp.h"

namespace yomber {

/// What the mount asks about thumbnails: the host mostly. Nobody waits for these: what fails is not
/// tried again. Thread-safety: one thread at a time; every operation blocks until it is answered.
class ThumbnailRequests {
 public:
  explicit ThumbnailRequests(std::string controlSocket)
      : controlSocket_(std::move(controlSocket)) {}

  /// Of the item at a location as the drive has it.
  [[nodiscard]] NSErrorRef identify(const std::string& location, std::string& identifier);
  /// Calls `take` for each of the items, on another thread, never for two at a time and never after
  /// this has returned; the image is nil where there is none.
  using Take = std::function<void(const std::string& identifier, const NSDataRef& image)>;
  [[nodiscard]] NSErrorRef fetch(const std::vector<std::string>& identifiers, const Take& take);
  /// Calls `take` on this thread for those of the items that have a thumbnail, which is read from
  /// the record store itself: however large an item is, its content is not brought here to be
  /// drawn.
  [[nodiscard]] static NSErrorRef readStored(const std::vector<std::string>& identifiers,
                                             const Take& take);

 private:
  ipc::Remote<protocol::Control> control(NSErrorRef* error);

  const std::string controlSocket_;
  ipc::Connection::Ref connection_;
};

}  // namespace yomber
