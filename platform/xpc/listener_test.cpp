#include "platform/xpc/listener.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <memory>
#include <string>
#include <vector>

#include "platform/ipc/gate.h"
#include "platform/ipc/message_stream.h"
#include "platform/ipc/test_error_lines.h"
#include "platform/xpc/test_workshop.h"

namespace yomber::test {
namespace {

constexpr uid_t kNobody = 65534;

/// A listener that nobody knows the endpoint of yet.
struct Waiting {
  Waiting() : listener(NSXPCListener::anonymousListener()), endpoint(listener->endpoint()) {
    listener->setDelegate(vendor);
    listener->resume();
    endpoint->whenSettled([gate = settled] { gate->open(); });
  }
  std::shared_ptr<WorkshopVendor> vendor = std::make_shared<WorkshopVendor>();
  NSXPCListenerRef listener;
  NSXPCListenerEndpointRef endpoint;
  std::shared_ptr<ipc::Gate> settled = std::make_shared<ipc::Gate>();
};

TEST(NSXPCListener, HasOneEndpointWhileSomebodyHoldsIt) {
  const auto listener = NSXPCListener::anonymousListener();
  auto endpoint = listener->endpoint();
  ASSERT_NE(endpoint, nullptr);
  EXPECT_EQ(listener->endpoint(), endpoint);
  endpoint = nullptr;
  EXPECT_EQ(listener->endpoint(), nullptr);
}

TEST(NSXPCListener, IsSettledWhenItsClientHasConnected) {
  Waiting waiting;
  const auto client = NSXPCConnection::initWithListenerEndpoint(waiting.endpoint);
  client->resume();
  waiting.settled->wait();
  EXPECT_NE(waiting.vendor->waitForObject(), nullptr);
}

TEST(NSXPCListener, IsSettledWhenItsEndpointIsGone) {
  Waiting waiting;
  waiting.endpoint = nullptr;
  waiting.settled->wait();
  EXPECT_EQ(waiting.vendor->connection().lock(), nullptr);
}

TEST(NSXPCListener, IsSettledWhenItIsInvalidated) {
  Waiting waiting;
  EXPECT_FALSE(waiting.listener->isInvalidated());
  waiting.listener->invalidate();
  EXPECT_TRUE(waiting.listener->isInvalidated());
  waiting.settled->wait();
}

TEST(NSXPCListener, DroppingItInterruptsTheClientThatComesLater) {
  Waiting waiting;
  waiting.listener = nullptr;
  waiting.settled->wait();
  const auto notes = std::make_shared<HandlerNotes>();
  const auto client = NSXPCConnection::initWithListenerEndpoint(waiting.endpoint);
  client->setInterruptionHandler([notes] { notes->note("interrupted"); });
  client->setInvalidationHandler([notes] { notes->note("invalidated"); });
  client->resume();
  ASSERT_TRUE(notes->waitFor(2));
  EXPECT_EQ(notes->all(), (std::vector<std::string>{"interrupted", "invalidated"}));
}

TEST(NSXPCListener, InvalidatingItLeavesItsConnectionAlone) {
  WorkshopConnection workshop;
  workshop.client->resume();
  ASSERT_EQ(workshop.addOne(1), 2U);
  workshop.listener->invalidate();
  workshop.listener = nullptr;
  EXPECT_EQ(workshop.addOne(2), 3U);
}

TEST(NSXPCListener, RefusesOnesWithoutADelegate) {
  WorkshopConnection workshop;
  workshop.listener->setDelegate({});
  workshop.client->resume();
  ASSERT_TRUE(workshop.handlers->waitFor(1));
  EXPECT_EQ(workshop.handlers->all(), (std::vector<std::string>{"invalidated"}));
}

TEST(NSXPCListener, HoldsItsDelegateWeakly) {
  const auto listener = NSXPCListener::anonymousListener();
  auto vendor = std::make_shared<WorkshopVendor>();
  const std::weak_ptr<WorkshopVendor> weak = vendor;
  listener->setDelegate(vendor);
  vendor = nullptr;
  EXPECT_TRUE(weak.expired());
}

TEST(NSXPCListener, HasItsHalfOfTheHandshakeWaitInTheSocket) {
  Waiting waiting;
  char byte = 0;
  EXPECT_EQ(::recv(waiting.endpoint->descriptor(), &byte, 1, MSG_PEEK | MSG_DONTWAIT), 1);
}

TEST(NSXPCListener, RefusesWhoBeginsWithAnythingElse) {
  Waiting waiting;
  const ipc::UniqueFd stranger = waiting.endpoint->takeSocket();
  ASSERT_EQ(::send(stranger.get(), "XXXX", 4, MSG_NOSIGNAL), 4);
  waiting.settled->wait();
  EXPECT_EQ(waiting.vendor->connection().lock(), nullptr) << "the delegate heard of it";
  char bytes[16];
  while (::recv(stranger.get(), bytes, sizeof bytes, 0) > 0) {
  }
}

TEST(NSXPCListener, RefusesAnotherUser) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root to become another user";
  const ipc::test::ErrorLines errors;
  Waiting waiting;
  const int descriptor = waiting.endpoint->descriptor();
  const pid_t child = ::fork();
  if (child == 0) {
    if (::setgid(kNobody) != 0 || ::setuid(kNobody) != 0) ::_exit(99);
    if (ipc::MessageStream::sendCredentials(descriptor) != 0) ::_exit(1);
    char byte = 0;
    ssize_t count = 0;
    do {
      count = ::recv(descriptor, &byte, 1, 0);
    } while (count > 0);
    ::_exit(0);  // disconnected
  }
  waiting.endpoint = nullptr;
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  EXPECT_EQ(WEXITSTATUS(status), 0);
  waiting.settled->wait();
  EXPECT_EQ(waiting.vendor->connection().lock(), nullptr) << "the delegate heard of him";
  // The line comes before the settling.
  EXPECT_TRUE(errors.has("process " + std::to_string(child) + ", belongs to user " +
                         std::to_string(kNobody) + " and was refused"));
}

}  // namespace
}  // namespace yomber::test
