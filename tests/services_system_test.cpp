// Services of items over a whole drive: clients that are killed in the middle of calls, an
// extension that is, and many connections at once.
//
// YOMBER_KILLED_CLIENTS says how many clients are killed (500 for a whole campaign),
// YOMBER_SERVICE_CONNECTIONS to how many items' services clients connect at once (1000).
#include <algorithm>
#include <array>
#include <atomic>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <vector>

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "platform/foundation/descriptor_limit.h"
#include "platform/foundation/log_sinks.h"
#include "platform/foundation/sanitized.h"
#include "platform/foundation/stopped_process.h"
#include "platform/foundation/temporary_directory.h"
#include "platform/ipc/unix_socket.h"
#include "tests/harness/service_caller.h"
#include "tests/harness/test_drive.h"

namespace yomber::testing {
namespace {

constexpr std::size_t kKilledClients = 500;
constexpr std::size_t kKilledClientsUsually = kIsSanitized ? 38 : 76;
constexpr std::size_t kVisitorsAtOnce = 10;
constexpr std::size_t kConnections = 1000;
constexpr std::size_t kConnectionsUsually = kIsSanitized ? 40 : 200;
constexpr std::size_t kInterruptedClients = 10;

/// What the variable says, or `usually`; says so when that is less than `whole`.
std::size_t sizeFrom(const char* name, std::size_t usually, std::size_t whole) {
  const char* const text = std::getenv(name);
  const std::size_t size = text != nullptr ? std::strtoull(text, nullptr, 10) : usually;
  if (size < whole) (void)std::printf("%zu instead of %zu: see %s\n", size, whole, name);
  return size;
}

std::size_t descriptorsOf(pid_t process) {
  return static_cast<std::size_t>(std::distance(
      std::filesystem::directory_iterator("/proc/" + std::to_string(process) + "/fd"), {}));
}

/// Where visitors wait until it is opened.
class VisitorGate {
 public:
  VisitorGate() { EXPECT_EQ(mkfifo(path().c_str(), S_IRUSR | S_IWUSR), 0); }
  [[nodiscard]] std::string path() const { return directory_ / "gate"; }
  void open() {
    writer_.reset(::open(path().c_str(), O_RDWR | O_CLOEXEC));
    EXPECT_TRUE(static_cast<bool>(writer_));
  }

 private:
  const TemporaryDirectory directory_;
  ipc::UniqueFd writer_;
};

/// Every call was answered once.
void expectAnswered(const ServiceCallEnds& ends) {
  const auto calls = ServiceCaller::calls();
  for (std::size_t i = 0; i < calls.size(); ++i) {
    SCOPED_TRACE(calls[i].name);
    const auto each = ends.of(i);
    ASSERT_EQ(each.size(), 1U);
    if (calls[i].answer == ServiceCaller::Answer::LeftOut) {
      ASSERT_NE(each[0].failure, nullptr);
      EXPECT_TRUE(each[0].failure->is(NSCocoaErrorDomain, NSXPCConnectionReplyInvalid));
      continue;
    }
    EXPECT_EQ(each[0].failure, nullptr) << each[0].failure->description();
    if (calls[i].answer == ServiceCaller::Answer::Always) {
      EXPECT_EQ(each[0].error, nullptr) << each[0].error->description();
    }
  }
}

/// A client that notes how its connections and its calls end.
struct NotedCaller {
  std::unique_ptr<ServiceCaller> caller;
  std::shared_ptr<ServiceCallEnds> ends = std::make_shared<ServiceCallEnds>();
  std::shared_ptr<std::atomic<int>> interruptions = std::make_shared<std::atomic<int>>(0);
  std::shared_ptr<std::atomic<int>> invalidations = std::make_shared<std::atomic<int>>(0);

  NotedCaller(const NSFileProviderServices& services, const std::string& identifier) {
    NSErrorRef error;
    caller = ServiceCaller::connect(
        services, identifier, &error,
        [interruptions = interruptions, invalidations = invalidations](NSXPCConnection& made) {
          made.setInterruptionHandler([interruptions] { ++*interruptions; });
          made.setInvalidationHandler([invalidations] { ++*invalidations; });
        });
    if (caller == nullptr) throw std::runtime_error(identifier + ": " + error->description());
  }
  void callEverything() const { ends->callEverything(*caller); }
  [[nodiscard]] bool isThrough() const { return ends->count() >= ServiceCaller::calls().size(); }
  /// The calls from `first` on, before `last`, that failed with the connection.
  [[nodiscard]] std::size_t lostCalls(std::size_t first, std::size_t last) const {
    std::size_t lost = 0;
    for (std::size_t i = first; i < last; ++i) {
      const auto each = ends->of(i);
      EXPECT_EQ(each.size(), 1U) << ServiceCaller::calls()[i].name;
      lost += static_cast<std::size_t>(std::ranges::count_if(each, [](const auto& end) {
        return end.failure != nullptr &&
               (end.failure->is(NSCocoaErrorDomain, NSXPCConnectionInterrupted) ||
                end.failure->is(NSCocoaErrorDomain, NSXPCConnectionInvalid));
      }));
    }
    return lost;
  }
};

class ServicesSystem : public ::testing::Test {
 protected:
  ServicesSystem() {
    unsetenv("XDG_RUNTIME_DIR");
    raiseDescriptorLimit();
  }

  /// A drive that is up with so many documents.
  void upWith(std::size_t documents) {
    for (std::size_t i = 0; i < documents; ++i)
      drive_.write("document " + std::to_string(i), "content");
    drive_.up();
    ASSERT_TRUE(eventually([&] {
      identifiers_.clear();
      for (const auto& item : drive_.json({"ls", "/"}))
        identifiers_.push_back(item.at("id").get<std::string>());
      return identifiers_.size() == documents;
    }));
    services_.emplace(DrivePaths::forHome(drive_.home()));
    extension_ = drive_.pidOf(TestDrive::Process::Extension);
  }

  /// A client calls everything, and all of it is answered.
  void expectAnswers(const std::string& identifier) const {
    const NotedCaller noted(*services_, identifier);
    EXPECT_EQ(noted.caller->fetchShare().failure, nullptr);
    noted.callEverything();
    ASSERT_TRUE(eventually([&] { return noted.isThrough(); }));
    expectAnswered(*noted.ends);
  }

  /// How many lines of the drive's log contain the text.
  [[nodiscard]] std::size_t linesOfLog(const std::string& text) const {
    const std::string log = drive_.yomber({"log", "--lines", "100000"}).output;
    std::size_t count = 0;
    for (std::size_t at = log.find(text); at != std::string::npos; at = log.find(text, at + 1))
      ++count;
    return count;
  }

  /// Visitors for the calls from `first` on, before `last`, that end in this way.
  void visit(const std::string& moment, std::size_t first, std::size_t last) {
    SCOPED_TRACE(moment + ", calls " + std::to_string(first) + " to " + std::to_string(last - 1));
    VisitorGate gate;
    std::vector<std::unique_ptr<LineProcess>> visitors;
    for (std::size_t call = first; call < last; ++call) {
      visitors.push_back(std::make_unique<LineProcess>(
          std::vector<std::string>{programPath("service_visitor"), drive_.home(),
                                   identifiers_[call % identifiers_.size()], std::to_string(call),
                                   moment, gate.path()},
          drive_.environment()));
    }
    expectAllSay(visitors, "connected");
    if (::testing::Test::HasFailure()) return;
    std::optional<StoppedProcess> stopped;
    const bool isHeld = moment == "held";
    if (isHeld) stopped.emplace(drive_.pidOf(TestDrive::Process::Zarn));
    gate.open();
    if (isHeld) {
      expectAllSay(visitors, "called");
      for (const auto& visitor : visitors) ::kill(visitor->pid(), SIGKILL);
    }
    for (const auto& visitor : visitors)
      EXPECT_EQ(visitor->waitForEnd(), moment == "ended" ? 0 : -SIGKILL);
  }

  TestDrive drive_;
  std::vector<std::string> identifiers_;
  std::optional<NSFileProviderServices> services_;
  pid_t extension_ = -1;

 private:
  static void expectAllSay(const std::vector<std::unique_ptr<LineProcess>>& visitors,
                           const std::string& text) {
    for (const auto& visitor : visitors) {
      std::string said;
      EXPECT_TRUE(visitor->readUntil([&](const std::string& line) {
        said = line;
        return line == text;
      })) << "instead of "
          << text << ": " << said;
    }
  }
};

TEST_F(ServicesSystem, NothingIsLeftOfClientsThatWereKilledInTheMiddleOfACall) {
  static constexpr std::array kMoments{"held", "answered", "amid", "begun"};
  const std::size_t count =
      sizeFrom("YOMBER_KILLED_CLIENTS", kKilledClientsUsually, kKilledClients);
  upWith(2);
  ASSERT_EQ(drive_.yomber({"share", "link", "document 1"}).exitCode, 0);
  const pid_t host = drive_.pidOf(TestDrive::Process::Host);
  visit("ended", 0, kVisitorsAtOnce);
  expectAnswers(identifiers_[0]);
  const std::size_t before = descriptorsOf(extension_);
  const std::size_t hostBefore = descriptorsOf(host);

  const std::size_t calls = ServiceCaller::calls().size();
  for (std::size_t killed = 0; killed < count && !HasFailure();) {
    const std::size_t first = killed % calls;
    const std::size_t last = std::min({first + kVisitorsAtOnce, calls, first + count - killed});
    visit(kMoments[killed / calls % kMoments.size()], first, last);
    killed += last - first;
  }
  EXPECT_EQ(drive_.pidOf(TestDrive::Process::Extension), extension_);
  for (const std::string& identifier : identifiers_) expectAnswers(identifier);
  EXPECT_TRUE(eventually([&] { return descriptorsOf(extension_) <= before; }))
      << descriptorsOf(extension_) << " descriptors instead of " << before;
  EXPECT_TRUE(eventually([&] { return descriptorsOf(host) <= hostBefore; }))
      << descriptorsOf(host) << " descriptors of the host instead of " << hostBefore;
}

TEST_F(ServicesSystem, AnExtensionThatIsKilledInterruptsItsClientsOnceWhoAskAgain) {
  upWith(kInterruptedClients);
  std::vector<NotedCaller> clients;
  clients.reserve(identifiers_.size());
  for (const std::string& identifier : identifiers_) clients.emplace_back(*services_, identifier);
  {
    // What it asks zarn stays under way.
    const StoppedProcess zarn(drive_.pidOf(TestDrive::Process::Zarn));
    for (const auto& client : clients) client.callEverything();
    for (const auto& client : clients)
      EXPECT_TRUE(eventually([&] { return client.ends->count() > 0; })) << "they are heard";
    ASSERT_EQ(::kill(extension_, SIGKILL), 0);
    for (const auto& client : clients) {
      EXPECT_TRUE(eventually([&] { return client.isThrough() && *client.invalidations == 2; }));
    }
  }
  for (const std::string& identifier : identifiers_) expectAnswers(identifier);
  EXPECT_NE(drive_.pidOf(TestDrive::Process::Extension), extension_);

  const std::size_t calls = ServiceCaller::calls().size();
  constexpr std::size_t kSharingCalls = 8;
  for (const auto& client : clients) {
    EXPECT_GE(client.lostCalls(0, kSharingCalls), 1U);
    EXPECT_GE(client.lostCalls(kSharingCalls, calls), 1U);
    EXPECT_EQ(*client.interruptions, 2) << "of two connections";
    EXPECT_EQ(*client.invalidations, 2);
  }
}

TEST_F(ServicesSystem, AnotherUserWithTheEndpointsOfThisOneIsHungUpOnAndInTheLog) {
  if (geteuid() != 0) GTEST_SKIP() << "only root can become another user";
  upWith(1);
  LineProcess visitor(
      {programPath("service_visitor"), drive_.home(), identifiers_[0], "0", "estranged", "no gate"},
      drive_.environment());
  std::vector<std::string> said;
  EXPECT_TRUE(visitor.readUntil([&](const std::string& line) {
    said.push_back(line);
    return said.size() == 2;
  }));
  EXPECT_EQ(said, (std::vector<std::string>{"refused", "refused"}));
  EXPECT_EQ(visitor.waitForEnd(), 0);
  expectAnswers(identifiers_[0]);
  if (logsToJournal()) GTEST_SKIP() << "this machine logs to its journal";
  const std::string line = "The peer, process " + std::to_string(visitor.pid()) +
                           ", belongs to user 65534 and was refused";
  EXPECT_TRUE(eventually([&] { return linesOfLog(line) == 2; })) << linesOfLog(line);
}

TEST_F(ServicesSystem, ManyClientsOfManyItemsAreAllAnsweredAndNothingIsLeftOfThem) {
  upWith(sizeFrom("YOMBER_SERVICE_CONNECTIONS", kConnectionsUsually, kConnections));
  const auto crowd = [&] {
    std::vector<NotedCaller> clients;
    clients.reserve(identifiers_.size());
    for (const std::string& identifier : identifiers_) clients.emplace_back(*services_, identifier);
    for (const auto& client : clients) EXPECT_EQ(client.caller->fetchShare().failure, nullptr);
    for (const auto& client : clients) client.callEverything();
    for (const auto& client : clients) ASSERT_TRUE(eventually([&] { return client.isThrough(); }));
    for (const auto& client : clients) expectAnswered(*client.ends);
    EXPECT_GE(descriptorsOf(extension_), 2 * clients.size()) << "all are connected at once";
  };
  crowd();  // so that what is kept for good is there
  expectAnswers(identifiers_.front());
  ASSERT_TRUE(eventually([&] { return descriptorsOf(extension_) < 2 * identifiers_.size(); }));
  const std::size_t before = descriptorsOf(extension_);
  crowd();
  expectAnswers(identifiers_.back());
  EXPECT_TRUE(eventually([&] { return descriptorsOf(extension_) <= before; }))
      << descriptorsOf(extension_) << " descriptors instead of " << before;
  EXPECT_EQ(drive_.pidOf(TestDrive::Process::Extension), extension_);
}

}  // namespace
}  // namespace yomber::testing
