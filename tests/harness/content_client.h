#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "platform/foundation/error.h"
#include "platform/ipc/connection.h"
#include "platform/ipc/remote.h"
#include "protocols/content.capnp.h"
#include "protocols/daemon.capnp.h"

namespace yomber::testing {

/// A client of zarn that asks about content, as the client library does. Each operation answers
/// what zarn said, or why it could not be asked.
///
/// Thread-safety: every operation may be called on any thread.
class ContentClient {
 public:
  /// Of the drive at `home`, whose sockets are in the home. Ends the test where zarn is not there.
  explicit ContentClient(const std::string& home);

  using Local = protocol::Content::State::Local;
  using Upload = protocol::Content::State::Upload;
  struct State {
    Local local = Local::HERE;
    Upload upload = Upload::NONE;
    bool isPinned = false;
    std::uint64_t size = 0;
    std::uint64_t localBytes = 0;
    NSErrorRef lastFailure;
    NSErrorRef error;  ///< why there is no state
  };
  struct Location {
    std::string path;
    NSErrorRef error;
  };
  struct Emptied {
    std::uint64_t count = 0;
    NSErrorRef error;
  };

  [[nodiscard]] State state(const std::string& path) const;
  [[nodiscard]] NSErrorRef provide(const std::string& path, std::uint64_t options = 0) const;
  /// Asks and takes the wish back at once.
  void provideAndForget(const std::string& path) const;
  [[nodiscard]] NSErrorRef evict(const std::string& path) const;
  [[nodiscard]] NSErrorRef setPinned(const std::string& path, bool isPinned) const;
  [[nodiscard]] Location trash(const std::string& path) const;
  [[nodiscard]] Location putBackLocation(const std::string& path) const;
  [[nodiscard]] Emptied emptyTrash() const;
  [[nodiscard]] NSErrorRef setTagNames(const std::string& path,
                                       const std::vector<std::string>& names) const;
  /// The identifier of the item at a location, after a scan of it; empty when there is none.
  [[nodiscard]] std::string identifierAt(const std::string& path) const;
  /// Where the item of that identifier is now; empty when there is none.
  [[nodiscard]] std::string locationOf(const std::string& identifier) const;

 private:
  ipc::Connection::Ref connection_;
  ipc::Remote<protocol::Daemon> daemon_;
  ipc::Remote<protocol::Content> content_;
};

}  // namespace yomber::testing
