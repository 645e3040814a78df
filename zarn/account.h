#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/foundation/error.h"

namespace yomber {

struct AccountRecord {
  std::string name;
  std::string perAppAccountIdentifier;
  friend bool operator==(const AccountRecord&, const AccountRecord&) = default;
};

/// Who is signed in to the drive; kept in a file of its own, so that a database that has to be
/// built anew signs nobody out.
///
/// Accounts that were signed in once are remembered by name and keep their identifier.
/// Thread-safety: every operation may be called on any thread; those that change something block
/// for the disk.
class Account {
 public:
  /// Reads the file; a missing one means that nobody is signed in. One that cannot be read is an
  /// error: it is left as it is.
  static std::unique_ptr<Account> open(const std::string& path, NSErrorRef* error = nullptr);
  ~Account();
  Account(const Account&) = delete;
  Account& operator=(const Account&) = delete;

  /// Nothing when nobody is signed in. Never blocks for the disk.
  [[nodiscard]] std::optional<AccountRecord> current() const;

  /// Fails when the name is not valid, or when somebody else is signed in. Nil, with nothing
  /// changed, when that account is signed in already.
  [[nodiscard]] NSErrorRef signIn(const std::string& name);
  /// Nil, with nothing changed, when nobody is signed in.
  [[nodiscard]] NSErrorRef signOut();

  /// Called after each change, on the thread that made it. To be set before the first of them.
  void onChange(std::function<void()> handler);

 private:
  class State;
  explicit Account(std::unique_ptr<State> state);
  std::unique_ptr<State> state_;
};

/// 1 to 255 bytes of UTF-8 without control characters, and no space at either end.
[[nodiscard]] bool isValidAccountName(std::string_view name);

}  // namespace yomber
