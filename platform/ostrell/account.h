#pragma once

#include <memory>
#include <optional>
#include <string>

#include "platform/foundation/error.h"

namespace yomber {

class QSAccount;
using QSAccountRef = std::shared_ptr<const QSAccount>;

/// The account that is signed in to the drive.
///
/// Ownership: shared, immutable. Thread-safety: the class operations may be called on any thread.
class QSAccount {
 public:
  QSAccount(std::string name, std::optional<std::string> perAppAccountIdentifier)
      : name_(std::move(name)), perAppAccountIdentifier_(std::move(perAppAccountIdentifier)) {}

  [[nodiscard]] const std::string& name() const { return name_; }
  [[nodiscard]] const std::optional<std::string>& perAppAccountIdentifier() const {
    return perAppAccountIdentifier_;
  }

  /// Makes the library post QSAccountTokenDidChangeNotification whenever the account changes, and
  /// after the daemon was lost and is back. Idempotent; never blocks.
  static void startAccountTokenChangeObserverIfNeeded();

  /// The account, from the library's cache; nil with no error when nobody is signed in. The cache
  /// is filled by one synchronous daemon call, and emptied by an account change and by the loss of
  /// the connection.
  static QSAccountRef currentCachedLoggedInAccountWithError(NSErrorRef* error);

 private:
  const std::string name_;
  const std::optional<std::string> perAppAccountIdentifier_;
};

}  // namespace yomber
