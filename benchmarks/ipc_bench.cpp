// What a call between two processes costs beside a bare socket: one caller, eight callers, and
// pages of items. The peer is a process of its own (ipc_echo_peer).

#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <csignal>
#include <cstdint>
#include <cstdio>
#include <functional>
#include <thread>
#include <vector>

#include "benchmarks/figure.h"
#include "platform/ipc/call.h"
#include "platform/ipc/connection.h"
#include "platform/ipc/test_echo_server.h"

namespace {

using namespace yomber;
using namespace yomber::ipc;
using test::Echo;

constexpr int kRounds = 20'000;
constexpr int kPages = 3'000;
constexpr int kThreads = 8;
constexpr std::uint32_t kItemsPerPage = 200;
constexpr std::uint32_t kItemBytes = 300;
constexpr std::size_t kMessageBytes = 64;

using Clock = std::chrono::steady_clock;

/// Microseconds of each of `rounds` runs of `work`, after some that warm up.
std::vector<double> measure(int rounds, const std::function<void()>& work) {
  std::vector<double> times;
  times.reserve(static_cast<std::size_t>(rounds));
  for (int i = -rounds / 10; i < rounds; ++i) {
    const auto start = Clock::now();
    work();
    const std::chrono::duration<double, std::micro> taken = Clock::now() - start;
    if (i >= 0) times.push_back(taken.count());
  }
  return times;
}

bool readMessage(int fd, char* message) {
  for (std::size_t at = 0; at < kMessageBytes;) {
    const ssize_t count = ::read(fd, message + at, kMessageBytes - at);
    if (count <= 0) return false;
    at += static_cast<std::size_t>(count);
  }
  return true;
}

/// Two processes that send each other 64 bytes and do nothing else. Forks: call it first.
std::vector<double> bareEcho() {
  UniqueFd ours;
  UniqueFd theirs;
  if (!makeSocketPair(ours, theirs)) return {};
  const pid_t child = ::fork();
  char message[kMessageBytes] = {};
  if (child == 0) {
    ours.reset();
    while (readMessage(theirs.get(), message) &&
           ::write(theirs.get(), message, sizeof message) > 0) {
    }
    ::_exit(0);
  }
  theirs.reset();
  auto times = measure(kRounds, [&] {
    (void)!::write(ours.get(), message, sizeof message);
    readMessage(ours.get(), message);
  });
  ours.reset();
  ::waitpid(child, nullptr, 0);
  return times;
}

void callOnce(const Remote<Echo>& echo) {
  if (const NSErrorRef error = test::echoOnce(echo)) {
    std::fprintf(stderr, "A call failed: %s\n", error->description().c_str());
    std::exit(1);
  }
}

std::vector<double> callsFromThreads(const Remote<Echo>& echo) {
  std::vector<std::vector<double>> times(kThreads);
  std::vector<std::thread> threads;
  threads.reserve(times.size());
  for (auto& own : times) {
    threads.emplace_back(
        [&own, &echo] { own = measure(kRounds / kThreads, [&] { callOnce(echo); }); });
  }
  std::vector<double> all;
  for (std::size_t i = 0; i < threads.size(); ++i) {
    threads[i].join();
    all.insert(all.end(), times[i].begin(), times[i].end());
  }
  return all;
}

/// One page, every field of which is looked at; answers the bytes of its payloads.
std::uint64_t fetchPage(const Remote<Echo>& echo) {
  std::uint64_t bytes = 0;
  const NSErrorRef error = callAndWait(
      echo, &Echo::Client::pageRequest,
      [](Echo::PageParams::Builder params) {
        params.setLimit(kItemsPerPage);
        params.setItemBytes(kItemBytes);
      },
      [&](Echo::PageResults::Reader results) {
        for (const auto item : results.getItems()) {
          if (item.getId() == 0 || item.getName().size() == 0) continue;
          bytes += item.getPayload().size();
        }
      });
  return error ? 0 : bytes;
}

void report(const char* name, double value, const char* unit) {
  bench::Figure figure;
  figure.name = name;
  figure.value = value;
  figure.unit = unit;
  bench::print(figure);
}

/// Median beside the bare echo's, and the 99th percentile.
bool reportCalls(const std::string& name, const std::vector<double>& times, double bare,
                 double goal) {
  const auto limit = [goal](double ratio) { return ratio <= goal; };
  char text[64];
  std::snprintf(text, sizeof text, "at most %g times", goal);
  const auto figure = bench::compared(name + ", median", bench::percentile(times, 0.5), "us",
                                      "bare socket echo", bare, text, limit);
  bench::print(figure);
  report((name + ", 99th percentile").c_str(), bench::percentile(times, 0.99), "us");
  return figure.reached;
}

}  // namespace

int main() {
  const auto bareTimes = bareEcho();
  const double bare = bench::percentile(bareTimes, 0.5);
  report("bare socket echo, median", bare, "us");
  report("bare socket echo, 99th percentile", bench::percentile(bareTimes, 0.99), "us");

  const test::TemporaryDirectory directory;
  const test::EchoProcess peer(directory.file("echo"));
  NSErrorRef error;
  const auto connection = Connection::connect(directory.file("echo"), &error);
  if (!connection) {
    std::fprintf(stderr, "%s\n", error->localizedDescription().c_str());
    return 1;
  }
  const auto echo = connection->bootstrap<Echo>();

  bool reached = reportCalls("call", measure(kRounds, [&] { callOnce(echo); }), bare, 6);
  const double start = bench::secondsFor(
      [&] { reached &= reportCalls("call from 8 threads", callsFromThreads(echo), bare, 38); });
  report("calls a second from 8 threads", kRounds * 1.1 / start, "calls/s");

  bool complete = true;
  std::vector<double> pages;
  const double seconds = bench::secondsFor([&] {
    pages = measure(kPages, [&] { complete &= fetchPage(echo) == kItemsPerPage * kItemBytes; });
  });
  report("page of 200 items of 300 bytes, median", bench::percentile(pages, 0.5), "us");
  report("items by pages", kItemsPerPage * kPages * 1.1 / seconds, "items/s");
  if (!complete) std::fprintf(stderr, "A page was not complete.\n");
  return reached && complete ? 0 : 1;
}
