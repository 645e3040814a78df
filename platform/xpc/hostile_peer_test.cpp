// Whatever the other side sends: its own connection ends or goes on, and nothing else happens.

#include <gtest/gtest.h>

#include <cstdio>
#include <memory>
#include <string>

#include "platform/foundation/sanitized.h"
#include "platform/xpc/test_hostile_peer.h"
#include "platform/xpc/test_workshop.h"

namespace yomber::test {
namespace {

void callEachMethod(const NSXPCConnectionRef& client) {
  const auto proxy = client->remoteObjectProxyWithErrorHandler<Workshop>({});
  proxy->note(1);
  proxy->addOne(2, [](std::uint64_t) {});
  proxy->measure("some text", [](std::uint64_t) {});
  proxy->work("job", [](const NSErrorRef&) {})->cancel();
  proxy->polish(3, [](std::uint64_t) {});
}

TEST(HostilePeer, NothingThatIsSentHarmsOtherConnections) {
  // Sanitizers are ten times slower.
  const int rounds = kIsSanitized ? 100 : 1'000;
  if (kIsSanitized) {
    (void)std::printf("under a sanitizer: %d rounds instead of 1000\n", rounds);
  }
  WorkshopConnection bystander;
  bystander.client->resume();
  ASSERT_EQ(bystander.addOne(1), 2U);
  const std::string valid =
      recordedCalls(NSXPCInterface::interfaceWithProtocol<Workshop>(), callEachMethod);
  speakMutations(valid, rounds, [](const std::string& bytes) {
    const auto vendor = std::make_shared<WorkshopVendor>();
    speakTo(vendor, bytes);
    ASSERT_TRUE(vendor->handlers->waitFor(1)) << "the connection has ended";
  });
  EXPECT_EQ(bystander.addOne(2), 3U);
  EXPECT_TRUE(bystander.handlers->all().empty());
}

}  // namespace
}  // namespace yomber::test
