#pragma once

#include <cstddef>
#include <functional>
#include <memory>
#include <span>
#include <string>
#include <vector>

#include "platform/fileprovider/services.h"
#include "platform/foundation/error.h"
#include "platform/foundation/lock.h"
#include "platform/rozzel/share.h"
#include "platform/xpc/connection.h"

namespace yomber::testing {

/// How a call to a service ended.
struct ServiceCallEnd {
  NSErrorRef failure;  ///< what its error handler was given; nil when the service answered
  NSErrorRef error;    ///< what the answer brought
};

/// A client of both services of an item, with a connection to each, that can make every call.
///
/// Its connections end with it. Thread-safety: one thread; what it calls back comes on any.
class ServiceCaller {
 public:
  using Done = std::function<void(const ServiceCallEnd& end)>;
  using Prepare = std::function<void(NSXPCConnection& connection)>;

  enum class Answer {
    Always,     ///< without an error, whatever else is under way
    Sometimes,  ///< or an error, by what became of the share meanwhile
    LeftOut,    ///< the service does not have it
  };
  struct Call {
    const char* name;
    Answer answer;
    void (*begin)(const ServiceCaller& caller, const Done& done);
  };
  /// Every call of both services.
  static std::span<const Call> calls();

  /// Nil with an error when the item has not both services, or nobody answers. `prepare` is called
  /// with each connection before it is resumed.
  static std::unique_ptr<ServiceCaller> connect(const NSFileProviderServices& services,
                                                const std::string& identifier, NSErrorRef* error,
                                                const Prepare& prepare = {});
  ~ServiceCaller();
  ServiceCaller(const ServiceCaller&) = delete;
  ServiceCaller& operator=(const ServiceCaller&) = delete;

  /// Gets the share that is saved when saving is called; waits. How that ended.
  ServiceCallEnd fetchShare();
  /// Waits until the service of collaboration has answered, which asks nobody.
  ServiceCallEnd waitForAnswer() const;

  [[nodiscard]] const NSXPCConnectionRef& sharing() const { return sharing_; }
  [[nodiscard]] const NSXPCConnectionRef& collaboration() const { return collaboration_; }
  [[nodiscard]] const RZShareRef& share() const { return share_; }

 private:
  ServiceCaller(NSXPCConnectionRef sharing, NSXPCConnectionRef collaboration);

  const NSXPCConnectionRef sharing_;
  const NSXPCConnectionRef collaboration_;
  RZShareRef share_;
};

/// How every call of one client ended, by its place in ServiceCaller::calls().
///
/// Thread-safety: every operation may be called on any thread.
class ServiceCallEnds : public std::enable_shared_from_this<ServiceCallEnds> {
 public:
  /// Makes every call at once; each end is added here. `each` is called after that, if given.
  void callEverything(const ServiceCaller& caller, const std::function<void()>& each = {});
  [[nodiscard]] std::size_t count() const;
  /// Normally one.
  [[nodiscard]] std::vector<ServiceCallEnd> of(std::size_t call) const;

 private:
  mutable Mutex mutex_;
  std::vector<std::vector<ServiceCallEnd>> ends_ GUARDED_BY(mutex_){ServiceCaller::calls().size()};
};

}  // namespace yomber::testing
