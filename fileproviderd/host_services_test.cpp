// Services of items through the host: asked for on the control socket, spoken to directly.

#include <gtest/gtest.h>
#include <signal.h>

#include <chrono>
#include <filesystem>
#include <string>
#include <thread>
#include <vector>

#include "fileproviderd/host_fixture.h"
#include "platform/fileprovider/errors.h"
#include "platform/fileprovider/services.h"
#include "platform/foundation/fault_points.h"
#include "platform/xpc/test_workshop.h"

namespace yomber {
namespace {

using test::HandlerNotes;
using test::Workshop;
using Notes = std::vector<std::string>;

constexpr const char* kService = "test.workshop";

/// A client's connection to the fake extension's one service, and what came of it.
struct Client {
  explicit Client(const NSFileProviderService& service) {
    NSErrorRef error;
    connection = service.fileProviderConnection(&error);
    EXPECT_NE(connection, nullptr) << error->description();
    if (connection == nullptr) return;
    connection->setRemoteObjectInterface(NSXPCInterface::interfaceWithProtocol<Workshop>());
    connection->setInterruptionHandler([notes = ends] { notes->note("interrupted"); });
    connection->setInvalidationHandler([notes = ends] { notes->note("invalidated"); });
    connection->resume();
    proxy = connection->remoteObjectProxyWithErrorHandler<Workshop>(
        [notes = answers](const NSErrorRef& failure) {
          notes->note(test::domainAndCode(failure));
        });
  }
  /// The last answer after one more call: a number, or the failure.
  std::string addOne(std::uint64_t value) {
    const std::size_t before = answers->all().size();
    proxy->addOne(value,
                  [notes = answers](std::uint64_t sum) { notes->note(std::to_string(sum)); });
    EXPECT_TRUE(answers->waitFor(before + 1));
    return answers->all().back();
  }

  NSXPCConnectionRef connection;
  std::shared_ptr<Workshop> proxy;
  const std::shared_ptr<HandlerNotes> ends = std::make_shared<HandlerNotes>();
  const std::shared_ptr<HandlerNotes> answers = std::make_shared<HandlerNotes>();
};

NSErrorRef interruption() {
  return NSError::errorWithDomain(NSCocoaErrorDomain, NSXPCConnectionInterrupted);
}

class HostServicesTest : public HostTest {
 protected:
  HostServicesTest() {
    command("root");
    setItems({{"item", 1}});
    startZarn();
    startHost();
  }
  NSFileProviderServiceRef service() {
    NSErrorRef error;
    auto found = services.serviceForItemIdentifier("item", kService, &error);
    EXPECT_NE(found, nullptr) << error->description();
    return found;
  }
  [[nodiscard]] std::size_t extensionDescriptors() const {
    const std::filesystem::directory_iterator all("/proc/" + std::to_string(status().extension) +
                                                  "/fd");
    return static_cast<std::size_t>(std::distance(all, std::filesystem::directory_iterator()));
  }

  const NSFileProviderServices services{paths};
};

TEST_F(HostServicesTest, AnItemsServicesAreHandedOut) {
  NSErrorRef error;
  const auto all = services.servicesForItemIdentifier("item", &error);
  EXPECT_EQ(error, nullptr);
  ASSERT_EQ(all.size(), 1U);
  EXPECT_EQ(all.front()->name(), kService);
  Client talker(*all.front());
  EXPECT_EQ(talker.addOne(1), "2");
}

TEST_F(HostServicesTest, AnItemWithoutServicesIsNoFailure) {
  NSErrorRef error;
  EXPECT_TRUE(services.servicesForItemIdentifier("other", &error).empty());
  EXPECT_EQ(error, nullptr);
}

TEST_F(HostServicesTest, AServiceThatAnItemDoesNotHaveIsAnErrorThatNamesBoth) {
  NSErrorRef error;
  EXPECT_EQ(services.serviceForItemIdentifier("item", "no.such.service", &error), nullptr);
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSFeatureUnsupportedError));
  EXPECT_NE(error->localizedDescription().find("no.such.service"), std::string::npos);
  EXPECT_NE(error->localizedDescription().find("item"), std::string::npos);
}

TEST_F(HostServicesTest, ANameThatIsTooLongIsRefused) {
  NSErrorRef error;
  EXPECT_EQ(services.serviceForItemIdentifier("item", std::string(5'000, 'n'), &error), nullptr);
  ASSERT_NE(error, nullptr);
  EXPECT_NE(error->localizedDescription().find("too long"), std::string::npos);
}

TEST_F(HostServicesTest, ConnectionsOutliveARequestThatLostZarn) {
  Client talker(*service());
  EXPECT_EQ(talker.addOne(1), "2");
  command("zarn-lost");
  NSErrorRef error;
  EXPECT_TRUE(services.servicesForItemIdentifier("item", &error).empty());
  EXPECT_EQ(test::domainAndCode(error), test::domainAndCode(interruption()));
  EXPECT_EQ(services.serviceForItemIdentifier("item", kService, &error), nullptr);
  EXPECT_EQ(test::domainAndCode(error), test::domainAndCode(interruption()));
  EXPECT_EQ(status().starts, 1U);
  EXPECT_EQ(talker.addOne(2), "3");
}

TEST_F(HostServicesTest, EachFurtherConnectionOfAServiceAsksTheHost) {
  const auto found = service();
  Client first(*found);
  Client second(*found);
  EXPECT_EQ(first.addOne(1), "2");
  EXPECT_EQ(second.addOne(2), "3");
  first.connection->invalidate();
  EXPECT_EQ(second.addOne(3), "4");
}

TEST_F(HostServicesTest, AConnectionComesWithoutWaitingToo) {
  const auto answered = std::make_shared<HandlerNotes>();
  service()->getFileProviderConnectionWithCompletionHandler(
      [answered](const NSXPCConnectionRef& connection, const NSErrorRef& error) {
        answered->note(connection != nullptr && error == nullptr ? "connected" : "failed");
      });
  ASSERT_TRUE(answered->waitFor(1));
  EXPECT_EQ(answered->all(), Notes{"connected"});
}

TEST_F(HostServicesTest, AKilledExtensionInterruptsItsClientsWhoAskAgain) {
  const auto found = service();
  Client talker(*found);
  ASSERT_EQ(talker.addOne(1), "2");
  constexpr std::size_t kCalls = 20;
  const auto replies = std::make_shared<HandlerNotes>();
  for (std::size_t i = 0; i < kCalls; ++i) {
    (void)talker.proxy->work("job " + std::to_string(i),
                             [replies](const NSErrorRef&) { replies->note("replied"); });
  }
  const pid_t killed = status().extension;
  ASSERT_EQ(kill(killed, SIGKILL), 0);
  ASSERT_TRUE(talker.ends->waitFor(2));
  EXPECT_EQ(talker.ends->all(), (Notes{"interrupted", "invalidated"}));
  Notes expected{"2"};
  expected.insert(expected.end(), kCalls, "NSCocoaErrorDomain 4097");
  EXPECT_EQ(talker.answers->all(), expected) << "each call failed once, before the handlers";
  EXPECT_TRUE(replies->all().empty());

  Client again(*found);
  EXPECT_EQ(again.addOne(5), "6");
  EXPECT_NE(status().extension, killed);
}

TEST_F(HostServicesTest, AServiceThatWasNotConnectedToOutlivesItsExtension) {
  const auto found = service();
  const pid_t killed = status().extension;
  ASSERT_EQ(kill(killed, SIGKILL), 0);
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(30);
  while (status().extension == killed) {
    ASSERT_LT(std::chrono::steady_clock::now(), deadline);
    std::this_thread::yield();
  }
  Client talker(*found);
  EXPECT_EQ(talker.addOne(1), "2");
  EXPECT_TRUE(talker.ends->all().empty());
}

TEST_F(HostServicesTest, AConnectionWithoutADescriptorIsAnErrorThatSaysSo) {
  ASSERT_EQ(FaultPoint::arm("xpc.endpoint.duplicate=error"), nullptr);
  const auto found = service();
  NSErrorRef error;
  EXPECT_EQ(found->fileProviderConnection(&error), nullptr);
  FaultPoint::disarmAll();
  ASSERT_NE(error, nullptr);
  EXPECT_NE(error->localizedDescription().find("raise the limit"), std::string::npos);
  Client talker(*found);
  EXPECT_EQ(talker.addOne(1), "2");
}

TEST_F(HostServicesTest, AnExtensionThatEndsWhileItIsAskedIsAskedAgain) {
  command("die-on-service");
  Client talker(*service());
  EXPECT_EQ(talker.addOne(1), "2");
  EXPECT_EQ(status().starts, 2U);
}

TEST_F(HostServicesTest, EndpointsThatNobodyUsesGoAway) {
  constexpr std::size_t kMany = 100;
  std::size_t during = 0;
  {
    std::vector<NSFileProviderServiceRef> held;
    for (std::size_t i = 0; i < kMany; ++i) held.push_back(service());
    during = extensionDescriptors();
    ASSERT_GE(during, kMany);
  }
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(30);
  while (extensionDescriptors() > during - kMany && std::chrono::steady_clock::now() < deadline) {
    std::this_thread::yield();
  }
  EXPECT_LE(extensionDescriptors(), during - kMany);
}

TEST(Services, SayThatADriveIsNotUp) {
  const NSFileProviderServices nowhere(DrivePaths::forHome("/nonexistent/drive"));
  NSErrorRef error;
  EXPECT_TRUE(nowhere.servicesForItemIdentifier("item", &error).empty());
  ASSERT_NE(error, nullptr);
  EXPECT_NE(error->localizedDescription().find("not up"), std::string::npos);
}

}  // namespace
}  // namespace yomber
