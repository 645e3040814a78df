// Says who has an item of the drive, and prints the link by which others get it.
// Usage: sharing IDENTIFIER   ("d:42"; `yomber id PATH` prints it)
#include <cstdio>
#include <future>

#include "platform/fileprovider/services.h"
#include "platform/ostrell/sharing_service.h"

using namespace yomber;

namespace {

void print(const RZShare& share) {
  for (const auto& person : share.participants()) std::printf("%s\n", person.userName.c_str());
  std::printf("%s\n", share.URL().value_or("not shared").c_str());
}

/// Of each call either the reply or the error handler of its proxy is called, once.
NSErrorRef askForShare(NSXPCConnection& connection) {
  std::promise<NSErrorRef> outcome;
  const auto item = connection.remoteObjectProxyWithErrorHandler<QSSharingServiceV1>(
      [&outcome](const NSErrorRef& lost) { outcome.set_value(lost); });
  (void)item->fetchShareWithCompletion(
      [&outcome](const RZShareRef& share, const NSErrorRef& error) {
        if (share) print(*share);
        outcome.set_value(error);
      });
  return outcome.get_future().get();
}

}  // namespace

int main(int argc, char** argv) {
  if (argc != 2) return 64;
  NSErrorRef error;
  const NSFileProviderServices drive(DrivePaths::forDefaultHome());
  const auto service = drive.serviceForItemIdentifier(argv[1], QSSharingServiceName, &error);
  const auto connection = service ? service->fileProviderConnection(&error) : nullptr;
  if (connection) {
    connection->setRemoteObjectInterface(getSharingServiceInterface());
    connection->resume();
    error = askForShare(*connection);
    connection->invalidate();
  }
  if (error) std::fprintf(stderr, "sharing: %s\n", error->localizedDescription().c_str());
  return error ? 1 : 0;
}
