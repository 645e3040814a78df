#include "mount/content_waits.h"

#include <algorithm>
#include <cerrno>
#include <utility>

#include "mount/file_system.h"
#include "mount/kernel_session.h"
#include "platform/foundation/log.h"
#include "platform/foundation/thread_pool.h"
#include "platform/ipc/event_loop.h"

namespace yomber {

ContentWaits::~ContentWaits() {
  std::map<const Node*, File> files;
  {
    LockGuard guard(mutex_);
    std::swap(files, files_);
  }
}

void ContentWaits::wait(fuse_req_t request, NodeUse node, const std::string& path, Then then) {
  const auto ask = [&](ContentRequests::Completion completion) {
    return requests_->provide(path, std::move(completion));
  };
  wait(request, std::move(node), Ask(ask), std::move(then));
}

void ContentWaits::wait(fuse_req_t request, NodeUse node, const Ask& ask, Then then) {
  std::uint64_t number = 0;
  {
    LockGuard guard(mutex_);
    number = ++lastNumber_;
    const Node* const key = node.get();
    File& file = files_[key];
    file.waiters.push_back({number, std::move(then)});
    file.lastWaiter = number;
    if (!file.request) {
      file.node = std::move(node);
      file.round = number;
      file.request =
          ask([this, key, number](const NSErrorRef& error) { answer(key, number, error); });
    }
    // What the library keeps for us is as large as a pointer. Under the lock: once that is released
    // the request may be answered.
    void* const kept = reinterpret_cast<void*>(number);  // NOLINT: a number, never followed
    fuse_req_interrupt_func(request, interrupted, kept);
  }
}

/// The library holds the request while it calls this, so it is answered elsewhere.
void ContentWaits::interrupted(fuse_req_t request, void* number) {
  auto& session = *static_cast<KernelSession*>(fuse_req_userdata(request));
  ContentWaits& self = session.files().contentWaits();
  ThreadPool::shared().async(
      [&self, number] { self.interrupt(reinterpret_cast<std::uint64_t>(number)); });
}

void ContentWaits::interrupt(std::uint64_t number) {
  Then then;
  {
    LockGuard guard(mutex_);
    for (auto& [node, file] : files_) {
      auto& waiters = file.waiters;
      const auto found = std::find_if(waiters.begin(), waiters.end(),
                                      [&](const Waiter& w) { return w.number == number; });
      if (found == waiters.end()) continue;
      then = std::move(found->then);
      waiters.erase(found);
      if (waiters.empty()) dropSoon(node, file.lastWaiter);
      break;
    }
  }
  if (then) then(EINTR);
}

/// Unless somebody else comes.
void ContentWaits::dropSoon(const Node* node, std::uint64_t lastWaiter) {
  ipc::EventLoop::shared().post([this, node, lastWaiter] {
    ipc::EventLoop& loop = ipc::EventLoop::shared();
    loop.detach(
        loop.timer().afterDelay(kComingBack.count() * kj::SECONDS).then([this, node, lastWaiter] {
          ThreadPool::shared().async([this, node, lastWaiter] { drop(node, lastWaiter); });
        }));
  });
}

void ContentWaits::drop(const Node* node, std::uint64_t lastWaiter) {
  File ended;  // what it holds is let go of without the lock
  LockGuard guard(mutex_);
  const auto found = files_.find(node);
  if (found == files_.end() || found->second.lastWaiter != lastWaiter) return;
  if (!found->second.waiters.empty()) return;
  ended = std::move(found->second);
  files_.erase(found);
}

void ContentWaits::answer(const Node* node, std::uint64_t round, const NSErrorRef& error) {
  File ended;
  {
    LockGuard guard(mutex_);
    const auto found = files_.find(node);
    if (found == files_.end() || found->second.round != round) return;
    ended = std::move(found->second);
    files_.erase(found);
  }
  if (error) log_default(defaultLog(), "[NOTICE] content is not to be had: %@", error);
  for (const Waiter& waiter : ended.waiters) waiter.then(errnoOf(error));
}

}  // namespace yomber
