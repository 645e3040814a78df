#pragma once

#include <atomic>
#include <exception>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <utility>

#include "platform/foundation/lock.h"
#include "platform/foundation/progress.h"
#include "platform/ipc/event_loop.h"
#include "platform/xpc/connection_link.h"
#include "platform/xpc/left_out_method.h"
#include "platform/xpc/served_progress.h"

namespace yomber {

/// What became of a message: its answer, or why there is none.
template <typename Answer>
struct DeliveryOutcome {
  std::optional<Answer> answer;
  bool isLeftOut = false;
  std::string failure;
};

/// One message on its way to the object and back. The first answer counts; a message that the
/// object lets go of without answering fails.
template <typename Answer>
class Delivery final : public DeliveredMessage {
 public:
  using Outcome = DeliveryOutcome<Answer>;
  /// Lives and dies on the loop thread: whoever fulfills last takes it there along.
  struct Fulfillers {
    kj::Own<kj::PromiseFulfiller<Outcome>> answer;
    kj::Own<kj::PromiseFulfiller<void>> delivered;
  };

  Delivery(std::shared_ptr<Fulfillers> fulfillers, std::shared_ptr<ServedProgress> progress)
      : progress_(std::move(progress)), fulfillers_(std::move(fulfillers)) {}
  ~Delivery() override { fail("The object dropped the message without answering it."); }

  void answer(Answer answer) { settle({.answer = std::move(answer), .failure = {}}); }
  void leaveOut(const std::string& text) override {
    settle({.answer = std::nullopt, .isLeftOut = true, .failure = text});
  }
  void fail(std::string why) {
    settle({.answer = std::nullopt, .isLeftOut = false, .failure = std::move(why)});
  }
  /// The method has returned with this progress, or nil. An answer that came before waited for it,
  /// so that the last counts come first.
  void didReturn(const NSProgressRef& progress) {
    progress_->attach(progress);
    std::optional<Outcome> due;
    {
      LockGuard guard(mutex_);
      hasReturned_ = true;
      due.swap(early_);
    }
    if (due) send(std::move(*due));
  }
  /// The object is done with the message. What was answered by then says so itself.
  void didDeliver() {
    LockGuard guard(mutex_);
    if (fulfillers_ == nullptr) return;
    ipc::EventLoop::shared().post([held = fulfillers_] { held->delivered->fulfill(); });
  }
  /// The method was left by an exception, as if it had returned nil. An answer that came before
  /// counts.
  void didThrow(const std::string& what) {
    fail("The object threw: " + what);
    if (progress_ != nullptr) didReturn(nullptr);
  }

 private:
  void settle(Outcome outcome) {
    if (answered_.exchange(true)) return;
    if (progress_ != nullptr) {
      LockGuard guard(mutex_);
      if (!hasReturned_) {
        early_ = std::move(outcome);
        return;
      }
    }
    send(std::move(outcome));
  }

  void send(Outcome outcome) {
    if (progress_ != nullptr) progress_->willReply();
    LockGuard guard(mutex_);
    ipc::EventLoop::shared().post(
        [held = std::move(fulfillers_), outcome = std::move(outcome)]() mutable {
          held->answer->fulfill(std::move(outcome));
          held->delivered->fulfill();  // else its end would be an exception, made for nobody
        });
  }

  const std::shared_ptr<ServedProgress> progress_;
  std::atomic<bool> answered_{false};

  Mutex mutex_;
  std::shared_ptr<Fulfillers> fulfillers_ GUARDED_BY(mutex_);  ///< until it is answered
  // Of a message whose method answers a progress.
  bool hasReturned_ GUARDED_BY(mutex_) = false;
  std::optional<Outcome> early_ GUARDED_BY(mutex_);
};

/// An exported object as the servers of its protocol use it. Not for extensions: this header shows
/// Cap'n Proto types.
///
/// Messages are delivered on the connection's queue, in the order of the calls of `deliver`. What
/// the object throws fails the message alone. A caller who gives a call up lets go of it only once
/// it was delivered, so that what waits for the queue counts as unanswered; and beyond
/// kMaximumWaitingMessages, messages are refused.
/// Thread-safety: loop thread only. Copies are the same object.
template <typename Protocol>
class ServedObject {
 public:
  ServedObject(std::shared_ptr<Protocol> object, std::shared_ptr<ConnectionLink> link)
      : object_(std::move(object)), link_(std::move(link)) {}

  /// Runs `invoke(object, reply)`, where `reply` is a std::function<void(Answer)>; the promise of
  /// what that is given. `context` is the call's, and allows no cancellation of its own accord.
  template <typename Answer, typename Context, typename Invoke>
  kj::Promise<Answer> deliver(Context context, Invoke invoke) const {
    return answerOf<Answer>(
        context,
        [invoke = std::move(invoke)](Protocol& object, const DeliveryRef<Answer>& delivery) {
          invoke(object, replyOf(delivery));
        },
        nullptr);
  }

  /// The same for a method that answers a progress, under the number that the caller gave the call.
  template <typename Answer, typename Context, typename Invoke>
  kj::Promise<Answer> deliver(Context context, std::uint64_t call, Invoke invoke) const {
    return answerOf<Answer>(
        context,
        [invoke = std::move(invoke)](Protocol& object, const DeliveryRef<Answer>& delivery) {
          delivery->didReturn(invoke(object, replyOf(delivery)));
        },
        link_->serveProgress(call));
  }

  /// The same for a method without reply; the promise is done when the method has returned.
  template <typename Invoke>
  kj::Promise<void> deliverOneWay(Invoke invoke) const {
    return start<Nothing>(
               [invoke = std::move(invoke)](Protocol& object,
                                            const DeliveryRef<Nothing>& delivery) {
                 invoke(object);
                 delivery->answer({});
               },
               nullptr)
        .answer.then([](Nothing) {});
  }

 private:
  struct Nothing {};
  template <typename Answer>
  using DeliveryRef = std::shared_ptr<Delivery<Answer>>;

  template <typename Answer>
  static std::function<void(Answer)> replyOf(const DeliveryRef<Answer>& delivery) {
    return [delivery](Answer answer) { delivery->answer(std::move(answer)); };
  }

  template <typename Answer>
  struct Started {
    kj::Promise<Answer> answer;
    kj::Promise<void> delivered;
  };

  template <typename Answer, typename Context, typename Body>
  kj::Promise<Answer> answerOf(Context context, Body body,
                               std::shared_ptr<ServedProgress> progress) const {
    auto started = start<Answer>(std::move(body), std::move(progress));
    return started.answer.exclusiveJoin(
        started.delivered.then([context]() mutable -> kj::Promise<Answer> {
          context.allowCancellation();
          return kj::NEVER_DONE;
        }));
  }

  template <typename Answer, typename Body>
  Started<Answer> start(Body body, std::shared_ptr<ServedProgress> progress) const {
    if (!link_->admitMessage()) {
      return {kj::Exception(kj::Exception::Type::OVERLOADED, __FILE__, __LINE__,
                            kj::heapString("Too many messages wait for the object; wait for "
                                           "replies before sending more.")),
              kj::NEVER_DONE};
    }
    auto answer = kj::newPromiseAndFulfiller<DeliveryOutcome<Answer>>();
    auto delivered = kj::newPromiseAndFulfiller<void>();
    using Fulfillers = typename Delivery<Answer>::Fulfillers;
    auto delivery = std::make_shared<Delivery<Answer>>(
        std::make_shared<Fulfillers>(
            Fulfillers{kj::mv(answer.fulfiller), kj::mv(delivered.fulfiller)}),
        std::move(progress));
    link_->queue()->async(
        [object = object_, link = link_, body = std::move(body), delivery = std::move(delivery)] {
          link->messageLeftQueue();
          run(body, *object, delivery);
          delivery->didDeliver();
        });
    return {answer.promise.then(
                [](DeliveryOutcome<Answer> outcome) { return answerIn(std::move(outcome)); }),
            kj::mv(delivered.promise)};
  }

  template <typename Answer, typename Body>
  static void run(const Body& body, Protocol& object, const DeliveryRef<Answer>& delivery) {
    const DeliveredMessage::Frame frame(*delivery);
    try {
      body(object, delivery);
    } catch (const std::exception& exception) {
      delivery->didThrow(exception.what());
    } catch (...) {
      delivery->didThrow("something that is no std::exception");
    }
  }

  /// Throws when there is none.
  template <typename Answer>
  static Answer answerIn(DeliveryOutcome<Answer> outcome) {
    if (outcome.answer) return std::move(*outcome.answer);
    kj::throwFatalException(kj::Exception(
        outcome.isLeftOut ? kj::Exception::Type::UNIMPLEMENTED : kj::Exception::Type::FAILED,
        __FILE__, __LINE__, kj::heapString(outcome.failure.c_str())));
  }

  std::shared_ptr<Protocol> object_;
  std::shared_ptr<ConnectionLink> link_;
};

}  // namespace yomber
