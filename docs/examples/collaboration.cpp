// Says what a program can do that edits a document of the drive together with others.
// Usage: collaboration IDENTIFIER   ("d:42"; `yomber id PATH` prints it)
#include <cstdio>
#include <future>

#include "platform/fileprovider/services.h"
#include "platform/ostrell/collaboration_service.h"

using namespace yomber;
using Collaboration = QSFileProviderPandrelCollaboration;

namespace {

/// Of each call either the reply or the error handler of its proxy is called, once.
NSErrorRef askForToken(NSXPCConnection& connection) {
  std::promise<NSErrorRef> outcome;
  const auto document = connection.remoteObjectProxyWithErrorHandler<Collaboration>(
      [&outcome](const NSErrorRef& lost) { outcome.set_value(lost); });
  (void)document->fetchCollaborationTokenWithCompletionHandler(
      [&outcome](const auto& provider, const auto& base, const auto& share, const auto& expiration,
                 const NSErrorRef& error) {
        if (provider && share && base && expiration)
          std::printf("%s\n%s\n%s\n", provider->c_str(), share->c_str(), base->c_str());
        outcome.set_value(error);
      });
  return outcome.get_future().get();
}

NSErrorRef askForCapabilities(NSXPCConnection& connection) {
  std::promise<NSErrorRef> outcome;
  connection
      .remoteObjectProxyWithErrorHandler<Collaboration>(
          [&outcome](const NSErrorRef& lost) { outcome.set_value(lost); })
      ->fetchVersionAndCapabilitiesWithCompletionHandler(
          [&outcome](std::uint64_t version, std::uint64_t can, const NSErrorRef& error) {
            std::printf("version %lu, capabilities %lu\n", version, can);
            outcome.set_value(error);
          });
  return outcome.get_future().get();
}

}  // namespace

int main(int argc, char** argv) {
  if (argc != 2) return 64;
  NSErrorRef error;
  const NSFileProviderServices drive(DrivePaths::forDefaultHome());
  const auto service = drive.serviceForItemIdentifier(argv[1], QSCollaborationServiceName, &error);
  const auto connection = service ? service->fileProviderConnection(&error) : nullptr;
  if (connection) {
    connection->setRemoteObjectInterface(NSXPCInterface::interfaceWithProtocol<Collaboration>());
    connection->resume();
    error = askForCapabilities(*connection);
    if (!error) error = askForToken(*connection);
    connection->invalidate();
  }
  if (error) std::fprintf(stderr, "collaboration: %s\n", error->localizedDescription().c_str());
  return error ? 1 : 0;
}
