#include "fileproviderd/host_clock.h"

#include <utility>

#include "platform/ipc/event_loop.h"

namespace yomber {
namespace {

/// The promise holds only a weak reference, so that a timer may end while its own work runs.
class LoopTimer final : public HostClock::Timer {
 public:
  explicit LoopTimer(std::function<void()> work)
      : work_(std::make_shared<std::function<void()>>(std::move(work))) {}

  void arm(std::chrono::milliseconds delay) {
    auto& loop = ipc::EventLoop::shared();
    loop.detach(loop.timer()
                    .afterDelay(delay.count() * kj::MILLISECONDS)
                    .then([weak = std::weak_ptr(work_)] {
                      if (const auto work = weak.lock()) (*work)();
                    }));
  }

 private:
  const std::shared_ptr<std::function<void()>> work_;
};

}  // namespace

HostClock::TimerRef LoopClock::after(std::chrono::milliseconds delay, std::function<void()> work) {
  auto timer = std::make_unique<LoopTimer>(std::move(work));
  timer->arm(delay);
  return timer;
}

}  // namespace yomber
