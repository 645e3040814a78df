#pragma once

#include <sys/types.h>

#include <chrono>
#include <cstddef>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "fileproviderd/hosted_enumerator.h"
#include "platform/foundation/error.h"
#include "platform/ipc/remote.h"
#include "protocols/extension.capnp.h"

namespace yomber {

/// Takes what came of a request. `isUnanswered`: the error, a connection error, says why the
/// extension gave no answer; else the error is what it answered, which may look the same.
template <typename Answer>
using AnswerHandler =
    std::function<void(std::optional<Answer>, NSErrorRef error, bool isUnanswered)>;

/// One life of the extension: its process and everything that was got from it. When it ends, all
/// its enumerators end with it.
///
/// Handlers are called once each.
/// Thread-safety: loop thread only.
/// Ownership: shared; whoever drops the last reference ends the process.
class ExtensionSession {
 public:
  virtual ~ExtensionSession() = default;
  /// Ends the process now; calls under way fail.
  virtual void end() = 0;
  [[nodiscard]] virtual pid_t pid() const = 0;
  [[nodiscard]] virtual std::size_t enumeratorCount() const = 0;

  /// The location of an item; nothing without an error when the extension knows none.
  virtual void locate(const std::string& identifier, std::chrono::milliseconds limit,
                      AnswerHandler<std::string> handler) = 0;
  virtual void identify(const std::string& path, AnswerHandler<std::string> handler) = 0;
  virtual void item(const std::string& identifier, AnswerHandler<ItemFields> handler) = 0;
  virtual void enumerator(const std::string& container, EnumeratorHandler handler) = 0;
  /// The enumerator itself, for listings that pass pages on unread.
  virtual void openEnumerator(
      const std::string& container,
      std::function<void(ipc::Remote<protocol::Enumerator>, NSErrorRef)> handler) = 0;
  /// The extension itself, for what is passed on and for what has no time limit.
  [[nodiscard]] virtual ipc::Remote<protocol::Extension> remote() const = 0;
};

using ExtensionSessionRef = std::shared_ptr<ExtensionSession>;

/// What a session tells whoever started it. Called on the loop thread.
struct ExtensionEvents {
  /// It has ended, for this reason; once.
  std::function<void(const NSErrorRef& reason)> didEnd;
  std::function<void(const std::string& container)> didSignal;
  /// A call ran out of time: the extension may be stuck.
  std::function<void()> didTimeOut;
};

/// Starts extensions. Thread-safety: loop thread only.
class ExtensionLauncher {
 public:
  virtual ~ExtensionLauncher() = default;
  /// Nil with an error that says what to do when the program cannot be started.
  virtual ExtensionSessionRef launch(ExtensionEvents events, NSErrorRef* error) = 0;
};

}  // namespace yomber
