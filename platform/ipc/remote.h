#pragma once

#include <capnp/capability.h>

#include <cstddef>
#include <functional>
#include <memory>
#include <utility>

#include "platform/ipc/event_loop.h"

namespace yomber::ipc {

namespace detail {

/// Destroys what only the loop thread may destroy, from any thread.
struct DeleteOnLoop {
  template <typename T>
  void operator()(T* object) const {
    EventLoop& loop = EventLoop::shared();
    if (loop.isCurrent()) {
      delete object;
    } else {
      loop.post([object] { delete object; });
    }
  }
};

}  // namespace detail

/// A capability that any thread may hold, copy, compare and drop.
///
/// Ownership: shared; the capability is released, on the loop thread, when the last copy goes.
/// Thread-safety: that of `std::shared_ptr`: distinct copies on any threads; `client` and the
/// constructors from capabilities on the loop thread only.
template <typename Interface>
class Remote {
 public:
  using Client = typename Interface::Client;
  /// Makes the capability when it is first needed. Called once, on the loop thread.
  using Resolver = std::function<Client()>;

  Remote() = default;
  Remote(std::nullptr_t) {}  // NOLINT: nil is written as nullptr
  explicit Remote(Client client) : state_(new State(std::move(client)), detail::DeleteOnLoop()) {}
  /// The one constructor for any thread.
  explicit Remote(Resolver resolver)
      : state_(new State(std::move(resolver)), detail::DeleteOnLoop()) {}

  /// REQUIRES: not nil, on the loop thread. Valid while a copy of this Remote is held.
  [[nodiscard]] Client& client() const {
    KJ_IF_MAYBE (made, state_->client) return *made;
    Resolver resolver = std::move(state_->resolver);
    return state_->client.emplace(resolver());
  }

  explicit operator bool() const { return state_ != nullptr; }
  /// Whether both are the very same handle (or both nil).
  friend bool operator==(const Remote& a, const Remote& b) { return a.state_ == b.state_; }

 private:
  struct State {
    explicit State(Client made) : client(std::move(made)) {}
    explicit State(Resolver later) : resolver(std::move(later)) {}
    kj::Maybe<Client> client;
    Resolver resolver;
  };
  std::shared_ptr<State> state_;
};

}  // namespace yomber::ipc
