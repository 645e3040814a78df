#include <functional>
#include <memory>
#include <stdexcept>
#include <utility>
#include <vector>

#include "platform/ipc/error_codec.h"
#include "platform/ostrell/service_wire.h"
#include "platform/ostrell/share_wire.h"
#include "platform/ostrell/sharing_server.h"
#include "platform/ostrell/sharing_service.h"
#include "platform/ostrell/url_wire.h"
#include "platform/xpc/interface_coding.h"
#include "platform/xpc/remote_object.h"

namespace yomber {
namespace {

using Service = protocol::SharingService;

RZShareRef shareOf(Service::OptionalShare::Reader reader) {
  if (!reader.isShare()) return nullptr;
  auto share = decodeShare(reader.getShare());
  if (share == nullptr) throw std::runtime_error("The reply holds what is no share.");
  return share;
}

template <typename Results>
auto shareReply(QSShareReply reply) {
  return [reply = std::move(reply)](typename Results::Reader results) -> std::function<void()> {
    return [reply, share = shareOf(results.getShare()),
            error = ipc::decodeOptional(results.getFailure())] {
      if (reply) reply(share, error);
    };
  };
}

class SharingProxy final : public QSSharingServiceV1 {
 public:
  SharingProxy(NSXPCConnectionRef connection, std::function<void(NSErrorRef)> errorHandler)
      : remote_(std::move(connection), std::move(errorHandler)) {}

  void fetchSharingInfo(QSSharingInfoReply reply) override {
    remote_.call(&Service::Client::fetchSharingInfoRequest, kNoParameters,
                 [reply = std::move(reply)](
                     Service::FetchSharingInfoResults::Reader results) -> std::function<void()> {
                   return [reply, shared = results.getShared(),
                           item = decodeOptionalItem(results.getItem()),
                           error = ipc::decodeOptional(results.getFailure())] {
                     if (reply) reply(shared, item, error);
                   };
                 });
  }

  NSProgressRef preflightCheckIfCurrentlyShareableWithCompletion(
      QSShareablePreflightReply completion) override {
    return remote_.callWithProgress(
        &Service::Client::preflightRequest, kNoParameters,
        [completion = std::move(completion)](
            Service::PreflightResults::Reader results) -> std::function<void()> {
          return
              [completion, shareable = results.getShareable(),
               item = decodeOptionalItem(results.getItem()),
               first = decodeItems(results.getFirst()), second = decodeItems(results.getSecond()),
               error = ipc::decodeOptional(results.getFailure())] {
                if (completion) completion(shareable, item, first, second, error);
              };
        });
  }

  NSProgressRef fetchParticipantListAndPublicPermission(QSParticipantsReply reply) override {
    return remote_.callWithProgress(
        &Service::Client::participantsRequest, kNoParameters,
        [reply = std::move(reply)](
            Service::ParticipantsResults::Reader results) -> std::function<void()> {
          auto participants = decodeParticipants(results.getParticipants());
          if (!participants) throw std::runtime_error("The reply holds what no share can have.");
          return [reply, participants = std::move(*participants),
                  permission = results.getPublicPermission(),
                  error = ipc::decodeOptional(results.getFailure())] {
            if (reply) reply(participants, permission, error);
          };
        });
  }

  void startPreparingForShareWhenForcing(bool forcing) override {
    remote_.call(
        &Service::Client::startPreparingRequest,
        [forcing](auto params) { params.setForcing(forcing); }, [](const auto&) { return [] {}; });
  }

  NSProgressRef fetchShareWithCompletion(QSShareReply completion) override {
    return remote_.callWithProgress(&Service::Client::fetchShareRequest, kNoParameters,
                                    shareReply<Service::FetchShareResults>(std::move(completion)));
  }

  NSProgressRef fetchShareURLWithCompletion(QSShareURLReply completion) override {
    return remote_.callWithProgress(
        &Service::Client::fetchShareUrlRequest, kNoParameters,
        [completion = std::move(completion)](
            Service::FetchShareUrlResults::Reader results) -> std::function<void()> {
          return [completion, url = decodeURL(results.getUrl()),
                  error = ipc::decodeOptional(results.getFailure())] {
            if (completion) completion(url, error);
          };
        });
  }

  NSProgressRef saveShare(const RZShareRef& share, QSShareReply completion) override {
    return remote_.callWithProgress(
        &Service::Client::saveShareRequest,
        [share](Service::SaveShareParams::Builder params) {
          if (share != nullptr) encodeShare(*share, params.initShare().initShare());
        },
        shareReply<Service::SaveShareResults>(std::move(completion)));
  }

  NSProgressRef unshareWithCompletion(QSErrorReply completion) override {
    return remote_.callWithProgress(&Service::Client::unshareRequest, kNoParameters,
                                    errorReply(std::move(completion)));
  }

 private:
  const RemoteObject<Service> remote_;
};

}  // namespace

NSXPCInterfaceRef getSharingServiceInterface() {
  return CodingOf<QSSharingServiceV1, SharingServer, SharingProxy>::makeInterface();
}

}  // namespace yomber
