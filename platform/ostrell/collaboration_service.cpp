#include "platform/ostrell/collaboration_service.h"

#include "platform/xpc/left_out_method.h"

namespace yomber {

void QSFileProviderPandrelCollaboration::setEnvironmentType(std::uint64_t /*type*/) {
  (void)NSXPCMethodIsLeftOut("setEnvironmentType:");
}

NSProgressRef QSFileProviderPandrelCollaboration::fetchCollaborationTokenWithCompletionHandler(
    TokenReply reply) {
  const auto error = NSXPCMethodIsLeftOut("fetchCollaborationTokenWithCompletionHandler:");
  if (reply) reply(std::nullopt, std::nullopt, std::nullopt, std::nullopt, error);
  return nullptr;
}

NSProgressRef QSFileProviderPandrelCollaboration::fetchLatestRevisionWithCompletionHandler(
    ErrorReply reply) {
  const auto error = NSXPCMethodIsLeftOut("fetchLatestRevisionWithCompletionHandler:");
  if (reply) reply(error);
  return nullptr;
}

NSProgressRef QSFileProviderPandrelCollaboration::refreshSharingStateWithCompletionHandler(
    ErrorReply reply) {
  const auto error = NSXPCMethodIsLeftOut("refreshSharingStateWithCompletionHandler:");
  if (reply) reply(error);
  return nullptr;
}

NSProgressRef QSFileProviderPandrelCollaboration::fetchPrivacyStateWithCompletionHandler(
    PrivacyReply reply) {
  const auto error = NSXPCMethodIsLeftOut("fetchPrivacyStateWithCompletionHandler:");
  if (reply) reply(false, false, nullptr, error);
  return nullptr;
}

void QSFileProviderPandrelCollaboration::documentIsInUseWithTimeout(double /*timeout*/) {
  (void)NSXPCMethodIsLeftOut("documentIsInUseWithTimeout:");
}

void QSFileProviderPandrelCollaboration::fetchFileProviderIdentifierWithCompletionHandler(
    StringReply reply) {
  const auto error = NSXPCMethodIsLeftOut("fetchFileProviderIdentifierWithCompletionHandler:");
  if (reply) reply(std::nullopt, error);
}

void QSFileProviderPandrelCollaboration::fetchURLForSharingFileWithCompletionHandler(
    URLReply reply) {
  const auto error = NSXPCMethodIsLeftOut("fetchURLForSharingFileWithCompletionHandler:");
  if (reply) reply(nullptr, error);
}

NSProgressRef QSFileProviderPandrelCollaboration::fetchFolderSharingStateWithCompletionHandler(
    FolderStateReply reply) {
  const auto error = NSXPCMethodIsLeftOut("fetchFolderSharingStateWithCompletionHandler:");
  if (reply) reply(false, error);
  return nullptr;
}

NSProgressRef QSFileProviderPandrelCollaboration::fetchSharedFolderInfoWithCompletionHandler(
    FolderInfoReply reply) {
  const auto error = NSXPCMethodIsLeftOut("fetchSharedFolderInfoWithCompletionHandler:");
  if (reply) reply(false, std::nullopt, error);
  return nullptr;
}

}  // namespace yomber
