#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "platform/foundation/error.h"
#include "platform/ipc/connection.h"
#include "platform/ipc/remote.h"
#include "protocols/control.capnp.h"

namespace yomber::testing {

/// A client of fileproviderd, as the command line is. Every operation answers what was said, or why
/// nobody could be asked.
///
/// Thread-safety: every operation may be called on any thread.
class HostClient {
 public:
  /// Of the drive at `home`, whose sockets are in the home. Throws where the host is not there.
  explicit HostClient(const std::string& home);

  struct Changed {
    std::string identifier;  ///< of the item as it is afterwards; may be empty
    NSErrorRef error;
  };
  [[nodiscard]] Changed importDocument(const std::string& path, const std::string& parent) const;
  [[nodiscard]] Changed createDirectory(const std::string& name, const std::string& parent) const;
  [[nodiscard]] Changed rename(const std::string& identifier, const std::string& name) const;
  [[nodiscard]] Changed reparent(const std::string& identifier, const std::string& parent) const;
  [[nodiscard]] Changed trash(const std::string& identifier) const;
  [[nodiscard]] Changed untrash(const std::string& identifier) const;
  [[nodiscard]] Changed remove(const std::string& identifier) const;

  /// While it lives, the host asks nobody to give the content up.
  using Need = ipc::Remote<protocol::Need>;
  [[nodiscard]] NSErrorRef provide(const std::string& path, Need& need) const;
  /// Asks and takes the wish back at once.
  void provideAndForget(const std::string& path) const;
  [[nodiscard]] NSErrorRef stopProviding(const std::string& path) const;

  /// The identifiers of what a folder holds, as it is listed; nothing when it cannot be.
  [[nodiscard]] std::optional<std::vector<std::string>> list(const std::string& folder) const;

 private:
  ipc::Connection::Ref connection_;
  ipc::Remote<protocol::Control> control_;
  ipc::Remote<protocol::Changes> changes_;
};

}  // namespace yomber::testing
