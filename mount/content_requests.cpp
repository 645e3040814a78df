#include "mount/content_requests.h"

#include <cerrno>
#include <optional>
#include <thread>
#include <utility>

#include "platform/fileprovider/constants.h"
#include "platform/fileprovider/file_operations.h"
#include "platform/fileprovider/item_codec.h"
#include "platform/foundation/log.h"
#include "platform/foundation/thread_pool.h"
#include "platform/ipc/call.h"
#include "platform/ipc/error_codec.h"
#include "platform/ipc/event_loop.h"
#include "platform/ipc/patience.h"
#include "platform/ostrell/errors.h"

namespace yomber {
namespace {

using protocol::Control;
using Clock = std::chrono::steady_clock;

constexpr ipc::CallOptions kAsLongAsItTakes{.timeout = std::chrono::milliseconds::zero()};
constexpr ipc::CallOptions kPatienceOptions{.timeout = ContentRequests::kPatience};
constexpr std::chrono::milliseconds kBetweenAttempts{200};
/// What was worked on for so long is waited for anew.
constexpr std::chrono::seconds kWorkedOn{5};
/// Both between two questions whether the host is stuck, and for its answer.
constexpr std::chrono::seconds kStuck{10};

NSErrorRef cancellation() {
  return NSError::errorWithDomain(NSCocoaErrorDomain, NSUserCancelledError);
}

/// One that is no work for the host.
ipc::Patience::Question questionFor(const ipc::Remote<Control>& control) {
  return [control](const ipc::CallOptions& options, const ipc::Patience::Answer& answer) {
    (void)ipc::call(
        control, &Control::Client::statusRequest, [](auto) {},
        [answer](const NSErrorRef& error, const auto*) { answer(error); }, options);
  };
}

/// Whether it is one of the drive's own processes that cannot be reached, which are started again,
/// rather than the store.
bool isForTheMoment(const NSErrorRef& error) {
  if (!error) return false;
  // Of the extension, which has lost zarn or does not find it.
  if (error->is(QSOstrellErrorDomain, QSOstrellErrorConnectionLost)) return true;
  if (error->is(NSPOSIXErrorDomain, ECONNREFUSED)) return true;
  if (!error->is(NSFileProviderErrorDomain, NSFileProviderErrorServerUnreachable)) return false;
  for (NSErrorRef cause = error; cause; cause = cause->underlyingError()) {
    if (cause->is(NSCocoaErrorDomain, NSUbiquitousFileUnavailableError)) return false;
  }
  return true;
}

/// `cause` was tried to be got over for long enough.
NSErrorRef unanswered(const NSErrorRef& cause) {
  NSErrorUserInfo info{{NSLocalizedDescriptionKey, std::string("the content does not come")}};
  if (cause) info.emplace(NSUnderlyingErrorKey, cause);
  return NSError::errorWithDomain(NSPOSIXErrorDomain, EIO, std::move(info));
}

/// A number that is none would be taken for success, or refused by the kernel.
int errnoOfSystem(std::int64_t code) {
  constexpr std::int64_t kLast = 511;  // that the kernel hands on
  return code > 0 && code <= kLast ? static_cast<int>(code) : EIO;
}

int errnoOfProvider(std::int64_t code) {
  switch (code) {
    case NSFileProviderErrorNotAuthenticated:
      return EACCES;
    case NSFileProviderErrorServerUnreachable:
      return ENETUNREACH;
    case NSFileProviderErrorInsufficientQuota:
      return EDQUOT;
    case NSFileProviderErrorNoSuchItem:
      return ENOENT;
    default:
      return EIO;
  }
}

int errnoOfCocoa(std::int64_t code) {
  switch (code) {
    case NSFileNoSuchFileError:
      return ENOENT;
    case NSUserCancelledError:
      return EINTR;
    case NSUbiquitousFileUnavailableError:
      return ENETUNREACH;
    case NSUbiquitousFileNotUploadedDueToQuotaError:
      return EDQUOT;
    case NSFileWriteOutOfSpaceError:
      return ENOSPC;
    default:
      return EIO;
  }
}

}  // namespace

int errnoOf(const NSErrorRef& error) {
  if (!error) return 0;
  if (error->domain() == NSPOSIXErrorDomain) return errnoOfSystem(error->code());
  if (error->domain() == NSFileProviderErrorDomain) return errnoOfProvider(error->code());
  return error->domain() == NSCocoaErrorDomain ? errnoOfCocoa(error->code()) : EIO;
}

/// One wish for content, through as many connections as it takes.
class ContentRequests::Providing final : public std::enable_shared_from_this<Providing> {
 public:
  Providing(std::shared_ptr<ContentRequests> requests, std::string path, Completion completion)
      : requests_(std::move(requests)),
        path_(std::move(path)),
        completion_(std::move(completion)) {}

  void begin() {
    watched_ = requests_->watch_->watch(path_, [weak = weak_from_this()] {
      if (const auto self = weak.lock()) self->giveUp(unanswered(nullptr));
    });
    attempt();
  }

  void cancel() { giveUp(cancellation()); }

  void giveUp(const NSErrorRef& error) {
    ipc::CallHandle call;
    {
      LockGuard guard(mutex_);
      isCancelled_ = true;
      call = call_;
    }
    call.cancel();
    finish(error);
  }

 private:
  void attempt() {
    if (isOver()) return;
    began_ = Clock::now();
    requests_->withControl(
        [self = shared_from_this()](const ipc::Remote<Control>& control, const NSErrorRef& error) {
          if (!control) return self->failed(error);
          self->ask(control);
        });
  }

  void ask(const ipc::Remote<Control>& control) {
    const auto self = shared_from_this();
    const auto patience = std::make_shared<ipc::Patience>(
        kStuck, questionFor(control), [self](const NSErrorRef& stuck) { self->giveUp(stuck); });
    ipc::EventLoop::shared().post([patience] { patience->begin(); });
    auto call = ipc::call(
        control, &Control::Client::startProvidingRequest,
        [path = path_](auto params) { params.setPath(wireData(path)); },
        [self, patience](const NSErrorRef& transport, const auto* results) {
          patience->end();
          NSErrorRef failure = transport;
          if (results != nullptr) failure = ipc::decodeOptional(results->getFailure());
          const bool isToTryAgain = transport || isForTheMoment(failure);
          if (!isToTryAgain) return self->finish(failure);
          self->failed(failure);
        },
        kAsLongAsItTakes);
    LockGuard guard(mutex_);
    call_ = std::move(call);
    if (isCancelled_) call_.cancel();
  }

  [[nodiscard]] bool isOver() {
    LockGuard guard(mutex_);
    return isCancelled_ || !completion_;
  }

  /// Tries again in a moment, and keeps no thread for that: many may be waiting.
  void failed(const NSErrorRef& error) {
    if (isOver()) return;
    const auto now = Clock::now();
    if (now - began_ > kWorkedOn || !giveUpAt_) giveUpAt_ = now + kPatience;
    if (now > *giveUpAt_) return finish(unanswered(error));
    requests_->dropConnection();
    ipc::EventLoop::shared().post([self = shared_from_this()] {
      ipc::EventLoop& loop = ipc::EventLoop::shared();
      loop.detach(loop.timer().afterDelay(kBetweenAttempts.count() * kj::MILLISECONDS).then([self] {
        self->attempt();
      }));
    });
  }

  void finish(const NSErrorRef& error) {
    Completion completion;
    {
      LockGuard guard(mutex_);
      std::swap(completion, completion_);
    }
    if (!completion) return;
    ThreadPool::shared().async([completion = std::move(completion), error] { completion(error); });
  }

  const std::shared_ptr<ContentRequests> requests_;
  const std::string path_;
  std::shared_ptr<DownloadWatch::Watched> watched_;  ///< set once
  Mutex mutex_;
  Completion completion_ GUARDED_BY(mutex_);
  ipc::CallHandle call_ GUARDED_BY(mutex_);
  bool isCancelled_ GUARDED_BY(mutex_) = false;

  // Of the attempt; there is one at a time.
  Clock::time_point began_;
  std::optional<Clock::time_point> giveUpAt_;
};

std::shared_ptr<ContentRequests> ContentRequests::create(std::string controlSocket,
                                                         std::shared_ptr<DownloadWatch> watch) {
  return std::shared_ptr<ContentRequests>(
      new ContentRequests(std::move(controlSocket), std::move(watch)));
}

std::shared_ptr<ContentRequests::Request> ContentRequests::provide(const std::string& path,
                                                                   Completion completion) {
  class Held final : public Request {
   public:
    explicit Held(std::shared_ptr<Providing> providing) : providing_(std::move(providing)) {}
    ~Held() override { providing_->cancel(); }
    Held(const Held&) = delete;
    Held& operator=(const Held&) = delete;

   private:
    const std::shared_ptr<Providing> providing_;
  };
  auto providing = std::make_shared<Providing>(shared_from_this(), path, std::move(completion));
  providing->begin();
  return std::make_shared<Held>(std::move(providing));
}

NSErrorRef ContentRequests::movingItem(const std::string& path, const std::string& destination,
                                       bool& requiresProviding) {
  const auto giveUpAt = Clock::now() + kPatience;
  for (;;) {
    NSErrorRef failure;
    const auto remote = control(&failure);
    NSErrorRef transport = failure;
    if (remote) {
      transport = ipc::callAndWait(
          remote, &Control::Client::movingItemRequest,
          [&](auto params) {
            params.setPath(wireData(path));
            params.setDestination(wireData(destination));
          },
          [&](auto results) {
            failure = ipc::decodeOptional(results.getFailure());
            requiresProviding = results.getRequiresProviding();
          },
          kPatienceOptions);
    }
    const bool isToTryAgain = transport || isForTheMoment(failure);
    if (!isToTryAgain || Clock::now() > giveUpAt) return transport ? transport : failure;
    dropConnection();
    std::this_thread::sleep_for(kBetweenAttempts);
  }
}

void ContentRequests::itemChanged(const std::string& path) {
  withControl([path](const ipc::Remote<Control>& remote, const NSErrorRef&) {
    // Whoever is not told now sees it on the disk.
    if (!remote) return;
    (void)ipc::call(
        remote, &Control::Client::itemChangedRequest,
        [path](auto params) { params.setPath(wireData(path)); },
        [](const NSErrorRef&, const auto*) {});
  });
}

NSErrorRef ContentRequests::stopProviding(const std::string& path) {
  NSErrorRef failure;
  const auto remote = control(&failure);
  if (!remote) return failure;
  NSErrorRef transport = ipc::callAndWait(
      remote, &Control::Client::stopProvidingRequest,
      [&](auto params) { params.setPath(wireData(path)); },
      [&](auto results) { failure = ipc::decodeOptional(results.getFailure()); });
  return transport ? transport : failure;
}

ipc::Remote<Control> ContentRequests::control(NSErrorRef* error) {
  ipc::Connection::Ref connection;
  {
    LockGuard guard(mutex_);
    connection = connection_;
  }
  if (!connection || !connection->isConnected()) {
    connection = ipc::Connection::connect(controlSocket_, error);
    if (!connection) return nullptr;
    LockGuard guard(mutex_);
    // Another thread may have been faster, and others use what it made.
    if (connection_ && connection_->isConnected()) {
      connection = connection_;
    } else {
      connection_ = connection;
    }
  }
  return connection->bootstrap<Control>();
}

void ContentRequests::withControl(const ControlHandler& handler) {
  ipc::Connection::Ref connection;
  {
    LockGuard guard(mutex_);
    if (connection_ && connection_->isConnected()) {
      connection = connection_;
    } else {
      waiting_.push_back(handler);
      if (waiting_.size() > 1) return;
    }
  }
  if (connection) return handler(connection->bootstrap<Control>(), nullptr);
  ipc::Connection::connectAsync(
      controlSocket_,
      [self = shared_from_this()](const ipc::Connection::Ref& made, const NSErrorRef& error) {
        self->didConnect(made, error);
      });
}

void ContentRequests::didConnect(const ipc::Connection::Ref& connection, const NSErrorRef& error) {
  std::vector<ControlHandler> waiting;
  ipc::Connection::Ref used;
  {
    LockGuard guard(mutex_);
    // Another thread may have been faster, and others use what it made.
    if (connection_ == nullptr || !connection_->isConnected()) connection_ = connection;
    used = connection_;
    std::swap(waiting, waiting_);
  }
  const auto control = used ? used->bootstrap<Control>() : ipc::Remote<Control>(nullptr);
  for (const auto& handler : waiting) handler(control, error);
}

void ContentRequests::dropConnection() {
  ipc::Connection::Ref dropped;
  LockGuard guard(mutex_);
  if (connection_ && !connection_->isConnected()) std::swap(dropped, connection_);
}

}  // namespace yomber
