#include "platform/ostrell/collaboration_server.h"

#include <optional>
#include <string>

#include "platform/ipc/error_codec.h"
#include "platform/ostrell/service_wire.h"
#include "platform/ostrell/url_wire.h"

namespace yomber {
namespace {

using Object = QSFileProviderPandrelCollaboration;

}  // namespace

kj::Promise<void> CollaborationServer::fetchVersionAndCapabilities(
    FetchVersionAndCapabilitiesContext context) {
  struct Answer {
    std::uint64_t version;
    std::uint64_t capabilities;
    NSErrorRef error;
  };
  return object_
      .deliver<Answer>(
          context,
          [](Object& object, const auto& reply) {
            object.fetchVersionAndCapabilitiesWithCompletionHandler(
                [reply](std::uint64_t version, std::uint64_t capabilities, NSErrorRef error) {
                  reply({version, capabilities, std::move(error)});
                });
          })
      .then([context](const Answer& answer) mutable {
        auto results = context.getResults();
        results.setVersion(answer.version);
        results.setCapabilities(answer.capabilities);
        ipc::encodeOptional(answer.error, results.initFailure());
      });
}

kj::Promise<void> CollaborationServer::setEnvironmentType(SetEnvironmentTypeContext context) {
  return object_.deliverOneWay(
      [type = context.getParams().getType()](Object& object) { object.setEnvironmentType(type); });
}

kj::Promise<void> CollaborationServer::fetchCollaborationToken(
    FetchCollaborationTokenContext context) {
  struct Answer {
    std::optional<std::string> providerIdentifier;
    std::optional<std::string> baseToken;
    std::optional<std::string> shareToken;
    std::optional<NSDate> expirationDate;
    NSErrorRef error;
  };
  return object_
      .deliver<Answer>(context, context.getParams().getCall(),
                       [](Object& object, const auto& reply) {
                         return object.fetchCollaborationTokenWithCompletionHandler(
                             [reply](const std::optional<std::string>& provider,
                                     const std::optional<std::string>& base,
                                     const std::optional<std::string>& share,
                                     const std::optional<NSDate>& date, NSErrorRef error) {
                               reply({provider, base, share, date, std::move(error)});
                             });
                       })
      .then([context](const Answer& answer) mutable {
        auto results = context.getResults();
        encodeOptionalString(answer.providerIdentifier, results.initProviderIdentifier());
        encodeOptionalString(answer.baseToken, results.initBaseToken());
        encodeOptionalString(answer.shareToken, results.initShareToken());
        if (answer.expirationDate) {
          results.initExpirationDate().setValue(answer.expirationDate->nanoseconds());
        }
        ipc::encodeOptional(answer.error, results.initFailure());
      });
}

kj::Promise<void> CollaborationServer::fetchLatestRevision(FetchLatestRevisionContext context) {
  return object_
      .deliver<NSErrorRef>(context, context.getParams().getCall(),
                           [](Object& object, const auto& reply) {
                             return object.fetchLatestRevisionWithCompletionHandler(reply);
                           })
      .then(errorResults(context));
}

kj::Promise<void> CollaborationServer::refreshSharingState(RefreshSharingStateContext context) {
  return object_
      .deliver<NSErrorRef>(context, context.getParams().getCall(),
                           [](Object& object, const auto& reply) {
                             return object.refreshSharingStateWithCompletionHandler(reply);
                           })
      .then(errorResults(context));
}

kj::Promise<void> CollaborationServer::fetchPrivacyState(FetchPrivacyStateContext context) {
  struct Answer {
    bool first;
    bool second;
    NSURLRef url;
    NSErrorRef error;
  };
  return object_
      .deliver<Answer>(context, context.getParams().getCall(),
                       [](Object& object, const auto& reply) {
                         return object.fetchPrivacyStateWithCompletionHandler(
                             [reply](bool first, bool second, NSURLRef url, NSErrorRef error) {
                               reply({first, second, std::move(url), std::move(error)});
                             });
                       })
      .then([context](const Answer& answer) mutable {
        auto results = context.getResults();
        results.setFirst(answer.first);
        results.setSecond(answer.second);
        encodeURL(answer.url, results.initUrl());
        ipc::encodeOptional(answer.error, results.initFailure());
      });
}

kj::Promise<void> CollaborationServer::documentIsInUse(DocumentIsInUseContext context) {
  return object_.deliverOneWay([timeout = context.getParams().getTimeout()](Object& object) {
    object.documentIsInUseWithTimeout(timeout);
  });
}

kj::Promise<void> CollaborationServer::fetchFileProviderIdentifier(
    FetchFileProviderIdentifierContext context) {
  struct Answer {
    std::optional<std::string> identifier;
    NSErrorRef error;
  };
  return object_
      .deliver<Answer>(context,
                       [](Object& object, const auto& reply) {
                         object.fetchFileProviderIdentifierWithCompletionHandler(
                             [reply](const std::optional<std::string>& identifier,
                                     NSErrorRef error) { reply({identifier, std::move(error)}); });
                       })
      .then([context](const Answer& answer) mutable {
        auto results = context.getResults();
        encodeOptionalString(answer.identifier, results.initIdentifier());
        ipc::encodeOptional(answer.error, results.initFailure());
      });
}

kj::Promise<void> CollaborationServer::fetchUrlForSharingFile(
    FetchUrlForSharingFileContext context) {
  struct Answer {
    NSURLRef url;
    NSErrorRef error;
  };
  return object_
      .deliver<Answer>(context,
                       [](Object& object, const auto& reply) {
                         object.fetchURLForSharingFileWithCompletionHandler(
                             [reply](NSURLRef url, NSErrorRef error) {
                               reply({std::move(url), std::move(error)});
                             });
                       })
      .then([context](const Answer& answer) mutable {
        auto results = context.getResults();
        encodeURL(answer.url, results.initUrl());
        ipc::encodeOptional(answer.error, results.initFailure());
      });
}

kj::Promise<void> CollaborationServer::fetchFolderSharingState(
    FetchFolderSharingStateContext context) {
  struct Answer {
    bool isInSharedFolder;
    NSErrorRef error;
  };
  return object_
      .deliver<Answer>(context, context.getParams().getCall(),
                       [](Object& object, const auto& reply) {
                         return object.fetchFolderSharingStateWithCompletionHandler(
                             [reply](bool isInSharedFolder, NSErrorRef error) {
                               reply({isInSharedFolder, std::move(error)});
                             });
                       })
      .then([context](const Answer& answer) mutable {
        auto results = context.getResults();
        results.setIsInSharedFolder(answer.isInSharedFolder);
        ipc::encodeOptional(answer.error, results.initFailure());
      });
}

kj::Promise<void> CollaborationServer::fetchSharedFolderInfo(FetchSharedFolderInfoContext context) {
  struct Answer {
    bool isInSharedFolder;
    std::optional<std::string> folderName;
    NSErrorRef error;
  };
  return object_
      .deliver<Answer>(
          context, context.getParams().getCall(),
          [](Object& object, const auto& reply) {
            return object.fetchSharedFolderInfoWithCompletionHandler(
                [reply](bool isInSharedFolder, const std::optional<std::string>& folderName,
                        NSErrorRef error) {
                  reply({isInSharedFolder, folderName, std::move(error)});
                });
          })
      .then([context](const Answer& answer) mutable {
        auto results = context.getResults();
        results.setIsInSharedFolder(answer.isInSharedFolder);
        encodeOptionalString(answer.folderName, results.initFolderName());
        ipc::encodeOptional(answer.error, results.initFailure());
      });
}

}  // namespace yomber
