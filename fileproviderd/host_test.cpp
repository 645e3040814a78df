#include "fileproviderd/host.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>

#include <cerrno>
#include <chrono>
#include <future>
#include <memory>

#include "fileproviderd/host_fixture.h"
#include "platform/fileprovider/constants.h"
#include "platform/foundation/stopped_process.h"
#include "platform/ipc/call.h"

namespace yomber {
namespace {

using namespace std::chrono_literals;
using Versions = std::map<std::string, std::uint64_t>;

Versions manyItems(int count) {
  Versions items;
  for (int i = 0; i < count; ++i) items["d:" + std::to_string(100'000 + i)] = 1;
  return items;
}

auto holds(const Versions& versions) {
  return [versions](const WatchedPicture& picture) {
    return picture.isListed && picture.versions == versions;
  };
}

/// Asks for a page, and takes that back before one came.
void callNextAndCancel(const ipc::Remote<protocol::Listing>& listing) {
  auto ended = std::make_shared<std::promise<NSErrorRef>>();
  const auto handle = ipc::call(
      listing, &protocol::Listing::Client::nextRequest, [](auto) {},
      [ended](const NSErrorRef& error, const protocol::Listing::NextResults::Reader*) {
        ended->set_value(error);
      });
  handle.cancel();
  const NSErrorRef error = ended->get_future().get();
  ASSERT_NE(error, nullptr) << "a page has come before";
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSUserCancelledError));
}

TEST_F(HostTest, AnswersLookupsThroughTheExtension) {
  startZarn();
  startHost();
  ItemFields found;
  ASSERT_EQ(item("a", &found), nullptr);
  EXPECT_EQ(found.filename, "name of a");
  std::string text;
  ASSERT_EQ(locate("b", &text), nullptr);
  EXPECT_EQ(text, "/root/b");
  ASSERT_EQ(identify("/root/c", &text), nullptr);
  EXPECT_EQ(text, "c");
}

TEST_F(HostTest, TellsMissingItemsFromMissingDaemons) {
  startZarn();
  startHost();
  for (const auto& error : {item("nothing"), locate("nothing"), identify("/root/nothing")}) {
    ASSERT_NE(error, nullptr);
    EXPECT_TRUE(error->is(NSFileProviderErrorDomain, NSFileProviderErrorNoSuchItem));
  }
  stopZarn();
  ASSERT_TRUE(waitForStatus([](const Status& status) { return !status.daemonReachable; }));
  const auto error = item("nothing");
  ASSERT_NE(error, nullptr);
  EXPECT_EQ(error->localizedDescription(), "zarn is not running: start the drive with 'yomber up'");
  EXPECT_TRUE(
      error->underlyingError()->is(NSFileProviderErrorDomain, NSFileProviderErrorNoSuchItem));
}

TEST_F(HostTest, SignedOutEveryLookupSaysSo) {
  startZarn();
  startHost();
  command("signed-out");
  for (const auto& error : {item("a"), locate("a"), identify("/root/a"), identify("/root/none")}) {
    ASSERT_NE(error, nullptr);
    EXPECT_TRUE(error->is(NSFileProviderErrorDomain, NSFileProviderErrorNotAuthenticated))
        << error->description();
  }
  countermand("signed-out");
  EXPECT_EQ(identify("/root/a"), nullptr);
}

TEST_F(HostTest, RefusesWhatIsTooLong) {
  startZarn();
  startHost();
  EXPECT_TRUE(item(std::string(5'000, 'x'))->is(NSPOSIXErrorDomain, EINVAL));
  EXPECT_TRUE(identify("/" + std::string(5'000, 'x'))->is(NSPOSIXErrorDomain, EINVAL));
}

TEST_F(HostTest, ListsPageByPageInOrder) {
  startZarn();
  startHost();
  const auto items = manyItems(1'050);
  setItems(items);
  const auto listing = list("i:1");
  std::vector<std::string> identifiers;
  bool more = true;
  int pages = 0;
  for (; more; ++pages) {
    const auto before = identifiers.size();
    ASSERT_EQ(next(listing, &identifiers, &more), nullptr);
    EXPECT_LE(identifiers.size() - before, 200U);
  }
  EXPECT_EQ(pages, 6);
  std::vector<std::string> expected;
  for (const auto& [identifier, version] : items) expected.push_back(identifier);
  EXPECT_EQ(identifiers, expected);
  EXPECT_EQ(next(listing, &identifiers, &more), nullptr) << "after the end there is nothing";
  EXPECT_FALSE(more);
  EXPECT_EQ(identifiers.size(), expected.size());
}

TEST_F(HostTest, GivesTheExtensionItsSocketAndNothingElse) {
  startZarn();
  startHost();
  ItemFields self;
  ASSERT_EQ(item("self", &self), nullptr);
  // No input, the host's output and error, the socket; and the signal.
  EXPECT_THAT(self.filename, testing::MatchesRegex("n..s/9"));
}

TEST_F(HostTest, StartsNothingUntilItIsNeeded) {
  startZarn();
  startHost();
  ASSERT_TRUE(waitForStatus([](const Status& status) { return status.daemonReachable; }));
  EXPECT_EQ(status().starts, 0U);
  EXPECT_EQ(item("a"), nullptr);
  EXPECT_EQ(status().starts, 1U);
}

TEST_F(HostTest, WithoutZarnEveryCallSaysWhatToDo) {
  startHost();
  std::vector<std::string> none;
  for (const auto& error : {item("a"), locate("a"), identify("/root/a"), listAll("i:1", &none)}) {
    ASSERT_NE(error, nullptr);
    EXPECT_EQ(error->localizedDescription(),
              "zarn is not running: start the drive with 'yomber up'");
  }
  EXPECT_EQ(status().starts, 0U) << "the extension is started only when zarn answers";
  startZarn();
  EXPECT_EQ(item("a"), nullptr) << "it is tried again with each call";
}

TEST_F(HostTest, StartsTheExtensionAfreshWhileTheRootIsUnknown) {
  startZarn();
  countermand("root");
  startHost([](Host::Options& options) { options.supervision.acquire = 1s; });
  const auto error = locate("a");
  ASSERT_NE(error, nullptr);
  EXPECT_THAT(error->localizedDescription(), testing::HasSubstr("root"));
  EXPECT_GT(status().starts, 1U);
  command("root");
  EXPECT_EQ(locate("a"), nullptr);
}

TEST_F(HostTest, AKilledExtensionIsReplacedAndReaped) {
  startZarn();
  startHost();
  ASSERT_EQ(item("a"), nullptr);
  const auto first = status().extension;
  ASSERT_GT(first, 0);
  ASSERT_EQ(kill(first, SIGKILL), 0);
  EXPECT_EQ(item("b"), nullptr) << "the request is made again with the next one";
  EXPECT_NE(status().extension, first);
  EXPECT_EQ(kill(first, 0), -1) << "a zombie";
  EXPECT_EQ(errno, ESRCH);
}

TEST_F(HostTest, AnExtensionThatLostZarnIsNotTakenForLostItself) {
  startZarn();
  startHost();
  ASSERT_EQ(item("a"), nullptr);
  const auto healthy = status().extension;
  command("zarn-lost");
  for (const auto& error : {item("a"), locate("nothing"), identify("/root/nothing")}) {
    ASSERT_NE(error, nullptr);
    EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSXPCConnectionInterrupted)) << error->description();
  }
  EXPECT_EQ(status().starts, 1U);
  EXPECT_EQ(status().extension, healthy);
  countermand("zarn-lost");
  EXPECT_EQ(item("a"), nullptr);
}

TEST_F(HostTest, AListingIsWholeForWhoCallsAgainAfterCancelling) {
  startZarn();
  countermand("root");
  startHost();
  const auto items = manyItems(450);
  setItems(items);
  const auto listing = list("i:1");
  for (int i = 0; i < 2; ++i) callNextAndCancel(listing);
  (void)status();  // it follows the last cancellation
  command("root");
  std::vector<std::string> listed;
  bool more = true;
  while (more) ASSERT_EQ(next(listing, &listed, &more), nullptr);
  std::vector<std::string> expected;
  for (const auto& [identifier, version] : items) expected.push_back(identifier);
  EXPECT_EQ(listed, expected);
}

TEST_F(HostTest, CancelledCallsForPagesTakeNobodysPlace) {
  startZarn();
  countermand("root");
  startHost();
  const auto listing = list("i:1");
  constexpr int kMoreThanMayWait = 40;
  for (int i = 0; i < kMoreThanMayWait; ++i) callNextAndCancel(listing);
  (void)status();  // it follows the last cancellation
  command("root");
  std::vector<std::string> listed;
  EXPECT_EQ(next(listing, &listed), nullptr);
  EXPECT_EQ(listed, (std::vector<std::string>{"a", "b", "c"}));
}

TEST_F(HostTest, AnExtensionThatDiesInMidListingEndsTheListingClearly) {
  startZarn();
  startHost();
  setItems(manyItems(1'000));
  const auto listing = list("i:1");
  ASSERT_EQ(next(listing), nullptr);
  command("die-on-page");
  NSErrorRef error;
  for (int page = 0; page < 5 && error == nullptr; ++page) error = next(listing);
  ASSERT_NE(error, nullptr);
  EXPECT_THAT(error->localizedDescription(), testing::HasSubstr("extension"));
  EXPECT_NE(next(listing), nullptr) << "it stays ended";
  countermand("die-on-page");
  std::vector<std::string> identifiers;
  EXPECT_EQ(listAll("i:1", &identifiers), nullptr);
  EXPECT_EQ(identifiers.size(), 1'000U);
}

TEST_F(HostTest, AStuckExtensionIsEndedAndReplaced) {
  startZarn();
  startHost([](Host::Options& options) {
    options.callLimit = 300ms;
    options.supervision.answer = 300ms;
  });
  ASSERT_EQ(item("a"), nullptr);
  const auto stuck = status().extension;
  const StoppedProcess stopped(static_cast<pid_t>(stuck));
  const auto error = item("a");
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSXPCConnectionTimedOut));
  ASSERT_TRUE(waitForStatus([&](const Status& now) { return now.extension != stuck; }));
  EXPECT_EQ(item("a"), nullptr);
}

TEST_F(HostTest, AHangingRequestIsGivenUpInTime) {
  startZarn();
  startHost([](Host::Options& options) {
    options.callLimit = 300ms;
    options.supervision.answer = 300ms;
  });
  ASSERT_EQ(item("a"), nullptr);
  command("hang");
  const auto listing = list("i:1");
  EXPECT_NE(next(listing), nullptr);
  EXPECT_NE(item("a"), nullptr);
  countermand("hang");
  std::vector<std::string> identifiers;
  ASSERT_TRUE(waitForStatus([this](const Status&) { return item("a") == nullptr; }));
}

TEST_F(HostTest, AWatchFollowsSignalsOfTheExtension) {
  startZarn();
  startHost();
  ipc::Remote<protocol::Watch> registration;
  const auto picture = watch("i:1", &registration);
  ASSERT_TRUE(picture->waitFor(holds({{"a", 1}, {"b", 1}, {"c", 1}})));
  setItems({{"a", 2}, {"c", 1}, {"d", 1}});
  signalFromExtension("i:1");
  EXPECT_TRUE(picture->waitFor(holds({{"a", 2}, {"c", 1}, {"d", 1}})));
  EXPECT_EQ(status().watches, 1U);
  EXPECT_EQ(status().enumerators, 1U);
  registration = nullptr;
  EXPECT_TRUE(
      waitForStatus([](const Status& now) { return now.watches == 0 && now.enumerators == 0; }));
}

TEST_F(HostTest, AWatchFollowsSignalsThatZarnRaisesItself) {
  startZarn();
  startHost();
  ipc::Remote<protocol::Watch> registration;
  const auto picture = watch(NSFileProviderWorkingSetContainerItemIdentifier, &registration);
  ASSERT_TRUE(picture->waitFor(holds({{"a", 1}, {"b", 1}, {"c", 1}})));
  setItems({{"a", 5}});
  signalFromZarn(NSFileProviderWorkingSetContainerItemIdentifier);
  EXPECT_TRUE(picture->waitFor(holds({{"a", 5}})));
}

TEST_F(HostTest, AWatchSurvivesTheExtensionAgainAndAgain) {
  startZarn();
  startHost([](Host::Options& options) { options.supervision.stable = 0ms; });
  ipc::Remote<protocol::Watch> registration;
  const auto picture = watch("i:1", &registration);
  ASSERT_TRUE(picture->waitFor(holds({{"a", 1}, {"b", 1}, {"c", 1}})));
  std::uint32_t descriptors = 0;
  for (std::uint64_t round = 2; round < 12; ++round) {
    const auto pid = status().extension;
    setItems({{"a", round}, {"r" + std::to_string(round), 1}});
    ASSERT_GT(pid, 0);
    ASSERT_EQ(kill(pid, SIGKILL), 0);
    ASSERT_TRUE(picture->waitFor(holds({{"a", round}, {"r" + std::to_string(round), 1}})))
        << "round " << round;
    ASSERT_TRUE(waitForStatus([](const Status& now) { return now.enumerators == 1; }));
    if (round == 3) descriptors = status().descriptors;
  }
  EXPECT_TRUE(
      picture->waitFor([](const WatchedPicture& now) { return now.resumes == now.pauses; }));
  EXPECT_TRUE(waitForStatus([&](const Status& now) { return now.descriptors <= descriptors; }))
      << "descriptors leak: " << descriptors << " grew to " << status().descriptors;
}

TEST_F(HostTest, AWatchStartedWithoutZarnComesAliveWithIt) {
  startHost();
  ipc::Remote<protocol::Watch> registration;
  const auto picture = watch("i:1", &registration);
  EXPECT_TRUE(picture->waitFor([](const WatchedPicture& now) { return now.pauses == 1; }));
  startZarn();
  EXPECT_TRUE(picture->waitFor(holds({{"a", 1}, {"b", 1}, {"c", 1}})));
  EXPECT_TRUE(picture->waitFor([](const WatchedPicture& now) { return now.resumes == 1; }));
}

TEST_F(HostTest, ChangesMadeWhileZarnWasAwayShowWithoutAnyoneAsking) {
  startZarn();
  startHost();
  ipc::Remote<protocol::Watch> registration;
  const auto picture = watch("i:1", &registration);
  ASSERT_TRUE(picture->waitFor(holds({{"a", 1}, {"b", 1}, {"c", 1}})));
  stopZarn();
  ASSERT_TRUE(waitForStatus([](const Status& now) { return !now.daemonReachable; }));
  setItems({{"new", 1}});
  startZarn();
  EXPECT_TRUE(picture->waitFor(holds({{"new", 1}})));
}

TEST_F(HostTest, SigningOutPausesAWatchAndSigningInResumesIt) {
  startZarn();
  startHost();
  ipc::Remote<protocol::Watch> registration;
  const auto picture = watch("i:1", &registration);
  ASSERT_TRUE(picture->waitFor(holds({{"a", 1}, {"b", 1}, {"c", 1}})));
  command("signed-out");
  std::vector<std::string> none;
  const auto error = listAll("i:1", &none);
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(NSFileProviderErrorDomain, NSFileProviderErrorNotAuthenticated));
  // What cuts the watch off makes its enumerator expire, as a new process does.
  ASSERT_EQ(kill(status().extension, SIGKILL), 0);
  ASSERT_TRUE(picture->waitFor([](const WatchedPicture& now) { return now.pauses == 1; }));
  setItems({{"a", 9}});
  countermand("signed-out");
  ASSERT_TRUE(waitForStatus(
      [this](const Status& now) { return now.extension > 0 || item("a") == nullptr; }));
  signalFromExtension(NSFileProviderRootContainerItemIdentifier);
  EXPECT_TRUE(picture->waitFor(holds({{"a", 9}})));
}

TEST_F(HostTest, AWatchOfAFolderThatIsGoneEnds) {
  startZarn();
  startHost();
  ipc::Remote<protocol::Watch> registration;
  const auto picture = watch("gone", &registration);
  ASSERT_TRUE(picture->waitFor([](const WatchedPicture& now) { return now.end != nullptr; }));
  EXPECT_TRUE(picture->end->is(NSFileProviderErrorDomain, NSFileProviderErrorNoSuchItem));
}

TEST_F(HostTest, TooManyWatchesAreRefused) {
  startZarn();
  startHost([](Host::Options& options) { options.maximumWatches = 1; });
  ipc::Remote<protocol::Watch> first;
  ipc::Remote<protocol::Watch> second;
  const auto picture = watch("i:1", &first);
  const auto refused = watch("i:2", &second);
  EXPECT_TRUE(refused->waitFor([](const WatchedPicture& now) { return now.end != nullptr; }));
  EXPECT_TRUE(picture->waitFor([](const WatchedPicture& now) { return now.isListed; }));
}

TEST_F(HostTest, AClientThatLeavesTakesItsWatchesAlong) {
  startZarn();
  startHost();
  ipc::Remote<protocol::Watch> registration;
  ASSERT_TRUE(
      watch("i:1", &registration)->waitFor([](const WatchedPicture& now) { return now.isListed; }));
  client->close();
  NSErrorRef error;
  client = ipc::Connection::connect(paths.controlSocket, &error);
  ASSERT_NE(client, nullptr);
  remote = client->bootstrap<protocol::Control>();
  EXPECT_TRUE(
      waitForStatus([](const Status& now) { return now.watches == 0 && now.enumerators == 0; }));
}

TEST_F(HostTest, AMissingProgramIsNamed) {
  startZarn();
  startHost([](Host::Options& options) {
    options.extensionProgram = "/no/such/program";
    options.supervision.acquire = 300ms;
  });
  const auto error = item("a");
  ASSERT_NE(error, nullptr);
  EXPECT_THAT(error->localizedDescription(), testing::HasSubstr("/no/such/program"));
  EXPECT_NE(status().lastFailure, nullptr);
}

}  // namespace
}  // namespace yomber
