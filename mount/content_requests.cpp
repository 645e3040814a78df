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
  if (!error || !error->is(NSFileProviderErrorDomain, NSFileProviderErrorServerUnreachable)) {
    return false;
  }
  for (NSErrorRef cause = error; cause; cause = cause->underlyingError()) {
    if (cause->is(NSCocoaErrorDomain, NSUbiquitousFileUnavailableError)) return false;
  }
  return true;
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
  if (error->domain() == NSPOSIXErrorDomain) return static_cast<int>(error->code());
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
    ThreadPool::shared().async([self = shared_from_this()] { self->attempt(); });
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
  /// May wait for the connection.
  void attempt() {
    NSErrorRef error;
    began_ = Clock::now();
    const auto control = requests_->control(&error);
    if (!control) return failed(error);
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
          self->answered(transport, failure);
        },
        kAsLongAsItTakes);
    LockGuard guard(mutex_);
    call_ = std::move(call);
    if (isCancelled_) call_.cancel();
  }

  /// On the loop thread: what comes next may block.
  void answered(const NSErrorRef& transport, const NSErrorRef& failure) {
    ThreadPool::shared().async([self = shared_from_this(), transport, failure] {
      if (transport || isForTheMoment(failure)) {
        self->failed(transport ? transport : failure);
      } else {
        self->finish(failure);
      }
    });
  }

  void failed(const NSErrorRef& error) {
    {
      LockGuard guard(mutex_);
      if (isCancelled_ || !completion_) return;
    }
    const auto now = Clock::now();
    if (now - began_ > kWorkedOn || !giveUpAt_) giveUpAt_ = now + kPatience;
    if (now > *giveUpAt_) return finish(error);
    requests_->dropConnection();
    std::this_thread::sleep_for(kBetweenAttempts);
    attempt();
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
  Mutex mutex_;
  Completion completion_ GUARDED_BY(mutex_);
  ipc::CallHandle call_ GUARDED_BY(mutex_);
  bool isCancelled_ GUARDED_BY(mutex_) = false;

  // Of the thread that attempts; there is one at a time.
  Clock::time_point began_;
  std::optional<Clock::time_point> giveUpAt_;
};

std::shared_ptr<ContentRequests> ContentRequests::create(std::string controlSocket) {
  return std::shared_ptr<ContentRequests>(new ContentRequests(std::move(controlSocket)));
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
  ThreadPool::shared().async([self = shared_from_this(), path] {
    NSErrorRef error;
    const auto remote = self->control(&error);
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

void ContentRequests::dropConnection() {
  ipc::Connection::Ref dropped;
  LockGuard guard(mutex_);
  if (connection_ && !connection_->isConnected()) std::swap(dropped, connection_);
}

}  // namespace yomber
