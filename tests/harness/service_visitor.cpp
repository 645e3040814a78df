// A client of both services of an item that is killed in the middle of a call:
// service_visitor HOME IDENTIFIER CALL MOMENT GATE prints "connected", waits until the FIFO at GATE
// is open for writing, and begins the call of that number. Then, by the moment:
//
//   begun     it kills itself at once;
//   answered  it kills itself when the answer comes;
//   amid      it makes every call instead, and kills itself when CALL + 1 of them have ended;
//   held      it prints "called" when the extension has heard the call, and waits to be killed;
//   ended     it makes every call instead, waits for all, hangs up, prints "ended", and ends.
//
// With the moment "estranged" it becomes another user before it uses what the host has given it,
// makes one call over each connection, prints "answered" or "refused" for each, and ends.

#include <fcntl.h>
#include <sys/prctl.h>
#include <unistd.h>

#include <atomic>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <string_view>

#include "platform/ipc/gate.h"
#include "tests/harness/service_caller.h"

namespace yomber::testing {
namespace {

void say(const char* text) {
  (void)std::puts(text);
  (void)std::fflush(stdout);
}

void require(const NSErrorRef& error) {
  if (error == nullptr) return;
  say(error->description().c_str());
  std::_Exit(1);
}

std::unique_ptr<ServiceCaller> connect(const char* home, const char* identifier) {
  NSErrorRef error;
  auto caller =
      ServiceCaller::connect(NSFileProviderServices(DrivePaths::forHome(home)), identifier, &error);
  require(error);
  return caller;
}

void waitForGate(const char* path) {
  const int gate = open(path, O_RDONLY | O_CLOEXEC);
  if (gate < 0) std::_Exit(1);
  close(gate);
}

[[noreturn]] void waitToBeKilled() {
  for (;;) pause();
}

[[noreturn]] void die() {
  (void)raise(SIGKILL);
  std::abort();
}

void callEverything(const ServiceCaller& caller, std::size_t wanted, std::function<void()> then) {
  const auto ended = std::make_shared<std::atomic<std::size_t>>(0);
  std::make_shared<ServiceCallEnds>()->callEverything(caller,
                                                      [ended, wanted, then = std::move(then)] {
                                                        if (++*ended == wanted) then();
                                                      });
}

void endInOrder(std::unique_ptr<ServiceCaller> caller) {
  ipc::Gate all;
  callEverything(*caller, ServiceCaller::calls().size(), [&] { all.open(); });
  all.wait();
  caller.reset();
  say("ended");
}

void becomeAnotherUser() {
  constexpr uid_t kNobody = 65534;
  if (getuid() == kNobody) return;
  if (setgid(kNobody) != 0 || setuid(kNobody) != 0) std::_Exit(1);
}

int visitAsAnotherUser(const char* home, const char* identifier) {
  NSErrorRef error;
  const auto caller =
      ServiceCaller::connect(NSFileProviderServices(DrivePaths::forHome(home)), identifier, &error,
                             [](NSXPCConnection&) { becomeAnotherUser(); });
  require(error);
  for (const ServiceCallEnd& end : {caller->fetchShare(), caller->waitForAnswer()})
    say(end.failure == nullptr ? "answered" : "refused");
  return 0;
}

int visit(const char* home, const char* identifier, std::size_t number, std::string_view moment,
          const char* gate) {
  if (moment == "estranged") return visitAsAnotherUser(home, identifier);
  auto caller = connect(home, identifier);
  require(caller->fetchShare().failure);
  // Has its answers also while the others' are held up.
  const auto witness = connect(home, identifier);
  require(witness->waitForAnswer().failure);
  say("connected");
  waitForGate(gate);
  const ServiceCaller::Call& call = ServiceCaller::calls()[number];
  if (moment == "begun") {
    call.begin(*caller, [](const ServiceCallEnd&) {});
    die();
  }
  if (moment == "answered") {
    call.begin(*caller, [](const ServiceCallEnd&) { die(); });
    waitToBeKilled();
  }
  if (moment == "amid") {
    callEverything(*caller, number + 1, [] { die(); });
    waitToBeKilled();
  }
  if (moment == "held") {
    call.begin(*caller, [](const ServiceCallEnd&) {});
    require(witness->waitForAnswer().failure);
    say("called");
    waitToBeKilled();
  }
  if (moment != "ended") return 64;
  endInOrder(std::move(caller));
  return 0;
}

}  // namespace
}  // namespace yomber::testing

int main(int argc, char** argv) {
  using yomber::testing::ServiceCaller;
  if (argc != 6) return 64;
  const std::size_t number = std::strtoull(argv[3], nullptr, 10);
  if (number >= ServiceCaller::calls().size()) return 64;
  // Nobody is left waiting when the test itself is killed.
  (void)prctl(PR_SET_PDEATHSIG, SIGKILL);
  return yomber::testing::visit(argv[1], argv[2], number, argv[4], argv[5]);
}
