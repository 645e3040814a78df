#include "yomber/drive_sharing.h"

#include <cerrno>
#include <memory>
#include <utility>

#include "platform/fileprovider/services.h"
#include "platform/foundation/fault_points.h"
#include "platform/ostrell/daemon_connection.h"
#include "platform/ostrell/errors.h"
#include "platform/ostrell/share_operations.h"
#include "platform/ostrell/sharing_service.h"
#include "platform/rozzel/errors.h"
#include "yomber/item_output.h"
#include "yomber/service_client.h"

namespace yomber {

namespace {

FaultPoint shareFetched("yomber.share.fetched");

using SharingClient = ServiceClient<QSSharingServiceV1>;

/// How often something is done anew because others saved in between: each time somebody's change
/// was saved, so that this is an end only for what never ends.
constexpr int maximumAttempts = 1000;

std::unique_ptr<SharingClient> openSharing(DriveClient& client,
                                           const NSFileProviderItemIdentifier& identifier,
                                           NSErrorRef& error) {
  const NSFileProviderServices services(client.paths());
  const auto service = services.serviceForItemIdentifier(identifier, QSSharingServiceName, &error);
  const auto connection = service ? service->fileProviderConnection(&error) : nullptr;
  if (!connection) return nullptr;
  connection->setRemoteObjectInterface(getSharingServiceInterface());
  return std::make_unique<SharingClient>(connection);
}

/// Waits for an operation of the client library; `prepare` sets the completion that settles.
template <typename Operation, typename Prepare>
NSErrorRef run(const std::shared_ptr<Operation>& operation, const Prepare& prepare) {
  const auto completion = std::make_shared<Completion>();
  prepare([completion](NSErrorRef error) { completion->settle(std::move(error)); });
  operation->start();
  return completion->wait();
}

/// Whether the share is the item's own, rather than that of a folder around it.
bool isOwnShare(const NSFileProviderItemIdentifier& identifier, const RZShare& share) {
  return !share.isKnownToServer() ||
         identifier.substr(identifier.find(':') + 1) == share.rootRecordID().recordName();
}

NSErrorRef liesInShare(const RZShare& share) {
  return qs_errorWithPOSIXCode(EINVAL, "it lies in \"" + printableName(share.title()) +
                                           "\", which is shared; name that folder");
}

NSErrorRef fetchShare(SharingClient& service, RZShareRef& share) {
  return service.call([&](QSSharingServiceV1& item, const SharingClient::Done& done) {
    (void)item.fetchShareWithCompletion([&share, done](RZShareRef found, NSErrorRef error) {
      share = std::move(found);
      done(std::move(error));
    });
  });
}

/// Shares of folders are saved through the client library, those of documents by their service.
NSErrorRef save(SharingClient& service, const RZShareRef& share, RZShareRef& saved) {
  if (share->type() != RZShareTypeFolder) {
    return service.call([&](QSSharingServiceV1& item, const SharingClient::Done& done) {
      (void)item.saveShare(share, [&saved, done](RZShareRef stored, NSErrorRef error) {
        saved = std::move(stored);
        done(std::move(error));
      });
    });
  }
  const auto operation = QSShareSaveOperation::initWithShare(share);
  return run(operation, [&](auto done) {
    operation->setShareSaveCompletionBlock([&saved, done](RZShareRef stored, NSErrorRef error) {
      saved = std::move(stored);
      done(std::move(error));
    });
  });
}

/// Calls `act(service, share)` with the item's own share; anew when somebody else saved it
/// meanwhile.
template <typename Act>
NSErrorRef withShare(DriveClient& client, const NSFileProviderItemIdentifier& identifier,
                     const Act& act) {
  NSErrorRef error;
  for (int attempt = 0; attempt < maximumAttempts; ++attempt) {
    // A connection keeps the share that it has fetched, so each attempt has one of its own.
    const auto service = openSharing(client, identifier, error);
    RZShareRef share;
    if (service) error = fetchShare(*service, share);
    if (!error && shareFetched.hit()) error = NSError::errorWithErrno(EIO);
    if (error) return error;
    if (!isOwnShare(identifier, *share)) return liesInShare(*share);
    error = act(*service, *share);
    if (!rz_isError(error, RZErrorServerRecordChanged)) return error;
  }
  return error;
}

}  // namespace

DriveSharing::DriveSharing(DriveClient& client) : client_(client) {
  QSDaemonConnection::setDefaultHome(client.paths().home);
}

NSErrorRef DriveSharing::share(const NSFileProviderItemIdentifier& identifier, RZShareRef& share) {
  NSErrorRef error;
  const auto service = openSharing(client_, identifier, error);
  return service ? fetchShare(*service, share) : error;
}

NSErrorRef DriveSharing::participants(const NSFileProviderItemIdentifier& identifier,
                                      std::vector<RZShareParticipant>& participants) {
  NSErrorRef error;
  const auto service = openSharing(client_, identifier, error);
  if (!service) return error;
  return service->call([&](QSSharingServiceV1& item, const SharingClient::Done& done) {
    (void)item.fetchParticipantListAndPublicPermission(
        [&participants, done](const std::vector<RZShareParticipant>& found, std::int64_t,
                              NSErrorRef failure) {
          participants = found;
          done(std::move(failure));
        });
  });
}

NSErrorRef DriveSharing::change(const NSFileProviderItemIdentifier& identifier,
                                const std::function<void(RZShare& share)>& change,
                                RZShareRef& saved) {
  return withShare(client_, identifier, [&](SharingClient& service, const RZShare& share) {
    const auto wanted = std::make_shared<RZShare>(share);
    change(*wanted);
    return save(service, wanted, saved);
  });
}

NSErrorRef DriveSharing::link(const NSFileProviderItemIdentifier& identifier, std::string& url) {
  NSErrorRef error;
  const auto service = openSharing(client_, identifier, error);
  if (!service) return error;
  RZShareRef share;
  error = fetchShare(*service, share);
  if (error) return error;
  if (!isOwnShare(identifier, *share)) return liesInShare(*share);
  return service->call([&](QSSharingServiceV1& item, const SharingClient::Done& done) {
    (void)item.fetchShareURLWithCompletion([&url, done](NSURLRef found, NSErrorRef failure) {
      if (found) url = found->absoluteString();
      done(std::move(failure));
    });
  });
}

NSErrorRef DriveSharing::stop(const NSFileProviderItemIdentifier& identifier) {
  return withShare(client_, identifier, [](SharingClient& service, const RZShare&) {
    return service.call([](QSSharingServiceV1& item, const SharingClient::Done& done) {
      (void)item.unshareWithCompletion(done);
    });
  });
}

NSErrorRef DriveSharing::accept(const std::string& url, NSFileProviderItemIdentifier& identifier) {
  const NSURLRef link = NSURL::URLWithString(url);
  if (!link) return qs_errorWithPOSIXCode(EINVAL, "that is no link of a share");
  const auto operation = QSShareAcceptOperation::initWithShareURL(link);
  return run(operation, [&](auto done) {
    operation->setShareAcceptCompletionBlock(
        [&identifier, done](const std::optional<std::string>& found, NSErrorRef error) {
          identifier = found.value_or("");
          done(std::move(error));
        });
  });
}

NSErrorRef DriveSharing::sharedWithMe(std::vector<RZShareRef>& shares) {
  const auto completion = std::make_shared<Completion>();
  const auto done = [completion](NSErrorRef error) { completion->settle(std::move(error)); };
  const auto daemon =
      QSDaemonConnection::defaultConnection().remoteObjectProxyWithErrorHandler(done);
  daemon->sharesWithMeWithReply(
      [&shares, done](const std::vector<RZShareRef>& found, NSErrorRef error) {
        shares = found;
        done(std::move(error));
      });
  return completion->wait();
}

}  // namespace yomber
