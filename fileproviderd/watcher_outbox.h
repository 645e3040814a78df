#pragma once

#include <deque>
#include <functional>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "platform/fileprovider/item.h"
#include "platform/foundation/error.h"

namespace yomber {

/// Whoever watches a container. `answered` is to be called once, when the watcher took the call (or
/// will never), never before the call returns. Thread-safety: loop thread only.
class ContainerWatcher {
 public:
  using Answered = std::function<void()>;
  virtual ~ContainerWatcher() = default;
  virtual void didList(const std::vector<ItemFields>& items, bool last, Answered answered) = 0;
  virtual void didUpdate(const std::vector<ItemFields>& items, Answered answered) = 0;
  virtual void didDelete(const std::vector<std::string>& identifiers, Answered answered) = 0;
  virtual void didPause(const NSErrorRef& error, Answered answered) = 0;
  virtual void didResume(Answered answered) = 0;
  virtual void didEnd(const NSErrorRef& error, Answered answered) = 0;
};

/// Sends calls to a watcher, each when the last was answered.
///
/// Thread-safety: loop thread only.
class WatcherOutbox : public std::enable_shared_from_this<WatcherOutbox> {
 public:
  using Call = std::function<void(ContainerWatcher& watcher, ContainerWatcher::Answered answered)>;

  /// `onIdle` is called whenever the last call was answered.
  explicit WatcherOutbox(std::shared_ptr<ContainerWatcher> watcher)
      : watcher_(std::move(watcher)) {}
  void setOnIdle(std::function<void()> onIdle) { onIdle_ = std::move(onIdle); }

  void send(Call call);
  [[nodiscard]] bool isIdle() const { return !isBusy_ && waiting_.empty(); }

 private:
  void sendNext();

  const std::shared_ptr<ContainerWatcher> watcher_;
  std::function<void()> onIdle_;
  std::deque<Call> waiting_;
  bool isBusy_ = false;
};

}  // namespace yomber
