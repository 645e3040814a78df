#pragma once

#include <cstddef>
#include <cstdint>
#include <map>
#include <memory>

#include "platform/foundation/lock.h"
#include "platform/ipc/remote.h"
#include "protocols/daemon.capnp.h"
#include "zarn/coalesced_call.h"

namespace yomber {

/// Whoever asked to be told of changes of the account, the container list and the working set.
///
/// Each of them has one call of a kind on its way at a time.
/// Ownership: shared. Thread-safety: every operation may be called on any thread.
class Registrations : public std::enable_shared_from_this<Registrations> {
 public:
  /// Ends the registration when it is dropped.
  class Token {
   public:
    Token(std::weak_ptr<Registrations> owner, std::uint64_t number)
        : owner_(std::move(owner)), number_(number) {}
    ~Token();
    Token(const Token&) = delete;
    Token& operator=(const Token&) = delete;

   private:
    const std::weak_ptr<Registrations> owner_;
    const std::uint64_t number_;
  };

  [[nodiscard]] std::unique_ptr<Token> addObserver(ipc::Remote<protocol::LibraryObserver> observer);
  [[nodiscard]] std::unique_ptr<Token> addHost(ipc::Remote<protocol::HostReceiver> host);

  void accountTokenDidChange();
  void containerListDidChange();
  void workingSetDidChange();

 private:
  struct Calls {
    std::shared_ptr<CoalescedCall> account;
    std::shared_ptr<CoalescedCall> containers;
    std::shared_ptr<CoalescedCall> workingSet;
  };
  using Kind = std::shared_ptr<CoalescedCall> Calls::*;

  std::unique_ptr<Token> add(Calls calls);
  void request(Kind kind);

  Mutex mutex_;
  std::uint64_t lastNumber_ GUARDED_BY(mutex_) = 0;
  std::map<std::uint64_t, Calls> calls_ GUARDED_BY(mutex_);
};

}  // namespace yomber
