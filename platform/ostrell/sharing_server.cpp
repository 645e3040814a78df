#include "platform/ostrell/sharing_server.h"

#include <cerrno>
#include <string>

#include "platform/ipc/error_codec.h"
#include "platform/ostrell/service_wire.h"
#include "platform/ostrell/share_wire.h"
#include "platform/ostrell/url_wire.h"

namespace yomber {
namespace {

using Object = QSSharingServiceV1;

struct ShareAnswer {
  RZShareRef share;
  NSErrorRef error;
};

template <typename Context>
void encodeShareAnswer(const ShareAnswer& answer, Context& context) {
  auto results = context.getResults();
  if (answer.share != nullptr) encodeShare(*answer.share, results.initShare().initShare());
  ipc::encodeOptional(answer.error, results.initFailure());
}

NSErrorRef noShareError() {
  return NSError::errorWithDomain(
      NSPOSIXErrorDomain, EINVAL,
      {{NSLocalizedDescriptionKey, std::string("what was sent to be saved is no share")}});
}

}  // namespace

kj::Promise<void> SharingServer::fetchSharingInfo(FetchSharingInfoContext context) {
  struct Answer {
    bool shared;
    NSFileProviderItemRef item;
    NSErrorRef error;
  };
  return object_
      .deliver<Answer>(context,
                       [](Object& object, const auto& reply) {
                         object.fetchSharingInfo(
                             [reply](bool shared, NSFileProviderItemRef item, NSErrorRef error) {
                               reply({shared, std::move(item), std::move(error)});
                             });
                       })
      .then([context](const Answer& answer) mutable {
        auto results = context.getResults();
        results.setShared(answer.shared);
        encodeOptionalItem(answer.item, results.initItem());
        ipc::encodeOptional(answer.error, results.initFailure());
      });
}

kj::Promise<void> SharingServer::preflight(PreflightContext context) {
  struct Answer {
    bool shareable;
    NSFileProviderItemRef item;
    NSFileProviderItems first;
    NSFileProviderItems second;
    NSErrorRef error;
  };
  return object_
      .deliver<Answer>(context, context.getParams().getCall(),
                       [](Object& object, const auto& reply) {
                         return object.preflightCheckIfCurrentlyShareableWithCompletion(
                             [reply](bool shareable, NSFileProviderItemRef item,
                                     const NSFileProviderItems& first,
                                     const NSFileProviderItems& second, NSErrorRef error) {
                               reply({shareable, std::move(item), first, second, std::move(error)});
                             });
                       })
      .then([context](const Answer& answer) mutable {
        auto results = context.getResults();
        results.setShareable(answer.shareable);
        encodeOptionalItem(answer.item, results.initItem());
        encodeItems(answer.first, results.initFirst(static_cast<unsigned>(answer.first.size())));
        encodeItems(answer.second, results.initSecond(static_cast<unsigned>(answer.second.size())));
        ipc::encodeOptional(answer.error, results.initFailure());
      });
}

kj::Promise<void> SharingServer::participants(ParticipantsContext context) {
  struct Answer {
    std::vector<RZShareParticipant> participants;
    std::int64_t publicPermission;
    NSErrorRef error;
  };
  return object_
      .deliver<Answer>(context, context.getParams().getCall(),
                       [](Object& object, const auto& reply) {
                         return object.fetchParticipantListAndPublicPermission(
                             [reply](const std::vector<RZShareParticipant>& participants,
                                     std::int64_t permission, NSErrorRef error) {
                               reply({participants, permission, std::move(error)});
                             });
                       })
      .then([context](const Answer& answer) mutable {
        auto results = context.getResults();
        encodeParticipants(
            answer.participants,
            results.initParticipants(static_cast<unsigned>(answer.participants.size())));
        results.setPublicPermission(answer.publicPermission);
        ipc::encodeOptional(answer.error, results.initFailure());
      });
}

kj::Promise<void> SharingServer::startPreparing(StartPreparingContext context) {
  return object_.deliverOneWay([forcing = context.getParams().getForcing()](Object& object) {
    object.startPreparingForShareWhenForcing(forcing);
  });
}

kj::Promise<void> SharingServer::fetchShare(FetchShareContext context) {
  return object_
      .deliver<ShareAnswer>(
          context, context.getParams().getCall(),
          [](Object& object, const auto& reply) {
            return object.fetchShareWithCompletion([reply](RZShareRef share, NSErrorRef error) {
              reply({std::move(share), std::move(error)});
            });
          })
      .then([context](const ShareAnswer& answer) mutable { encodeShareAnswer(answer, context); });
}

kj::Promise<void> SharingServer::fetchShareUrl(FetchShareUrlContext context) {
  struct Answer {
    NSURLRef url;
    NSErrorRef error;
  };
  return object_
      .deliver<Answer>(
          context, context.getParams().getCall(),
          [](Object& object, const auto& reply) {
            return object.fetchShareURLWithCompletion([reply](NSURLRef url, NSErrorRef error) {
              reply({std::move(url), std::move(error)});
            });
          })
      .then([context](const Answer& answer) mutable {
        auto results = context.getResults();
        encodeURL(answer.url, results.initUrl());
        ipc::encodeOptional(answer.error, results.initFailure());
      });
}

kj::Promise<void> SharingServer::saveShare(SaveShareContext context) {
  const auto given = context.getParams().getShare();
  RZShareRef share = given.isShare() ? decodeShare(given.getShare()) : nullptr;
  if (share == nullptr) {
    encodeShareAnswer({nullptr, noShareError()}, context);
    return kj::READY_NOW;
  }
  return object_
      .deliver<ShareAnswer>(context, context.getParams().getCall(),
                            [share = std::move(share)](Object& object, const auto& reply) {
                              return object.saveShare(share,
                                                      [reply](RZShareRef saved, NSErrorRef error) {
                                                        reply({std::move(saved), std::move(error)});
                                                      });
                            })
      .then([context](const ShareAnswer& answer) mutable { encodeShareAnswer(answer, context); });
}

kj::Promise<void> SharingServer::unshare(UnshareContext context) {
  return object_
      .deliver<NSErrorRef>(
          context, context.getParams().getCall(),
          [](Object& object, const auto& reply) { return object.unshareWithCompletion(reply); })
      .then(errorResults(context));
}

}  // namespace yomber
