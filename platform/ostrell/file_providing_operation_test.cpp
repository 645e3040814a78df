#include "platform/ostrell/file_providing_operation.h"

#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "platform/foundation/drive_paths.h"
#include "platform/ipc/event_loop.h"
#include "platform/ostrell/awaited.h"
#include "platform/ostrell/constants.h"
#include "platform/ostrell/reading_options.h"
#include "platform/ostrell/scripted_daemon.h"
#include "platform/ostrell/test_short_patience.h"

namespace yomber {
namespace {

using Outcomes = std::shared_ptr<Awaited<NSErrorRef>>;
using Operation = std::shared_ptr<QSFileProvidingOperation>;

class FileProvidingOperationTest : public testing::Test {
 protected:
  Operation makeOperation(NSFileCoordinatorReadingOptions options = 0) {
    auto operation = QSFileProvidingOperation::initWithURL(url, options);
    operation->setFileProvidingCompletion(
        [into = outcomes](const NSErrorRef& error) { into->add(error); });
    return operation;
  }
  void expectCancelledOnce(const Operation& operation) {
    ASSERT_EQ(outcomes->wait().size(), 1U);
    ASSERT_TRUE(outcomes->values()[0]);
    EXPECT_TRUE(outcomes->values()[0]->is(NSCocoaErrorDomain, NSUserCancelledError));
    operation->waitUntilFinished();
    EXPECT_EQ(outcomes->values().size(), 1U);
  }

  ScriptedDaemon daemon;
  const NSURLRef url = NSURL::fileURLWithPath(daemon.root() + "/five.txt");
  const Outcomes outcomes = std::make_shared<Awaited<NSErrorRef>>();
  NSOperationQueue queue;
};

TEST_F(FileProvidingOperationTest, AsksTheDaemonWithTheOptionsAndEndsWithNoError) {
  const auto operation = makeOperation(0x20001);
  queue.addOperation(operation);
  EXPECT_EQ(outcomes->wait(), std::vector<NSErrorRef>{nullptr});
  operation->waitUntilFinished();
  EXPECT_EQ(daemon.calls().back(),
            (ScriptedDaemon::Call{"startProviding", {url->path(), "131073"}}));
}

TEST_F(FileProvidingOperationTest, WaitsForWhatIsGoingOnWhenItWantsTheCurrentVersion) {
  const auto operation = makeOperation();
  operation->setWantsCurrentVersion(true);
  queue.addOperation(operation);
  EXPECT_EQ(outcomes->wait(), std::vector<NSErrorRef>{nullptr});
  EXPECT_EQ(daemon.calls().back(),
            (ScriptedDaemon::Call{
                "startProviding",
                {url->path(), std::to_string(QSFileCoordinatorReadingForcesProviding)}}));
}

TEST_F(FileProvidingOperationTest, EndsWithTheDaemonsError) {
  daemon.scriptContent([](ScriptedContentAnswers& answers) {
    answers.startProviding = [](const std::string&, std::uint64_t) {
      return NSError::errorWithDomain(NSCocoaErrorDomain, NSUbiquitousFileUnavailableError);
    };
  });
  queue.addOperation(makeOperation());
  ASSERT_EQ(outcomes->wait().size(), 1U);
  EXPECT_TRUE(outcomes->values()[0]->is(NSCocoaErrorDomain, NSUbiquitousFileUnavailableError));
}

TEST_F(FileProvidingOperationTest, IsNotFinishedBeforeTheDaemonAnswers) {
  daemon.hold("startProviding");
  const auto operation = makeOperation();
  queue.addOperation(operation);
  ASSERT_TRUE(daemon.waitForCalls("startProviding"));
  EXPECT_FALSE(operation->isFinished());
  EXPECT_TRUE(outcomes->values().empty());
  daemon.release("startProviding");
  EXPECT_EQ(outcomes->wait(), std::vector<NSErrorRef>{nullptr});
}

TEST_F(FileProvidingOperationTest, CancellingDropsTheCallAndEndsItOnce) {
  daemon.hold("startProviding");
  const auto operation = makeOperation();
  queue.addOperation(operation);
  ASSERT_TRUE(daemon.waitForCalls("startProviding"));
  operation->cancel();
  EXPECT_TRUE(daemon.waitForCalls("startProviding.dropped"));
  operation->cancel();
  daemon.release("startProviding");
  expectCancelledOnce(operation);
}

TEST_F(FileProvidingOperationTest, CancelledBeforeItStartsItNeverAsksAndEndsOnce) {
  queue.setSuspended(true);
  const auto operation = makeOperation();
  queue.addOperation(operation);
  operation->cancel();
  queue.setSuspended(false);
  expectCancelledOnce(operation);
  queue.waitUntilAllOperationsAreFinished();
  EXPECT_EQ(daemon.callCount("startProviding"), 0U);
}

TEST_F(FileProvidingOperationTest, CancelledWhileTheDaemonIsBeingReachedItNeverAsks) {
  daemon.hold("describe");
  const auto operation = makeOperation();
  queue.addOperation(operation);
  ASSERT_TRUE(daemon.waitForCalls("describe"));
  operation->cancel();
  expectCancelledOnce(operation);
  daemon.release("describe");
  ASSERT_TRUE(daemon.waitForCalls("observe"));
  ipc::EventLoop::shared().runAndWait([] {});
  EXPECT_EQ(daemon.callCount("startProviding"), 0U);
}

TEST_F(FileProvidingOperationTest, CancellingAfterTheEndChangesNothing) {
  const auto operation = makeOperation();
  queue.addOperation(operation);
  EXPECT_EQ(outcomes->wait(), std::vector<NSErrorRef>{nullptr});
  operation->cancel();
  operation->waitUntilFinished();
  EXPECT_EQ(outcomes->values().size(), 1U);
}

TEST_F(FileProvidingOperationTest, ALostDaemonIsToldWithWhatToDo) {
  daemon.hold("startProviding");
  queue.addOperation(makeOperation());
  ASSERT_TRUE(daemon.waitForCalls("startProviding"));
  daemon.dropConnections();
  ASSERT_EQ(outcomes->wait().size(), 1U);
  const auto error = outcomes->values()[0];
  EXPECT_TRUE(error->is(QSOstrellErrorDomain, QSOstrellErrorConnectionLost));
  EXPECT_NE(error->localizedDescription().find(url->path()), std::string::npos);
  EXPECT_TRUE(error->underlyingError());
}

TEST_F(FileProvidingOperationTest, WithoutADaemonItEndsWithWhereItWasLookedFor) {
  daemon.stop();
  queue.addOperation(makeOperation());
  ASSERT_EQ(outcomes->wait().size(), 1U);
  const std::string socket = DrivePaths::forHome(daemon.home()).daemonSocket;
  EXPECT_NE(outcomes->values()[0]->localizedDescription().find(socket), std::string::npos);
}

TEST_F(FileProvidingOperationTest, WithoutALocationItEndsWithNoSuchFile) {
  const auto operation = QSFileProvidingOperation::initWithURL(nullptr, 0);
  operation->setFileProvidingCompletion(
      [into = outcomes](const NSErrorRef& error) { into->add(error); });
  queue.addOperation(operation);
  ASSERT_EQ(outcomes->wait().size(), 1U);
  EXPECT_TRUE(outcomes->values()[0]->is(NSCocoaErrorDomain, NSFileNoSuchFileError));
}

TEST_F(FileProvidingOperationTest, CancellationsThatRaceTheAnswerEndEachOperationOnce) {
  constexpr std::size_t kOperations = 200;
  std::vector<Operation> operations;
  for (std::size_t i = 0; i < kOperations; ++i) operations.push_back(makeOperation());
  std::thread canceller([&] {
    for (const auto& each : operations) each->cancel();
  });
  for (const auto& each : operations) queue.addOperation(each);
  canceller.join();
  queue.waitUntilAllOperationsAreFinished();
  EXPECT_EQ(outcomes->wait(kOperations).size(), kOperations);
}

// ---- A daemon that is alive but stuck ----------------------------------------------------------

/// The time limit is read when the daemon's link is made.
class ProvidingByAStuckDaemonTest : private ShortPatience, public FileProvidingOperationTest {};

TEST_F(ProvidingByAStuckDaemonTest, AnsweringOtherQuestionsItMayTakeItsTime) {
  daemon.hold("startProviding");
  queue.addOperation(makeOperation());
  ASSERT_TRUE(daemon.waitForCalls("startProviding"));
  daemon.forgetCalls();
  ASSERT_TRUE(daemon.waitForCalls("describe", 2));
  EXPECT_TRUE(outcomes->values().empty());
  daemon.release("startProviding");
  EXPECT_EQ(outcomes->wait(), std::vector<NSErrorRef>{nullptr});
}

TEST_F(ProvidingByAStuckDaemonTest, AnsweringNothingItIsGivenUp) {
  daemon.hold("startProviding");
  queue.addOperation(makeOperation());
  ASSERT_TRUE(daemon.waitForCalls("startProviding"));
  daemon.hold("*");
  ASSERT_EQ(outcomes->wait().size(), 1U);
  const auto error = outcomes->values()[0];
  ASSERT_TRUE(error);
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSXPCConnectionTimedOut));
  EXPECT_NE(error->localizedDescription().find(url->path()), std::string::npos);
  EXPECT_TRUE(daemon.waitForCalls("startProviding.dropped"));
  daemon.release("*");
  queue.waitUntilAllOperationsAreFinished();
  EXPECT_EQ(outcomes->values().size(), 1U);
}

TEST(ReadingOptions, AreWrittenByName) {
  EXPECT_EQ(QSFileCoordinatorReadingOptionsPrettyPrint(0), "none");
  EXPECT_EQ(QSFileCoordinatorReadingOptionsPrettyPrint(1), "WithoutChanges");
  EXPECT_EQ(QSFileCoordinatorReadingOptionsPrettyPrint(0x2000a),
            "ResolvesSymbolicLink|ForUploading|ForcesProviding");
  EXPECT_EQ(QSFileCoordinatorReadingOptionsPrettyPrint(0x8000000000000104),
            "ImmediatelyAvailableMetadataOnly|0x8000000000000100");
}

}  // namespace
}  // namespace yomber
