#include "provider/testing/recording_manager.h"

#include <chrono>

#include "platform/fileprovider/manager.h"
#include "platform/foundation/lock.h"

namespace yomber {
namespace {

constexpr auto kPatience = std::chrono::seconds(10);

}  // namespace

class RecordingManager::Transport : public NSFileProviderManager::Transport {
 public:
  void signalEnumerator(const NSFileProviderItemIdentifier& container,
                        std::function<void(NSErrorRef)> completionHandler) override {
    NSErrorRef answer;
    {
      LockGuard guard(_lock);
      _signals.push_back(container);
      answer = _answer;
      _changed.notifyAll();
    }
    if (completionHandler) completionHandler(answer);
  }
  void setAnswer(NSErrorRef error) {
    LockGuard guard(_lock);
    _answer = std::move(error);
  }
  std::vector<NSFileProviderItemIdentifier> signals() {
    LockGuard guard(_lock);
    return _signals;
  }
  bool waitForSignals(std::size_t count) {
    const auto deadline = std::chrono::steady_clock::now() + kPatience;
    LockGuard guard(_lock);
    while (_signals.size() < count) {
      if (!_changed.waitUntil(_lock, deadline)) return _signals.size() >= count;
    }
    return true;
  }

 private:
  Mutex _lock;
  Condition _changed;
  std::vector<NSFileProviderItemIdentifier> _signals GUARDED_BY(_lock);
  NSErrorRef _answer GUARDED_BY(_lock);
};

RecordingManager::RecordingManager() : _transport(std::make_shared<Transport>()) {
  NSFileProviderManager::defaultManager().setTransport(_transport);
}

RecordingManager::~RecordingManager() {
  NSFileProviderManager::defaultManager().setTransport(nullptr);
}

void RecordingManager::setAnswer(NSErrorRef error) { _transport->setAnswer(std::move(error)); }

std::vector<NSFileProviderItemIdentifier> RecordingManager::signals() const {
  return _transport->signals();
}

bool RecordingManager::waitForSignals(std::size_t count) const {
  return _transport->waitForSignals(count);
}

}  // namespace yomber
