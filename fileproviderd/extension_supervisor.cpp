#include "fileproviderd/extension_supervisor.h"

#include <utility>

#include "fileproviderd/host_errors.h"
#include "platform/fileprovider/constants.h"
#include "platform/foundation/log.h"

namespace yomber {

ExtensionSupervisor::ExtensionSupervisor(ExtensionLauncher& launcher, DaemonProbe& daemon,
                                         HostClock& clock, Events events, Backoff::Random random,
                                         Limits limits)
    : launcher_(launcher),
      daemon_(daemon),
      clock_(clock),
      events_(std::move(events)),
      limits_(limits),
      backoff_(std::move(random)) {}

ExtensionSupervisor::~ExtensionSupervisor() {
  if (starting_ != nullptr) starting_->end();
  if (running_ != nullptr) running_->end();
}

void ExtensionSupervisor::acquire(SessionHandler handler) {
  if (state_ == State::Running) return handler(running_, nullptr);
  waiters_.push_back({std::move(handler), nullptr});
  const auto place = std::prev(waiters_.end());
  place->deadline = clock_.after(limits_.acquire, [this, place] {
    const Waiter waiter = std::move(*place);
    waiters_.erase(place);
    waiter.handler(nullptr, lastFailure_ != nullptr
                                ? lastFailure_
                                : extensionUnavailableError("has not started yet"));
  });
  if (state_ == State::Idle) begin();
}

void ExtensionSupervisor::sessionWasLost(const ExtensionSessionRef& session,
                                         const NSErrorRef& reason) {
  if (state_ == State::Running && running_ == session) {
    giveUpOn(extensionUnavailableError("closed its connection", reason));
  }
}

void ExtensionSupervisor::begin() {
  state_ = State::Probing;
  daemon_.probe([weak = weak_from_this()](const NSErrorRef& error) {
    if (const auto self = weak.lock()) self->didProbe(error);
  });
}

void ExtensionSupervisor::didProbe(const NSErrorRef& error) {
  if (error == nullptr) return launch();
  state_ = State::Idle;
  lastFailure_ = error;
  answerWaiters(nullptr, error);
}

void ExtensionSupervisor::launch() {
  const std::weak_ptr<ExtensionSupervisor> weak = weak_from_this();
  const auto life = ++life_;
  ExtensionEvents events;
  events.didEnd = [weak, life](const NSErrorRef& reason) {
    const auto self = weak.lock();
    if (self != nullptr && self->life_ == life) self->didEnd(reason);
  };
  events.didSignal = [weak, life](const std::string& container) {
    const auto self = weak.lock();
    if (self != nullptr && self->life_ == life) self->events_.didSignal(container);
  };
  events.didTimeOut = [weak, life] {
    const auto self = weak.lock();
    if (self != nullptr && self->life_ == life) self->ping();
  };
  NSErrorRef error;
  starting_ = launcher_.launch(std::move(events), &error);
  if (starting_ == nullptr) {
    log_error(defaultLog(), "[ERROR] %@", error);
    return rest(error);
  }
  ++startCount_;
  state_ = State::Starting;
  starting_->locate(NSFileProviderRootContainerItemIdentifier, limits_.answer,
                    [weak, life](const std::optional<std::string>& root, const NSErrorRef& failure,
                                 bool /*isUnanswered*/) {
                      const auto self = weak.lock();
                      if (self == nullptr || self->life_ != life) return;
                      self->didLocateRoot(root.has_value(), failure);
                    });
}

void ExtensionSupervisor::didLocateRoot(bool isKnown, const NSErrorRef& error) {
  if (state_ != State::Starting) return;
  if (!isKnown) {
    return giveUpOn(extensionUnavailableError(
        error != nullptr ? "does not answer" : "does not know the drive's root yet", error));
  }
  running_ = std::exchange(starting_, nullptr);
  runningSince_ = clock_.now();
  state_ = State::Running;
  lastFailure_ = nullptr;
  schedulePing();
  answerWaiters(running_, nullptr);
}

void ExtensionSupervisor::giveUpOn(const NSErrorRef& reason) {
  const auto session = starting_ != nullptr ? starting_ : running_;
  didEnd(reason);
  session->end();
}

void ExtensionSupervisor::didEnd(const NSErrorRef& reason) {
  ++life_;
  log_error(defaultLog(), "[ERROR] %@", reason);
  const bool wasRunning = state_ == State::Running;
  // Dropped last: whatever its destruction sets off finds the new state.
  const auto session =
      wasRunning ? std::exchange(running_, nullptr) : std::exchange(starting_, nullptr);
  pingTimer_.reset();
  isPinging_ = false;
  if (wasRunning && clock_.now() - runningSince_ >= limits_.stable) backoff_.reset();
  rest(reason);
  if (wasRunning) events_.didEnd(reason);
}

void ExtensionSupervisor::rest(const NSErrorRef& failure) {
  lastFailure_ = failure;
  state_ = State::Resting;
  restTimer_ = clock_.after(backoff_.next(), [weak = weak_from_this()] {
    if (const auto self = weak.lock()) self->didRest();
  });
}

void ExtensionSupervisor::didRest() {
  state_ = State::Idle;
  if (!waiters_.empty()) begin();
}

void ExtensionSupervisor::schedulePing() {
  pingTimer_ = clock_.after(limits_.pingEvery, [weak = weak_from_this()] {
    if (const auto self = weak.lock()) self->ping();
  });
}

void ExtensionSupervisor::ping() {
  if (state_ != State::Running || std::exchange(isPinging_, true)) return;
  running_->locate(
      NSFileProviderRootContainerItemIdentifier, limits_.answer,
      [weak = weak_from_this(), life = life_](const std::optional<std::string>& root,
                                              const NSErrorRef& error, bool /*isUnanswered*/) {
        const auto self = weak.lock();
        if (self == nullptr || self->life_ != life) return;
        if (error == nullptr && root.has_value()) {
          self->isPinging_ = false;
          return self->schedulePing();
        }
        self->giveUpOn(extensionUnavailableError("does not answer", error));
      });
}

void ExtensionSupervisor::answerWaiters(const ExtensionSessionRef& session,
                                        const NSErrorRef& error) {
  for (const auto& waiter : std::exchange(waiters_, {})) waiter.handler(session, error);
}

}  // namespace yomber
