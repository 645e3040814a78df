#include "platform/xpc/connection.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "platform/ipc/call.h"
#include "platform/ipc/gate.h"
#include "platform/xpc/connection_link.h"
#include "platform/xpc/test_workshop.capnp.h"
#include "platform/xpc/test_workshop.h"
#include "protocols/services.capnp.h"

namespace yomber::test {
namespace {

TEST(NSXPCConnection, CallsTheOtherSidesObject) {
  WorkshopConnection workshop;
  workshop.client->resume();
  EXPECT_EQ(workshop.addOne(41), 42U);
}

TEST(NSXPCConnection, TakesCallsBeforeTheOtherSideHasAccepted) {
  WorkshopConnection workshop;
  workshop.client->resume();
  const auto proxy = workshop.proxy();
  for (std::uint64_t i = 0; i < 100; ++i) proxy->note(i);
  const auto object = workshop.vendor->waitForObject();
  ASSERT_NE(object, nullptr);
  EXPECT_TRUE(object->waitForNotes(100));
}

TEST(NSXPCConnection, DeliversMessagesOneAfterTheOtherInTheirOrder) {
  WorkshopConnection workshop;
  workshop.client->resume();
  const auto proxy = workshop.proxy();
  constexpr std::uint64_t kCount = 2'000;
  std::vector<std::uint64_t> sent;
  for (std::uint64_t i = 0; i < kCount; ++i) {
    proxy->note(i);
    sent.push_back(i);
  }
  const auto object = workshop.vendor->waitForObject();
  ASSERT_TRUE(object->waitForNotes(kCount));
  EXPECT_EQ(object->notes(), sent);
}

TEST(NSXPCConnection, TakesRepliesInAnyOrder) {
  WorkshopConnection workshop;
  workshop.client->resume();
  ASSERT_EQ(workshop.addOne(0), 1U);
  const auto object = workshop.vendor->waitForObject();
  object->holdReplies();
  HandlerNotes replies;
  workshop.proxy()->addOne(1, [&](std::uint64_t value) { replies.note(std::to_string(value)); });
  ASSERT_TRUE(object->waitForHeldReplies(1));
  const auto proxy = workshop.proxy();
  proxy->measure("abc", [&](std::uint64_t value) { replies.note(std::to_string(value)); });
  ASSERT_TRUE(replies.waitFor(1));
  object->releaseReplies();
  ASSERT_TRUE(replies.waitFor(2));
  EXPECT_EQ(replies.all(), (std::vector<std::string>{"3", "2"}));
}

TEST(NSXPCConnection, AnswersAMethodThatIsLeftOutWithAnErrorAndStays) {
  WorkshopConnection workshop;
  workshop.client->resume();
  bool wasReplied = false;
  workshop.proxy()->polish(1, [&](std::uint64_t) { wasReplied = true; });
  workshop.proxy()->sweep();
  ASSERT_TRUE(workshop.failures->waitFor(2));
  EXPECT_EQ(workshop.failures->all(),
            (std::vector<std::string>{"NSCocoaErrorDomain 4101", "NSCocoaErrorDomain 4101"}));
  EXPECT_EQ(workshop.addOne(1), 2U);
  EXPECT_FALSE(wasReplied);
}

TEST(NSXPCConnection, AnswersACallOfAnotherInterfaceWithAnErrorAndStays) {
  WorkshopConnection workshop;
  workshop.client->resume();
  ASSERT_EQ(workshop.addOne(1), 2U);
  using Other = protocol::SharingService;
  const NSErrorRef error = ipc::callAndWait(
      workshop.client->link()->remote<Other>(), &Other::Client::fetchSharingInfoRequest,
      [](auto) {}, [](auto) {});
  EXPECT_EQ(domainAndCode(error), "NSCocoaErrorDomain 4101");
  EXPECT_EQ(workshop.addOne(2), 3U);
  EXPECT_TRUE(workshop.failures->all().empty());
}

TEST(NSXPCConnection, SaysWhichMethodIsLeftOut) {
  WorkshopConnection workshop;
  workshop.client->resume();
  HandlerNotes texts;
  workshop.client
      ->remoteObjectProxyWithErrorHandler<Workshop>(
          [&](const NSErrorRef& error) { texts.note(error->localizedDescription()); })
      ->polish(1, [](std::uint64_t) {});
  ASSERT_TRUE(texts.waitFor(1));
  EXPECT_NE(texts.all().front().find("polish"), std::string::npos) << texts.all().front();
}

TEST(NSXPCConnection, FailsTheOneMessageWhoseObjectThrows) {
  WorkshopConnection workshop;
  workshop.client->resume();
  workshop.proxy()->breakIt([](std::uint64_t) {});
  ASSERT_TRUE(workshop.failures->waitFor(1));
  EXPECT_EQ(workshop.failures->all().front(), "NSCocoaErrorDomain 4101");
  EXPECT_EQ(workshop.addOne(1), 2U);
}

TEST(NSXPCConnection, FailsAlsoTheMessageOfAMethodWithAProgress) {
  WorkshopConnection workshop;
  workshop.client->resume();
  const auto why = std::make_shared<HandlerNotes>();
  const auto proxy = workshop.client->remoteObjectProxyWithErrorHandler<Workshop>(
      [why](const NSErrorRef& error) { why->note(error->localizedDescription()); });
  const auto begin = [&](const std::string& name) {
    (void)proxy->work(name, [why](const NSErrorRef& error) { why->note(domainAndCode(error)); });
  };
  begin("broken");
  ASSERT_TRUE(why->waitFor(1));
  EXPECT_NE(why->all().back().find("it broke"), std::string::npos) << why->all().back();
  begin("odd");
  ASSERT_TRUE(why->waitFor(2));
  EXPECT_NE(why->all().back().find("no std::exception"), std::string::npos) << why->all().back();
  begin("broken late");
  ASSERT_TRUE(why->waitFor(3));
  EXPECT_EQ(why->all().back(), "workshop 7") << "what it answered before counts";
  EXPECT_EQ(workshop.addOne(1), 2U);
}

/// A connection whose object is busy with an earlier message until `free`.
struct BusyWorkshop : WorkshopConnection {
  BusyWorkshop() {
    client->resume();
    EXPECT_EQ(addOne(1), 2U);
    const auto served = vendor->connection().lock();
    EXPECT_NE(served, nullptr);
    if (served != nullptr) served->link()->queue()->async([gate = gate] { gate->wait(); });
  }
  ~BusyWorkshop() { free(); }
  BusyWorkshop(const BusyWorkshop&) = delete;
  BusyWorkshop& operator=(const BusyWorkshop&) = delete;
  void free() const { gate->open(); }
  /// Returns when the other side has seen all that was sent before.
  void roundTrip() const {
    EXPECT_EQ(ipc::callAndWait(
                  client->link()->remote<protocol::ServicePeer>(),
                  &protocol::ServicePeer::Client::cancelRequest, [](auto) {}, [](const auto&) {}),
              nullptr);
  }
  const std::shared_ptr<ipc::Gate> gate = std::make_shared<ipc::Gate>();
};

TEST(NSXPCConnection, AMessageThatWaitsIsNotForgottenWhenItsCallerGivesItUp) {
  BusyWorkshop workshop;
  using Service = WorkshopService::Client;
  constexpr int kCalls = 5;
  for (int i = 0; i < kCalls; ++i) {
    ipc::call(
        workshop.client->link()->remote<WorkshopService>(), &Service::measureRequest, [](auto) {},
        [](const NSErrorRef&, const auto*) {})
        .cancel();
  }
  for (int i = 0; i < 5; ++i) workshop.roundTrip();
  EXPECT_EQ(workshopMeasuresUnderWay(), kCalls) << "they count against what a peer may send";
  workshop.free();
  EXPECT_EQ(workshop.addOne(1), 2U) << "they were delivered before";
  for (int i = 0; i < 5; ++i) workshop.roundTrip();
  EXPECT_EQ(workshopMeasuresUnderWay(), 0);
}

TEST(NSXPCConnection, RefusesMessagesWhenTooManyWait) {
  BusyWorkshop workshop;
  const auto proxy = workshop.proxy();
  for (std::size_t i = 0; i < kMaximumWaitingMessages; ++i) proxy->note(i);
  workshop.roundTrip();
  EXPECT_TRUE(workshop.failures->all().empty());
  proxy->note(1);
  proxy->addOne(1, [](std::uint64_t) { ADD_FAILURE() << "it replied"; });
  ASSERT_TRUE(workshop.failures->waitFor(2));
  workshop.free();
  ASSERT_TRUE(workshop.vendor->waitForObject()->waitForNotes(kMaximumWaitingMessages));
  EXPECT_EQ(workshop.addOne(1), 2U) << "the connection stays";
  EXPECT_EQ(workshop.failures->all().size(), 2U);
}

TEST(NSXPCConnection, RefusesWhatIsTooLargeAndStays) {
  WorkshopConnection workshop;
  workshop.client->resume();
  workshop.proxy()->measure(std::string(std::size_t{65} << 20U, 'x'), [](std::uint64_t) {});
  ASSERT_TRUE(workshop.failures->waitFor(1));
  EXPECT_EQ(workshop.failures->all().front(), "NSCocoaErrorDomain 4101");
  EXPECT_EQ(workshop.addOne(1), 2U);
}

TEST(NSXPCConnection, CallsWithoutAnExportedObjectFailAndTheConnectionStays) {
  /// Resumes without exporting anything.
  class Silent final : public NSXPCListenerDelegate {
   public:
    bool listener(const NSXPCListenerRef&, const NSXPCConnectionRef& connection) override {
      connection->resume();
      return true;
    }
  };
  const auto silent = std::make_shared<Silent>();
  WorkshopConnection workshop;
  workshop.listener->setDelegate(silent);
  workshop.client->resume();
  workshop.proxy()->note(1);
  ASSERT_TRUE(workshop.failures->waitFor(1));
  EXPECT_EQ(workshop.failures->all().front(), "NSCocoaErrorDomain 4101");
  EXPECT_TRUE(workshop.handlers->all().empty());
}

TEST(NSXPCConnection, LetsTheListenersSideCallToo) {
  /// Calls what the client offers as soon as it has connected.
  class Caller final : public NSXPCListenerDelegate {
   public:
    bool listener(const NSXPCListenerRef&, const NSXPCConnectionRef& connection) override {
      connection->setRemoteObjectInterface(NSXPCInterface::interfaceWithProtocol<Workshop>());
      connection->resume();
      connection->remoteObjectProxyWithErrorHandler<Workshop>({})->note(7);
      return true;
    }
  };
  const auto caller = std::make_shared<Caller>();
  const auto object = std::make_shared<WorkshopObject>();
  WorkshopConnection workshop;
  workshop.listener->setDelegate(caller);
  workshop.client->setExportedInterface(NSXPCInterface::interfaceWithProtocol<Workshop>());
  workshop.client->setExportedObject<Workshop>(object);
  workshop.client->resume();
  EXPECT_TRUE(object->waitForNotes(1));
}

TEST(NSXPCConnection, CallsThatAreMadeTooEarlyFail) {
  WorkshopConnection workshop;
  workshop.proxy()->note(1);
  ASSERT_TRUE(workshop.failures->waitFor(1));
  EXPECT_EQ(workshop.failures->all().front(), "NSCocoaErrorDomain 4099");
  workshop.client->resume();
  EXPECT_EQ(workshop.addOne(1), 2U);
}

TEST(NSXPCConnection, LivesAsLongAsACallIsUnderWay) {
  WorkshopConnection workshop;
  workshop.client->resume();
  ASSERT_EQ(workshop.addOne(0), 1U);
  const auto object = workshop.vendor->waitForObject();
  object->holdReplies();
  ipc::Gate done;
  std::uint64_t answer = 0;
  workshop.proxy()->addOne(1, [&](std::uint64_t value) {
    answer = value;
    done.open();
  });
  workshop.client = nullptr;
  ASSERT_TRUE(object->waitForHeldReplies(1));
  object->releaseReplies();
  done.wait();
  EXPECT_EQ(answer, 2U);
  ASSERT_TRUE(workshop.vendor->handlers->waitFor(1));
  EXPECT_EQ(workshop.vendor->handlers->all(), (std::vector<std::string>{"invalidated"}))
      << "what nobody keeps says goodbye";
}

}  // namespace
}  // namespace yomber::test
