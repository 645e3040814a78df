#pragma once

#include <utility>

#include "platform/ostrell/sharing_service.h"
#include "platform/xpc/served_object.h"
#include "protocols/services.capnp.h"

namespace yomber {

/// Delivers the calls of a client to the sharing object of a connection. Loop thread only.
class SharingServer final : public protocol::SharingService::Server {
 public:
  using Object = QSSharingServiceV1;

  explicit SharingServer(ServedObject<Object> object) : object_(std::move(object)) {}

 protected:
  kj::Promise<void> fetchSharingInfo(FetchSharingInfoContext context) override;
  kj::Promise<void> preflight(PreflightContext context) override;
  kj::Promise<void> participants(ParticipantsContext context) override;
  kj::Promise<void> startPreparing(StartPreparingContext context) override;
  kj::Promise<void> fetchShare(FetchShareContext context) override;
  kj::Promise<void> fetchShareUrl(FetchShareUrlContext context) override;
  kj::Promise<void> saveShare(SaveShareContext context) override;
  kj::Promise<void> unshare(UnshareContext context) override;

 private:
  const ServedObject<Object> object_;
};

}  // namespace yomber
