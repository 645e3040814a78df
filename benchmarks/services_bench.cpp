// Services of items over a whole drive: from asking the host to the first reply, beside bare round
// trips; calls a second on one connection, beside bare calls; a thousand connections at once.

#include <atomic>
#include <filesystem>
#include <fstream>
#include <functional>
#include <memory>
#include <stdexcept>
#include <string>
#include <vector>

#include "benchmarks/daemon_process.h"
#include "benchmarks/figure.h"
#include "platform/fileprovider/services.h"
#include "platform/foundation/descriptor_limit.h"
#include "platform/foundation/drive_paths.h"
#include "platform/foundation/lock.h"
#include "platform/ipc/call.h"
#include "platform/ipc/connection.h"
#include "platform/ipc/gate.h"
#include "platform/ipc/test_echo_server.h"
#include "platform/ostrell/collaboration_service.h"
#include "tests/harness/service_caller.h"
#include "tests/harness/test_drive.h"

namespace {

using namespace yomber;
using ipc::test::Echo;
namespace harness = yomber::testing;
using Clock = std::chrono::steady_clock;
using Collaboration = QSFileProviderPandrelCollaboration;

constexpr const char* kCollaboration = "com.kelvo.PandrelCollaboration";
constexpr int kLatencyRounds = 400;
constexpr int kRateRounds = 20;
constexpr std::size_t kCallsInARound = 2000;
constexpr std::size_t kUnderWay = 64;
constexpr double kMemoryAfterwards = 1.1;

void require(const NSErrorRef& error, const std::string& what) {
  if (error) throw std::runtime_error(what + ": " + error->description());
}

/// Counts down from any thread.
class Countdown {
 public:
  explicit Countdown(std::size_t count) : left_(count) {}
  void done() {
    LockGuard guard(mutex_);
    if (--left_ == 0) changed_.notifyAll();
  }
  void wait() {
    LockGuard guard(mutex_);
    while (left_ > 0) changed_.wait(mutex_);
  }

 private:
  Mutex mutex_;
  Condition changed_;
  std::size_t left_ GUARDED_BY(mutex_);
};

NSXPCConnectionRef connectTo(const NSFileProviderService& service) {
  NSErrorRef error;
  const auto connection = service.fileProviderConnection(&error);
  require(error, "there is no connection");
  connection->setRemoteObjectInterface(NSXPCInterface::interfaceWithProtocol<Collaboration>());
  connection->resume();
  return connection;
}

std::shared_ptr<Collaboration> proxyOf(const NSXPCConnectionRef& connection) {
  return connection->remoteObjectProxyWithErrorHandler<Collaboration>([](const NSErrorRef& error) {
    (void)std::fprintf(stderr, "a call failed: %s\n", error->description().c_str());
    std::abort();
  });
}

void callOnce(Collaboration& proxy) {
  ipc::Gate replied;
  proxy.fetchVersionAndCapabilitiesWithCompletionHandler(
      [&](std::uint64_t version, std::uint64_t, const NSErrorRef&) {
        if (version == 1) replied.open();
      });
  replied.wait();
}

void callBare(const ipc::Remote<Echo>& echo) {
  require(ipc::test::echoOnce(echo), "a bare call failed");
}

void printAlone(const std::string& name, double value, const char* unit) {
  bench::Figure figure;
  figure.name = name;
  figure.value = value;
  figure.unit = unit;
  bench::print(figure);
}

double microseconds(const std::function<void()>& work) { return bench::secondsFor(work) * 1e6; }

// ---- Latency -----------------------------------------------------------------------------------

NSFileProviderServiceRef collaborationOf(const NSFileProviderServices& services,
                                         const std::string& identifier) {
  NSErrorRef error;
  for (const auto& service : services.servicesForItemIdentifier(identifier, &error)) {
    if (service->name() == kCollaboration) return service;
  }
  require(error, "the host answered no services");
  throw std::runtime_error(identifier + " has no collaboration");
}

bool reportLatency(const NSFileProviderServices& services, const ipc::Remote<Echo>& echo,
                   const std::vector<std::string>& identifiers) {
  std::vector<double> first;
  std::vector<double> bare;
  std::vector<double> named;
  for (int round = -20; round < kLatencyRounds; ++round) {
    if (round == 0) first = bare = named = {};
    const auto& identifier = identifiers[static_cast<std::size_t>(round + 20) % identifiers.size()];
    NSXPCConnectionRef connection;
    first.push_back(microseconds([&] {
      connection = connectTo(*collaborationOf(services, identifier));
      callOnce(*proxyOf(connection));
    }));
    connection->invalidate();
    bare.push_back(microseconds([&] {
      for (int i = 0; i < 4; ++i) callBare(echo);
    }));
    named.push_back(microseconds([&] {
      NSErrorRef error;
      const auto service = services.serviceForItemIdentifier(identifier, kCollaboration, &error);
      require(error, "there is no collaboration");
      connection = connectTo(*service);
      callOnce(*proxyOf(connection));
    }));
    connection->invalidate();
  }
  const double four = bench::percentile(bare, 0.5);
  const auto figure =
      bench::compared("an item's services asked for to the first reply, median",
                      bench::percentile(first, 0.5), "us", "four bare round trips", four,
                      "at most 1 time", [](double ratio) { return ratio <= 1; });
  bench::print(figure);
  bench::print(bench::compared("the same by the service's name, median",
                               bench::percentile(named, 0.5), "us", "four bare round trips", four,
                               "", [](double) { return true; }));
  bench::print(bench::compared("the first, 99th percentile", bench::percentile(first, 0.99), "us",
                               "four bare round trips", bench::percentile(bare, 0.99), "",
                               [](double) { return true; }));
  return figure.reached;
}

// ---- Calls a second ----------------------------------------------------------------------------

/// Keeps `kUnderWay` calls under way until `kCallsInARound` were answered; seconds.
/// `begin(done)` begins one and calls `done` on its answer.
double pipelinedSeconds(const std::function<void(std::function<void()> done)>& begin) {
  return bench::secondsFor([&] {
    Countdown left(kCallsInARound);
    std::atomic<std::size_t> begun{0};
    std::function<void()> next = [&] {
      if (begun.fetch_add(1) >= kCallsInARound) return;
      begin([&] {
        next();
        left.done();
      });
    };
    for (std::size_t i = 0; i < kUnderWay; ++i) next();
    left.wait();
  });
}

bool reportRates(const NSFileProviderServices& services, const ipc::Remote<Echo>& echo,
                 const std::string& identifier) {
  const auto connection = connectTo(*collaborationOf(services, identifier));
  const auto proxy = proxyOf(connection);
  bench::Repeated many;
  bench::Repeated single;
  const auto rate = [](double seconds) { return kCallsInARound / seconds; };
  for (int round = -2; round < kRateRounds; ++round) {
    if (round == 0) {
      many = {};
      single = {};
    }
    const double served = pipelinedSeconds([&](const std::function<void()>& done) {
      proxy->fetchVersionAndCapabilitiesWithCompletionHandler(
          [done](std::uint64_t, std::uint64_t, const NSErrorRef&) { done(); });
    });
    const double bare = pipelinedSeconds([&](const std::function<void()>& done) {
      (void)ipc::call(
          echo, &Echo::Client::echoRequest,
          [](Echo::EchoParams::Builder params) { params.setValue(1); },
          [done](const NSErrorRef& error, const Echo::EchoResults::Reader*) {
            require(error, "a bare call failed");
            done();
          });
    });
    many.add(rate(served), rate(bare));
    const double alone = bench::secondsFor([&] {
      for (std::size_t i = 0; i < kCallsInARound; ++i) callOnce(*proxy);
    });
    const double bareAlone = bench::secondsFor([&] {
      for (std::size_t i = 0; i < kCallsInARound; ++i) callBare(echo);
    });
    single.add(rate(alone), rate(bareAlone));
  }
  connection->invalidate();
  // A rate may be as much lower as the time may be longer.
  const auto isReached = [](double ratio) { return ratio >= 1 / 1.5; };
  const auto manyFigure = many.figure("calls a second on one connection, 64 under way", "calls/s",
                                      "bare calls of the same size", "at least 1/1.5", isReached);
  bench::print(manyFigure);
  bench::print(single.figure("calls a second on one connection, one after the other", "calls/s",
                             "bare calls of the same size", "", [](double) { return true; }));
  return manyFigure.reached;
}

// ---- A thousand connections --------------------------------------------------------------------

struct Usage {
  double mebibytes = 0;
  std::size_t descriptors = 0;
};

Usage usageOf(pid_t process) {
  const std::string folder = "/proc/" + std::to_string(process);
  std::ifstream file(folder + "/statm");
  std::size_t total = 0;
  std::size_t resident = 0;
  if (!(file >> total >> resident)) throw std::runtime_error("the extension is gone");
  Usage usage;
  usage.mebibytes = static_cast<double>(resident) * 4096 / (1 << 20);
  for ([[maybe_unused]] const auto& each : std::filesystem::directory_iterator(folder + "/fd")) {
    ++usage.descriptors;
  }
  return usage;
}

/// Everybody connects to both services of an item of his own, then all make every call at once, and
/// let go.
Usage crowd(const NSFileProviderServices& services, const std::vector<std::string>& identifiers,
            pid_t extension) {
  using harness::ServiceCaller;
  std::vector<std::unique_ptr<ServiceCaller>> clients;
  for (const auto& identifier : identifiers) {
    NSErrorRef error;
    clients.push_back(ServiceCaller::connect(services, identifier, &error));
    require(error, "cannot connect to the services of " + identifier);
    require(clients.back()->fetchShare().failure, "there is no share to save");
  }
  const auto calls = ServiceCaller::calls();
  Countdown left(clients.size() * calls.size());
  std::vector<std::shared_ptr<harness::ServiceCallEnds>> ends;
  for (const auto& client : clients) {
    ends.push_back(std::make_shared<harness::ServiceCallEnds>());
    ends.back()->callEverything(*client, [&] { left.done(); });
  }
  left.wait();
  const Usage full = usageOf(extension);
  for (const auto& each : ends) {
    for (std::size_t call = 0; call < calls.size(); ++call) {
      if (calls[call].answer == ServiceCaller::Answer::LeftOut) continue;
      require(each->of(call).at(0).failure, calls[call].name);
    }
  }
  return full;
}

/// What the extension uses once every call has been made, over one connection that is closed again:
/// code is in memory only after its first call, and that is nothing which connections keep.
Usage usageAfterOne(const NSFileProviderServices& services, const std::string& identifier,
                    pid_t extension) {
  const Usage untouched = usageOf(extension);
  printAlone("the extension's memory before anybody calls", untouched.mebibytes, "MiB");
  (void)crowd(services, {identifier}, extension);
  const bool isClosed =
      harness::eventually([&] { return usageOf(extension).descriptors <= untouched.descriptors; },
                          std::chrono::seconds(30));
  if (!isClosed) throw std::runtime_error("descriptors stay open");
  return usageOf(extension);
}

/// `start` is what the extension used before the crowd.
bool reportCrowd(const NSFileProviderServices& services,
                 const std::vector<std::string>& identifiers, pid_t extension, const Usage& start) {
  const auto descriptorsFall = [&] {
    return harness::eventually([&] { return usageOf(extension).descriptors <= start.descriptors; },
                               std::chrono::seconds(30));
  };
  (void)crowd(services, identifiers, extension);  // so that leaks show beside what is kept for good
  (void)descriptorsFall();
  const Usage before = usageOf(extension);
  Usage full;
  const double seconds = bench::secondsFor([&] { full = crowd(services, identifiers, extension); });
  const bool isBack = descriptorsFall();
  // Threads that were needed end some ten seconds after, and with the last of them memory goes.
  (void)harness::eventually(
      [&] { return usageOf(extension).mebibytes <= start.mebibytes * kMemoryAfterwards; },
      std::chrono::seconds(30));
  const Usage after = usageOf(extension);
  const std::string name =
      std::to_string(2 * identifiers.size()) + " connections, every call of both services";
  printAlone(name + ", all answered", seconds, "s");
  const auto descriptors = bench::compared(name + ": the extension's descriptors afterwards",
                                           static_cast<double>(after.descriptors), "",
                                           "at the start", static_cast<double>(start.descriptors),
                                           "no more", [&](double) { return isBack; });
  bench::print(descriptors);
  printAlone(name + ": descriptors while they are open", static_cast<double>(full.descriptors), "");
  const auto memory = bench::compared(name + ": the extension's memory afterwards", after.mebibytes,
                                      "MiB", "at the start", start.mebibytes, "at most 1.1 times",
                                      [](double ratio) { return ratio <= kMemoryAfterwards; });
  bench::print(memory);
  bench::print(bench::compared(name + ": its memory after the second time", after.mebibytes, "MiB",
                               "after the first", before.mebibytes, "",
                               [](double) { return true; }));
  printAlone(name + ": memory while they are open", full.mebibytes, "MiB");
  return isBack && memory.reached;
}

}  // namespace

int main() {
  raiseDescriptorLimit();
  const std::size_t count = bench::sizeFromEnvironment("YOMBER_SERVICE_CONNECTIONS", 1000);
  harness::TestDrive drive;
  for (std::size_t i = 0; i < count; ++i) drive.write("document " + std::to_string(i), "content");
  drive.up();
  bench::DaemonProcess::adoptEnvironment(drive);
  std::vector<std::string> identifiers;
  for (const auto& item : drive.json({"ls", "/"})) {
    const auto identifier = item.at("id").get<std::string>();
    if (identifier.starts_with("d:")) identifiers.push_back(identifier);
  }
  if (identifiers.size() != count) throw std::runtime_error("the listing is not whole");

  const NSFileProviderServices services(DrivePaths::forHome(drive.home()));
  const ipc::test::TemporaryDirectory directory;
  const ipc::test::EchoProcess peer(directory.file("echo"));
  NSErrorRef error;
  const auto direct = ipc::Connection::connect(directory.file("echo"), &error);
  require(error, "cannot connect");
  const auto echo = direct->bootstrap<Echo>();

  const pid_t extension = drive.pidOf(harness::TestDrive::Process::Extension);
  const Usage start = usageAfterOne(services, identifiers.front(), extension);
  bool reached = reportLatency(services, echo, identifiers);
  reached = reportRates(services, echo, identifiers.front()) && reached;
  reached = reportCrowd(services, identifiers, extension, start) && reached;
  return reached ? 0 : 1;
}
