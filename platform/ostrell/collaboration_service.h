#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>

#include "platform/foundation/date.h"
#include "platform/foundation/error.h"
#include "platform/foundation/progress.h"
#include "platform/foundation/url.h"
#include "platform/xpc/interface.h"

namespace yomber {

/// The service for programs that edit a document together.
inline constexpr const char* QSCollaborationServiceName = "com.kelvo.PandrelCollaboration";

/// What that service does for a program that edits one document
/// together with others.
///
/// Implemented by the extension for each connection, and by the proxy that a client calls. Every
/// reply given is called once, on any thread. The first operation is always there. The others are
/// optional: as they stand here they are left out, and a client that calls one that is gets
/// NSCocoaErrorDomain NSXPCConnectionReplyInvalid, and keeps its connection.
class QSFileProviderPandrelCollaboration {
 public:
  using VersionReply =
      std::function<void(std::uint64_t version, std::uint64_t capabilities, NSErrorRef error)>;
  using TokenReply = std::function<void(
      const std::optional<std::string>& providerIdentifier,
      const std::optional<std::string>& baseToken, const std::optional<std::string>& shareToken,
      const std::optional<NSDate>& expirationDate, NSErrorRef error)>;
  using ErrorReply = std::function<void(NSErrorRef error)>;
  using PrivacyReply = std::function<void(bool first, bool second, NSURLRef url, NSErrorRef error)>;
  using StringReply =
      std::function<void(const std::optional<std::string>& string, NSErrorRef error)>;
  using URLReply = std::function<void(NSURLRef url, NSErrorRef error)>;
  using FolderStateReply = std::function<void(bool isInSharedFolder, NSErrorRef error)>;
  using FolderInfoReply = std::function<void(
      bool isInSharedFolder, const std::optional<std::string>& folderName, NSErrorRef error)>;

  virtual ~QSFileProviderPandrelCollaboration() = default;

  virtual void fetchVersionAndCapabilitiesWithCompletionHandler(VersionReply reply) = 0;

  virtual void setEnvironmentType(std::uint64_t type);
  virtual NSProgressRef fetchCollaborationTokenWithCompletionHandler(TokenReply reply);
  virtual NSProgressRef fetchLatestRevisionWithCompletionHandler(ErrorReply reply);
  virtual NSProgressRef refreshSharingStateWithCompletionHandler(ErrorReply reply);
  virtual NSProgressRef fetchPrivacyStateWithCompletionHandler(PrivacyReply reply);
  virtual void documentIsInUseWithTimeout(double timeout);
  virtual void fetchFileProviderIdentifierWithCompletionHandler(StringReply reply);
  virtual void fetchURLForSharingFileWithCompletionHandler(URLReply reply);
  virtual NSProgressRef fetchFolderSharingStateWithCompletionHandler(FolderStateReply reply);
  virtual NSProgressRef fetchSharedFolderInfoWithCompletionHandler(FolderInfoReply reply);
};

template <>
NSXPCInterfaceRef NSXPCInterface::interfaceWithProtocol<QSFileProviderPandrelCollaboration>();

}  // namespace yomber
