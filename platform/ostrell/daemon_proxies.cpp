#include "platform/ostrell/daemon_proxies.h"

#include <optional>
#include <utility>

#include "platform/ostrell/error_handler_slot.h"
#include "platform/ostrell/patient_call.h"
#include "platform/ostrell/sharing_calls.h"

namespace yomber {
namespace {

/// Makes calls without waiting: replies and failures come on the link's reply queue.
class AsyncInvoker {
 public:
  AsyncInvoker(std::shared_ptr<DaemonLink> link, std::function<void(NSErrorRef)> errorHandler)
      : link_(std::move(link)),
        slot_(std::make_shared<ErrorHandlerSlot>(std::move(errorHandler), link_->replyQueue())) {}

  [[nodiscard]] const std::shared_ptr<DaemonLink>& link() const { return link_; }

  template <typename Client, typename Params, typename Results, typename Fill, typename Decode,
            typename Reply>
  void invoke(ipc::RequestMethod<Client, Params, Results> method, Fill fill, Decode decode,
              Reply reply, Limit limit = Limit::Links) {
    link_->withSession([=, link = link_, slot = slot_](const DaemonSessionRef& session,
                                                       const NSErrorRef& error) {
      if (!session) {
        slot->fail(error);
        return;
      }
      using Reader = typename Results::Reader;
      if (limit == Limit::None) {
        const auto take = [=](const Reader& results) {
          link->replyQueue()->async([reply, value = decode(session, results)] { reply(value); });
        };
        callPatiently(link, session, method, fill, take,
                      [slot](const NSErrorRef& failure) { slot->fail(failure); });
        return;
      }
      auto onReply = [decode, reply, slot, session, link](NSErrorRef failure,
                                                          const Reader* results) {
        const auto take = [&] {
          link->replyQueue()->async([reply, value = decode(session, *results)] { reply(value); });
        };
        if (results != nullptr) failure = whatIsWrongWith(take);
        if (!failure) return;
        link->noteFailure(session, failure);
        slot->fail(failure);
      };
      (void)ipc::call(session->remote<Client>(), method, fill, std::move(onReply),
                      link->callOptions());
    });
  }

 private:
  const std::shared_ptr<DaemonLink> link_;
  const std::shared_ptr<ErrorHandlerSlot> slot_;
};

/// Makes calls on the calling thread; keeps what the reply stored, or the transport failure.
class SyncInvoker {
 public:
  explicit SyncInvoker(std::shared_ptr<DaemonLink> link) : link_(std::move(link)) {}

  [[nodiscard]] const std::shared_ptr<DaemonLink>& link() const { return link_; }

  template <typename Client, typename Params, typename Results, typename Fill, typename Decode,
            typename Reply>
  void invoke(ipc::RequestMethod<Client, Params, Results> method, Fill fill, Decode decode,
              Reply reply, Limit limit = Limit::Links) {
    const auto session = link_->waitForSession(&error);
    if (!session) return;
    using Value = decltype(decode(session, std::declval<const typename Results::Reader&>()));
    std::optional<Value> value;
    if (limit == Limit::None) {
      error = waitPatiently(
          link_, session, method, std::move(fill),
          [decode, session](const auto& results) { return decode(session, results); }, value);
      if (value) reply(*value);
      return;
    }
    error = ipc::callAndWait(
        session->remote<Client>(), method, std::move(fill),
        [&](const typename Results::Reader& results) { value.emplace(decode(session, results)); },
        link_->callOptions());
    if (error) {
      link_->noteFailure(session, error);
    } else if (value) {
      reply(*value);
    }
  }

  NSErrorRef error;

 private:
  const std::shared_ptr<DaemonLink> link_;
};

using DaemonProxy = SharingCalls<QSDaemonProtocol, AsyncInvoker>;

class DaemonSyncProxy final : public SharingCalls<QSDaemonSyncProxy, SyncInvoker> {
 public:
  using SharingCalls::SharingCalls;

  void setObjResult(NSObjectRef result, NSErrorRef error) override {
    result_ = std::move(result);
    invoker().error = std::move(error);
  }
  void setBoolResult(bool result, NSErrorRef error) override {
    boolResult_ = result;
    invoker().error = std::move(error);
  }
  [[nodiscard]] NSObjectRef result() const override { return result_; }
  [[nodiscard]] bool boolResult() const override { return boolResult_; }
  [[nodiscard]] NSErrorRef error() const override { return invoker().error; }

 private:
  NSObjectRef result_;
  bool boolResult_ = false;
};

}  // namespace

QSDaemonProxyRef makeDaemonProxy(std::shared_ptr<DaemonLink> link,
                                 std::function<void(NSErrorRef)> errorHandler) {
  return std::make_shared<DaemonProxy>(AsyncInvoker(std::move(link), std::move(errorHandler)));
}

QSDaemonSyncProxyRef makeDaemonSyncProxy(std::shared_ptr<DaemonLink> link) {
  return std::make_shared<DaemonSyncProxy>(SyncInvoker(std::move(link)));
}

}  // namespace yomber
