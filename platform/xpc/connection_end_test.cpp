// How connections end: on purpose, or with the other process.

#include <gtest/gtest.h>
#include <sys/socket.h>

#include <chrono>
#include <cstring>
#include <string>
#include <vector>

#include "platform/ipc/awaited_peer.h"
#include "platform/ipc/event_loop.h"
#include "platform/ipc/gate.h"
#include "platform/ipc/message_stream.h"
#include "platform/xpc/connection_link.h"
#include "platform/xpc/test_workshop.h"

namespace yomber::test {
namespace {

using Notes = std::vector<std::string>;

/// A client's connection whose other end is a bare socket of the test's.
struct BareEnd {
  BareEnd() {
    ipc::UniqueFd theirs;
    EXPECT_TRUE(ipc::makeSocketPair(socket, theirs));
    client = NSXPCConnection::initWithListenerEndpoint(
        std::make_shared<NSXPCListenerEndpoint>(std::move(theirs)));
    client->setRemoteObjectInterface(NSXPCInterface::interfaceWithProtocol<Workshop>());
    client->setInterruptionHandler([notes = handlers] { notes->note("interrupted"); });
    client->setInvalidationHandler([notes = handlers] { notes->note("invalidated"); });
  }
  std::shared_ptr<Workshop> proxy() {
    return client->remoteObjectProxyWithErrorHandler<Workshop>(
        [notes = failures](const NSErrorRef& error) { notes->note(domainAndCode(error)); });
  }

  ipc::UniqueFd socket;
  NSXPCConnectionRef client;
  const std::shared_ptr<HandlerNotes> handlers = std::make_shared<HandlerNotes>();
  const std::shared_ptr<HandlerNotes> failures = std::make_shared<HandlerNotes>();
};

TEST(ConnectionEnd, InvalidatingTellsBothSidesOnce) {
  WorkshopConnection workshop;
  workshop.client->resume();
  ASSERT_EQ(workshop.addOne(1), 2U);
  workshop.client->invalidate();
  workshop.client->invalidate();
  ASSERT_TRUE(workshop.handlers->waitFor(1));
  ASSERT_TRUE(workshop.vendor->handlers->waitFor(1));
  workshop.client->link()->queue()->sync([] {});
  EXPECT_EQ(workshop.handlers->all(), Notes{"invalidated"});
  EXPECT_EQ(workshop.vendor->handlers->all(), Notes{"invalidated"});
}

TEST(ConnectionEnd, TheListenersSideCanSayGoodbyeToo) {
  WorkshopConnection workshop;
  workshop.client->resume();
  ASSERT_EQ(workshop.addOne(1), 2U);
  const auto served = workshop.vendor->connection().lock();
  ASSERT_NE(served, nullptr);
  served->invalidate();
  ASSERT_TRUE(workshop.handlers->waitFor(1));
  ASSERT_TRUE(workshop.vendor->handlers->waitFor(1));
  EXPECT_EQ(workshop.handlers->all(), Notes{"invalidated"});
  EXPECT_EQ(workshop.vendor->handlers->all(), Notes{"invalidated"});
  NSErrorRef error;
  EXPECT_EQ(workshop.addOne(1, &error), 0U);
  EXPECT_EQ(domainAndCode(error), "NSCocoaErrorDomain 4099");
}

TEST(ConnectionEnd, InvalidatingBeforeResumingTellsBothSides) {
  WorkshopConnection workshop;
  workshop.client->invalidate();
  ASSERT_TRUE(workshop.handlers->waitFor(1));
  ASSERT_TRUE(workshop.vendor->handlers->waitFor(1));
  EXPECT_EQ(workshop.handlers->all(), Notes{"invalidated"});
  EXPECT_EQ(workshop.vendor->handlers->all(), Notes{"invalidated"});
}

TEST(ConnectionEnd, ARefusedClientIsInvalidAndNotInterrupted) {
  WorkshopConnection workshop;
  workshop.vendor->accepts = false;
  workshop.client->resume();
  workshop.proxy()->note(1);
  ASSERT_TRUE(workshop.handlers->waitFor(1));
  EXPECT_EQ(workshop.handlers->all(), Notes{"invalidated"});
}

TEST(ConnectionEnd, ADeathIsAnInterruptionThenAnInvalidation) {
  BareEnd end;
  end.client->resume();
  end.proxy()->addOne(1, [](std::uint64_t) { ADD_FAILURE() << "nobody answered"; });
  end.socket.reset();
  ASSERT_TRUE(end.handlers->waitFor(2));
  EXPECT_EQ(end.handlers->all(), (Notes{"interrupted", "invalidated"}));
  ASSERT_TRUE(end.failures->waitFor(1));
  EXPECT_EQ(end.failures->all(), Notes{"NSCocoaErrorDomain 4097"});
}

TEST(ConnectionEnd, AnInterruptionHandlerThatInvalidatesChangesNothing) {
  BareEnd end;
  end.client->setInterruptionHandler(
      [notes = end.handlers, weak = std::weak_ptr<NSXPCConnection>(end.client)] {
        notes->note("interrupted");
        if (const auto connection = weak.lock()) connection->invalidate();
      });
  end.client->resume();
  end.socket.reset();
  ASSERT_TRUE(end.handlers->waitFor(2));
  end.client->link()->queue()->sync([] {});
  EXPECT_EQ(end.handlers->all(), (Notes{"interrupted", "invalidated"}));
}

TEST(ConnectionEnd, EveryCallUnderWayFailsOnceBeforeTheHandlers) {
  WorkshopConnection workshop;
  workshop.client->resume();
  ASSERT_EQ(workshop.addOne(0), 1U);
  const auto object = workshop.vendor->waitForObject();
  object->holdReplies();
  const auto order = std::make_shared<HandlerNotes>();
  workshop.client->setInvalidationHandler([order] { order->note("invalidated"); });
  constexpr std::size_t kCalls = 50;
  const auto proxy = workshop.client->remoteObjectProxyWithErrorHandler<Workshop>(
      [order](const NSErrorRef& error) { order->note(domainAndCode(error)); });
  for (std::size_t i = 0; i < kCalls; ++i) proxy->addOne(i, [](std::uint64_t) {});
  ASSERT_TRUE(object->waitForHeldReplies(kCalls));
  workshop.vendor->connection().lock()->invalidate();
  ASSERT_TRUE(order->waitFor(kCalls + 1));
  Notes expected(kCalls, "NSCocoaErrorDomain 4099");
  expected.emplace_back("invalidated");
  EXPECT_EQ(order->all(), expected);
  object->releaseReplies();
  workshop.client->link()->queue()->sync([] {});
  EXPECT_EQ(order->all(), expected) << "replies after the end are dropped";
}

TEST(ConnectionEnd, CallsAfterTheEndFailAtOnce) {
  BareEnd end;
  end.client->resume();
  end.socket.reset();
  ASSERT_TRUE(end.handlers->waitFor(2));
  end.proxy()->note(1);
  ASSERT_TRUE(end.failures->waitFor(1));
  EXPECT_EQ(end.failures->all(), Notes{"NSCocoaErrorDomain 4099"});
}

TEST(ConnectionEnd, HandlersAndErrorsComeOnTheConnectionsQueue) {
  BareEnd end;
  const auto queue = end.client->link()->queue();
  const auto where = std::make_shared<HandlerNotes>();
  const auto note = [where, queue](const char* what) {
    where->note(std::string(what) + (queue->isCurrent() ? " there" : " elsewhere"));
  };
  end.client->setInterruptionHandler([note] { note("interruption"); });
  end.client->setInvalidationHandler([note] { note("invalidation"); });
  end.client->resume();
  end.client
      ->remoteObjectProxyWithErrorHandler<Workshop>([note](const NSErrorRef&) { note("error"); })
      ->note(1);
  end.socket.reset();
  ASSERT_TRUE(where->waitFor(3));
  EXPECT_EQ(where->all(), (Notes{"error there", "interruption there", "invalidation there"}));
}

TEST(ConnectionEnd, GarbageEndsTheConnectionAndNothingElse) {
  BareEnd end;
  ASSERT_EQ(ipc::MessageStream::sendCredentials(end.socket.get()), 0);
  const std::string garbage(4096, '\xff');
  ASSERT_EQ(::send(end.socket.get(), garbage.data(), garbage.size(), MSG_NOSIGNAL),
            static_cast<ssize_t>(garbage.size()));
  end.client->resume();
  ASSERT_TRUE(end.handlers->waitFor(2));
  EXPECT_EQ(end.handlers->all(), (Notes{"interrupted", "invalidated"}));
}

TEST(ConnectionEnd, TheExportedObjectGoesWithItsConnection) {
  WorkshopConnection workshop;
  workshop.client->resume();
  ASSERT_EQ(workshop.addOne(1), 2U);
  std::weak_ptr<WorkshopObject> object = workshop.vendor->waitForObject();
  workshop.vendor->forgetObjects();
  EXPECT_FALSE(object.expired()) << "the connection keeps it";
  const auto served = workshop.vendor->connection();
  workshop.client->invalidate();
  ASSERT_TRUE(workshop.vendor->handlers->waitFor(1));
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(30);
  while (!object.expired() || !served.expired()) {
    ASSERT_LT(std::chrono::steady_clock::now(), deadline) << "somebody keeps them";
    if (const auto connection = served.lock()) connection->link()->queue()->sync([] {});
  }
}

/// Has the loop observe a descriptor, which it then cannot a second time.
class Observed {
 public:
  explicit Observed(int descriptor) {
    ipc::EventLoop::shared().runAndWait([&] {
      observer_ =
          kj::heap<Observer>(ipc::EventLoop::shared().port(), descriptor, Observer::OBSERVE_READ);
    });
  }
  ~Observed() {
    ipc::EventLoop::shared().runAndWait([this] {
      // The descriptor is closed by now, and the loop forgot it with that.
      (void)kj::runCatchingExceptions([this] { observer_ = nullptr; });
    });
  }
  Observed(const Observed&) = delete;
  Observed& operator=(const Observed&) = delete;

 private:
  using Observer = kj::UnixEventPort::FdObserver;
  kj::Own<Observer> observer_;
};

TEST(ConnectionEnd, ASocketThatCannotBeObservedIsLost) {
  for (const bool isAccepted : {true, false}) {
    SCOPED_TRACE(isAccepted ? "accepted" : "adopted");
    ipc::UniqueFd ours;
    ipc::UniqueFd theirs;
    ASSERT_TRUE(ipc::makeSocketPair(ours, theirs));
    const Observed taken(ours.get());
    const auto notes = std::make_shared<HandlerNotes>();
    const auto connection = isAccepted
                                ? NSXPCConnection::accepted(std::move(ours))
                                : NSXPCConnection::initWithListenerEndpoint(
                                      std::make_shared<NSXPCListenerEndpoint>(std::move(ours)));
    connection->setRemoteObjectInterface(NSXPCInterface::interfaceWithProtocol<Workshop>());
    connection->setInterruptionHandler([notes] { notes->note("interrupted"); });
    connection->setInvalidationHandler([notes] { notes->note("invalidated"); });
    connection->resume();
    const auto failures = std::make_shared<HandlerNotes>();
    connection
        ->remoteObjectProxyWithErrorHandler<Workshop>(
            [failures](const NSErrorRef&) { failures->note("failed"); })
        ->note(1);
    ASSERT_TRUE(notes->waitFor(2));
    EXPECT_EQ(notes->all(), (Notes{"interrupted", "invalidated"}));
    EXPECT_TRUE(failures->waitFor(1));
  }
}

TEST(ConnectionEnd, WhoCannotWaitForAPeerIsTold) {
  ipc::UniqueFd ours;
  ipc::UniqueFd theirs;
  ASSERT_TRUE(ipc::makeSocketPair(ours, theirs));
  const Observed taken(ours.get());
  const auto heard = std::make_shared<HandlerNotes>();
  const auto awaited = ipc::AwaitedPeer::await(
      std::move(ours), [heard](const ipc::UniqueFd& socket, const NSErrorRef& error) {
        heard->note(domainAndCode(error) + (socket ? " with a socket" : ""));
      });
  ASSERT_NE(awaited, nullptr);
  ASSERT_TRUE(heard->waitFor(1));
  EXPECT_EQ(heard->all(), Notes{"NSCocoaErrorDomain 4099"});
}

TEST(ConnectionEnd, AnEndpointIsGoodForOneConnection) {
  WorkshopConnection workshop;
  const auto endpoint = NSXPCListener::anonymousListener()->endpoint();
  ASSERT_TRUE(endpoint->isUsable());
  const auto first = NSXPCConnection::initWithListenerEndpoint(endpoint);
  const auto second = NSXPCConnection::initWithListenerEndpoint(endpoint);
  first->resume();
  EXPECT_FALSE(endpoint->isUsable());
  const auto notes = std::make_shared<HandlerNotes>();
  const auto failures = std::make_shared<HandlerNotes>();
  second->setRemoteObjectInterface(NSXPCInterface::interfaceWithProtocol<Workshop>());
  second->setInterruptionHandler([notes] { notes->note("interrupted"); });
  second->setInvalidationHandler([notes] { notes->note("invalidated"); });
  second->resume();
  ASSERT_TRUE(notes->waitFor(1));
  EXPECT_EQ(notes->all(), Notes{"invalidated"});
  second
      ->remoteObjectProxyWithErrorHandler<Workshop>([failures](const NSErrorRef& error) {
        failures->note(domainAndCode(error) + " " + error->localizedDescription());
      })
      ->note(1);
  ASSERT_TRUE(failures->waitFor(1));
  EXPECT_NE(failures->all().front().find("ask for a new one"), std::string::npos)
      << failures->all().front();
}

}  // namespace
}  // namespace yomber::test
