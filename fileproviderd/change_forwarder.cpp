#include "fileproviderd/change_forwarder.h"

#include <optional>
#include <utility>

#include "fileproviderd/host_errors.h"
#include "fileproviderd/outcome.h"
#include "platform/ipc/error_codec.h"

namespace yomber {
namespace {

using protocol::Changed;
using protocol::Changes;
using Context = capnp::CallContext<capnp::AnyPointer, capnp::AnyPointer>;

void answer(Context& context, const NSErrorRef& error) {
  ipc::encodeError(error, context.getResults().initAs<Changed>().initError());
}

class ChangeForwarder final : public Changes::Server {
 public:
  explicit ChangeForwarder(std::shared_ptr<Host> host) : host_(std::move(host)) {}

  DispatchCallResult dispatchCall(uint64_t interfaceId, uint16_t methodId,
                                  Context context) override {
    if (interfaceId != capnp::typeId<Changes>()) {
      return Changes::Server::dispatchCall(interfaceId, methodId, context);
    }
    return {forward(methodId, context), false};
  }

 private:
  kj::Promise<void> forward(uint16_t methodId, Context context) {
    return outcomeOf<ExtensionSessionRef>([this](auto handler) {
             host_->supervisor().acquire(
                 [handler](const ExtensionSessionRef& session, const NSErrorRef& error) {
                   handler(session != nullptr ? std::optional(session) : std::nullopt, error);
                 });
           })
        .then([host = host_, methodId,
               context](Outcome<ExtensionSessionRef> outcome) mutable -> kj::Promise<void> {
          if (!outcome.value) {
            answer(context, outcome.error);
            return kj::READY_NOW;
          }
          return send(host, *outcome.value, methodId, context);
        });
  }

  static kj::Promise<void> send(std::shared_ptr<Host> host, ExtensionSessionRef session,
                                uint16_t methodId, Context context) {
    const auto remote = session->remote();
    Changes::Client changes = remote.client().changesRequest().send().getChanges();
    auto request = changes.typelessRequest(capnp::typeId<Changes>(), methodId,
                                           context.getParams().targetSize());
    request.set(context.getParams());
    context.releaseParams();
    return request.send().then(
        [context](capnp::Response<capnp::AnyPointer>&& response) mutable {
          context.getResults(response.targetSize()).set(response);
        },
        [host = std::move(host), session = std::move(session),
         context](kj::Exception&& exception) mutable {
          const auto error = ipc::connectionError(exception);
          if (!isConnectionError(error)) return answer(context, error);
          host->supervisor().sessionWasLost(session, error);
          answer(context, changeInterruptedError(error));
        });
  }

  const std::shared_ptr<Host> host_;
};

}  // namespace

Changes::Client makeChangeForwarder(std::shared_ptr<Host> host) {
  return kj::heap<ChangeForwarder>(std::move(host));
}

}  // namespace yomber
