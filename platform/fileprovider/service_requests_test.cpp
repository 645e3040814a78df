#include "platform/fileprovider/service_requests.h"

#include <gtest/gtest.h>

#include <memory>
#include <optional>
#include <utility>
#include <vector>

#include "platform/xpc/listener_endpoint.h"

namespace yomber {
namespace {

/// Answers one and the same endpoint each time, which the test settles.
class OneEndpoint final : public NSFileProviderServiceSource {
 public:
  OneEndpoint() {
    ipc::UniqueFd end;
    EXPECT_TRUE(ipc::makeSocketPair(end, other_));
    endpoint_ = std::make_shared<NSXPCListenerEndpoint>(std::move(end), settlement);
  }
  NSFileProviderServiceName serviceName() const override { return "one"; }
  NSXPCListenerEndpointRef makeListenerEndpointAndReturnError(NSErrorRef* /*error*/) override {
    return endpoint_;
  }
  const std::shared_ptr<ListenerSettlement> settlement = std::make_shared<ListenerSettlement>();

 private:
  ipc::UniqueFd other_;
  NSXPCListenerEndpointRef endpoint_;
};

class OneServiceExtension final : public NSFileProviderExtension {
 public:
  std::vector<NSFileProviderServiceSourceRef> supportedServiceSourcesForItemIdentifier(
      const NSFileProviderItemIdentifier& /*identifier*/, NSErrorRef* /*error*/) override {
    return {source};
  }
  const std::shared_ptr<OneEndpoint> source = std::make_shared<OneEndpoint>();
};

TEST(ServiceRequests, RefuseMoreEndpointsThanMayWait) {
  OneServiceExtension extension;
  const auto isRefused = [&](std::uint32_t client, const char* whose) {
    const auto refused = vendServices(extension, "item", "one", client);
    EXPECT_TRUE(refused.services.empty()) << client;
    const std::string why = refused.error ? refused.error->localizedDescription() : std::string();
    return why.find("let go of") != std::string::npos && why.find(whose) != std::string::npos;
  };
  const auto clients =
      static_cast<std::uint32_t>(kMaximumWaitingEndpoints / kMaximumWaitingOfOneClient);
  for (std::uint32_t client = 0; client < clients; ++client) {
    for (std::size_t i = 0; i < kMaximumWaitingOfOneClient; ++i) {
      ASSERT_EQ(vendServices(extension, "item", std::nullopt, client).services.size(), 1U)
          << "client " << client << ", " << i;
    }
    if (client + 1 < clients) {
      EXPECT_TRUE(isRefused(client, "this program")) << "others keep their part";
    }
  }
  EXPECT_TRUE(isRefused(clients, "all programs together"));
  extension.source->settlement->settle();
  EXPECT_EQ(vendServices(extension, "item", "one", 0).services.size(), 1U) << "there is room again";
}

}  // namespace
}  // namespace yomber
