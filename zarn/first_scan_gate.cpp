#include "zarn/first_scan_gate.h"

#include <utility>

#include "platform/ipc/event_loop.h"

namespace yomber {

void FirstScanGate::open() {
  isOpen_.store(true, std::memory_order_release);
  ipc::EventLoop::shared().post([self = shared_from_this()] { self->settle(nullptr); });
}

void FirstScanGate::fail(NSErrorRef error) {
  failure_.store(error);
  ipc::EventLoop::shared().post([self = shared_from_this(), error] { self->settle(error); });
}

void FirstScanGate::retry() { failure_.store(nullptr); }

kj::Promise<NSErrorRef> FirstScanGate::wait() {
  ipc::EventLoop::shared().assertCurrent("FirstScanGate::wait");
  // Whoever waits already goes first, also when the gate has opened meanwhile.
  if (isOpen() && waiting_.empty()) return NSErrorRef();
  if (auto failure = failure_.load()) return failure;
  auto pair = kj::newPromiseAndFulfiller<NSErrorRef>();
  waiting_.push_back(kj::mv(pair.fulfiller));
  return kj::mv(pair.promise);
}

void FirstScanGate::settle(NSErrorRef error) {
  for (auto& fulfiller : std::exchange(waiting_, {})) fulfiller->fulfill(NSErrorRef(error));
}

}  // namespace yomber
