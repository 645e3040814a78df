// `itemForIdentifier:error:` as the host asks for it, of a real extension above a real zarn, beside
// bare calls over the same connections: three in a row, and calls through a bare relay.

#include <functional>
#include <optional>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "benchmarks/call_counter.h"
#include "benchmarks/daemon_process.h"
#include "benchmarks/figure.h"
#include "fileproviderd/remote_session.h"
#include "platform/foundation/drive_paths.h"
#include "platform/ipc/call.h"
#include "platform/ipc/connection.h"
#include "platform/ipc/event_loop.h"
#include "platform/ipc/gate.h"
#include "platform/ipc/test_echo_server.h"

namespace {

using namespace yomber;
using ipc::test::Echo;
namespace harness = yomber::testing;
using Clock = std::chrono::steady_clock;

constexpr std::size_t kFolders = 20;
constexpr std::size_t kFilesInFolder = 100;
constexpr int kCountedLookups = 1000;
constexpr int kManyThreads = 8;
constexpr int kRounds = 40;

void require(const NSErrorRef& error, const char* what) {
  if (error) throw std::runtime_error(std::string(what) + ": " + error->description());
}

/// The host's side of one life of the extension. Used from any threads but the loop's.
class HostedExtension {
 public:
  explicit HostedExtension(const std::string& home) {
    NSErrorRef error;
    onLoop([&](const std::function<void()>& done) {
      ProcessLauncher launcher({.program = harness::programPath("qs-fileprovider"), .home = home});
      session_ = launcher.launch({}, &error);
      done();
    });
    require(error, "the extension did not start");
  }
  ~HostedExtension() {
    onLoop([&](const std::function<void()>& done) {
      session_->end();
      session_ = nullptr;
      done();
    });
  }
  HostedExtension(const HostedExtension&) = delete;
  HostedExtension& operator=(const HostedExtension&) = delete;

  std::string identify(const std::string& path) {
    std::optional<std::string> found;
    onLoop([&](const std::function<void()>& done) {
      session_->identify(path, [&, done](std::optional<std::string> identifier, NSErrorRef, bool) {
        found = std::move(identifier);
        done();
      });
    });
    if (!found) throw std::runtime_error("there is no identifier for " + path);
    return *found;
  }

  void lookUp(const std::string& identifier) {
    NSErrorRef failure;
    onLoop([&](const std::function<void()>& done) {
      session_->item(identifier, [&, done](std::optional<ItemFields> item, NSErrorRef error, bool) {
        failure = std::move(error);
        isRight_ = isRight_ && item && item->identifier == identifier;
        done();
      });
    });
    require(failure, "a lookup failed");
  }
  /// Whether every lookup was answered with the item that was asked for.
  [[nodiscard]] bool isRight() const { return isRight_; }

 private:
  /// Runs `work` on the loop thread, and returns when it has called what it is given.
  static void onLoop(const std::function<void(const std::function<void()>& done)>& work) {
    ipc::Gate gate;
    ipc::EventLoop::shared().post([&] { work([&gate] { gate.open(); }); });
    gate.wait();
  }

  ExtensionSessionRef session_;  // loop thread only
  bool isRight_ = true;          // written on the loop thread; read when nothing is under way
};

/// Microseconds of each of `rounds` runs of `work` on each of `threads` threads, appended to
/// `times`. Answers the seconds that all took.
double measure(int threads, int rounds, const std::function<void(std::mt19937_64&)>& work,
               std::vector<double>& times) {
  std::vector<std::vector<double>> own(static_cast<std::size_t>(threads));
  const auto run = [&](std::vector<double>& mine, std::uint64_t seed) {
    std::mt19937_64 random(seed);
    for (int round = 0; round < rounds; ++round) {
      const auto start = Clock::now();
      work(random);
      mine.push_back(std::chrono::duration<double, std::micro>(Clock::now() - start).count());
    }
  };
  const double seconds = bench::secondsFor([&] {
    std::vector<std::jthread> running;
    for (std::size_t i = 1; i < own.size(); ++i)
      running.emplace_back([&, i] { run(own[i], times.size() + i); });
    run(own[0], times.size());
  });
  for (const auto& mine : own) times.insert(times.end(), mine.begin(), mine.end());
  return seconds;
}

struct Contenders {
  std::function<void(std::mt19937_64&)> lookup;
  std::function<void(std::mt19937_64&)> bareCalls;
  std::function<void(std::mt19937_64&)> pooledCalls;  // the first of the three answered on a pool
  std::function<void(std::mt19937_64&)> relayedCall;
};

struct Measured {
  std::vector<double> lookups;
  std::vector<double> bareCalls;
  std::vector<double> pooledCalls;
  std::vector<double> relayedCalls;
  double lookupSeconds = 0;
  double relaySeconds = 0;
};

/// Takes turns, so that whatever else the machine does hits all alike.
Measured takeTurns(const Contenders& contenders, int threads, int inOneGo) {
  Measured measured;
  for (int round = -2; round < kRounds; ++round) {
    if (round == 0) measured = {};
    measured.lookupSeconds += measure(threads, inOneGo, contenders.lookup, measured.lookups);
    (void)measure(threads, inOneGo, contenders.bareCalls, measured.bareCalls);
    (void)measure(threads, inOneGo, contenders.pooledCalls, measured.pooledCalls);
    measured.relaySeconds +=
        measure(threads, inOneGo, contenders.relayedCall, measured.relayedCalls);
  }
  return measured;
}

/// Compared without a goal.
void printBeside(const std::string& name, double value, const char* yardstick, double beside) {
  bench::Figure figure;
  figure.name = name;
  figure.value = value;
  figure.unit = "us";
  figure.yardstick = yardstick;
  figure.yardstickValue = beside;
  figure.ratio = value / beside;
  bench::print(figure);
}

bool report(const std::string& threads, const Measured& measured) {
  const std::string name = "itemForIdentifier:error: from " + threads;
  const double median = bench::percentile(measured.lookups, 0.5);
  const auto figure =
      bench::compared(name + ", median", median, "us", "three bare round trips",
                      bench::percentile(measured.bareCalls, 0.5), "at most 1.3 times",
                      [](double ratio) { return ratio <= 1.3; });
  bench::print(figure);
  // The extension waits for the daemon, so it cannot answer on its loop thread as bare calls do.
  printBeside(name + ", median", median, "three bare round trips, the first through the pool",
              bench::percentile(measured.pooledCalls, 0.5));
  printBeside(name + ", 99th percentile", bench::percentile(measured.lookups, 0.99),
              "three bare round trips", bench::percentile(measured.bareCalls, 0.99));
  return figure.reached;
}

void reportRates(const std::string& threads, const Measured& measured) {
  bench::Figure rate;
  rate.name = "itemForIdentifier:error: from " + threads + ", calls a second";
  rate.value = static_cast<double>(measured.lookups.size()) / measured.lookupSeconds;
  rate.unit = "calls/s";
  rate.yardstick = "through a bare relay";
  rate.yardstickValue = static_cast<double>(measured.relayedCalls.size()) / measured.relaySeconds;
  rate.ratio = rate.value / rate.yardstickValue;
  bench::print(rate);
}

std::vector<std::string> makeItems(const harness::TestDrive& drive) {
  std::vector<std::string> paths;
  for (std::size_t folder = 0; folder < kFolders; ++folder) {
    const std::string name = "folder " + std::to_string(folder);
    drive.makeFolder(name);
    for (std::size_t file = 0; file < kFilesInFolder; ++file) {
      paths.push_back(name + "/report " + std::to_string(file) + ".pdf");
      drive.write(paths.back());
    }
  }
  return paths;
}

/// The one call to the extension, and what a lookup takes of zarn by count.
bool reportRoundTrips(const std::string& home, const std::vector<std::string>& identifiers) {
  const bench::CallCounter counter(DrivePaths::forHome(home).daemonSocket);
  HostedExtension extension(home);
  for (int i = 0; i < 10; ++i)
    extension.lookUp(identifiers[0]);  // account and containers are asked
  const std::uint64_t before = counter.calls();
  for (int i = 0; i < kCountedLookups; ++i)
    extension.lookUp(identifiers[static_cast<std::size_t>(i) % identifiers.size()]);
  bench::Figure figure;
  figure.name = "itemForIdentifier:error:, round trips in all";
  figure.value = 1 + static_cast<double>(counter.calls() - before) / kCountedLookups;
  figure.unit = "calls";
  figure.goal = "3";
  figure.reached = counter.calls() - before == 2 * kCountedLookups;
  bench::print(figure);
  return figure.reached;
}

/// `connection` is to live as long as what is answered.
ipc::Remote<Echo> echoAt(const std::string& socket, ipc::Connection::Ref& connection) {
  NSErrorRef error;
  connection = ipc::Connection::connect(socket, &error);
  require(error, "cannot connect");
  return connection->bootstrap<Echo>();
}

void callOnce(const ipc::Remote<Echo>& echo) {
  require(ipc::test::echoOnce(echo), "a call failed");
}

void callThroughPool(const ipc::Remote<Echo>& echo) {
  require(ipc::callAndWait(
              echo, &Echo::Client::workRequest,
              [](Echo::WorkParams::Builder params) { params.setValue(1); },
              [](Echo::WorkResults::Reader) {}),
          "a call failed");
}

bool compare(const std::string& home, const std::vector<std::string>& identifiers) {
  const ipc::test::TemporaryDirectory directory;
  const ipc::test::EchoProcess peer(directory.file("echo"));
  harness::LineProcess relay(
      {harness::programPath("echo_relay"), directory.file("relay"), directory.file("echo")});
  if (!relay.readUntil([](const std::string& line) { return line == "ready"; }))
    throw std::runtime_error("the relay did not start");
  ipc::Connection::Ref direct;
  ipc::Connection::Ref relayed;
  const auto bare = echoAt(directory.file("echo"), direct);
  const auto behind = echoAt(directory.file("relay"), relayed);
  HostedExtension extension(home);
  const Contenders contenders{.lookup =
                                  [&](std::mt19937_64& random) {
                                    extension.lookUp(identifiers[random() % identifiers.size()]);
                                  },
                              .bareCalls =
                                  [&](std::mt19937_64&) {
                                    for (int i = 0; i < 3; ++i) callOnce(bare);
                                  },
                              .pooledCalls =
                                  [&](std::mt19937_64&) {
                                    callThroughPool(bare);
                                    for (int i = 0; i < 2; ++i) callOnce(bare);
                                  },
                              .relayedCall = [&](std::mt19937_64&) { callOnce(behind); }};

  const bool isReached = report("1 thread", takeTurns(contenders, 1, 400));
  const Measured many = takeTurns(contenders, kManyThreads, 200);
  const bool areReached = report("8 threads", many);
  reportRates("8 threads", many);
  if (!extension.isRight()) throw std::runtime_error("a lookup answered another item");
  return isReached && areReached;
}

}  // namespace

int main() {
  harness::TestDrive drive;
  bench::DaemonProcess::adoptEnvironment(drive);
  const std::vector<std::string> paths = makeItems(drive);
  bench::DaemonProcess daemon(drive);
  drive.signIn();
  std::vector<std::string> identifiers;
  {
    HostedExtension extension(drive.home());
    for (const std::string& path : paths)
      identifiers.push_back(extension.identify(drive.root() + "/" + path));
  }
  const bool isThree = reportRoundTrips(drive.home(), identifiers);
  const bool isFast = compare(drive.home(), identifiers);
  daemon.end();
  return isThree && isFast ? 0 : 1;
}
