#include "platform/foundation/operation.h"

#include <cxxabi.h>

#include <cstdint>
#include <cstdlib>
#include <deque>
#include <map>
#include <typeinfo>
#include <utility>

#include "platform/foundation/lock.h"
#include "platform/foundation/log_format.h"
#include "platform/foundation/thread_pool.h"

namespace yomber {
namespace {

std::string classNameOf(const NSOperation& operation) {
  const char* const mangled = typeid(operation).name();
  int status = 0;
  const std::unique_ptr<char, decltype(&std::free)> plain(
      abi::__cxa_demangle(mangled, nullptr, nullptr, &status), &std::free);
  return status == 0 ? plain.get() : mangled;
}

}  // namespace

struct NSOperation::State {
  enum class Stage : std::uint8_t { Pending, Executing, Finished };

  mutable Mutex mutex;
  mutable Condition finished;
  Stage stage GUARDED_BY(mutex) = Stage::Pending;
  bool cancelled GUARDED_BY(mutex) = false;
  std::function<void()> completionBlock GUARDED_BY(mutex);
  std::vector<std::function<void()>> finishObservers GUARDED_BY(mutex);
  std::vector<NSOperationRef> dependencies GUARDED_BY(mutex);
};

NSOperation::NSOperation() : state_(std::make_unique<State>()) {}

NSOperation::~NSOperation() = default;

void NSOperation::start() {
  const auto self = weak_from_this().lock();  // stays until the work is done, whoever drops it
  bool cancelled = false;
  {
    LockGuard guard(state_->mutex);
    if (state_->stage != State::Stage::Pending) return;
    state_->stage = State::Stage::Executing;
    cancelled = state_->cancelled;
  }
  if (!cancelled) main();
  if (cancelled || !isAsynchronous()) finish();
}

void NSOperation::cancel() {
  LockGuard guard(state_->mutex);
  state_->cancelled = true;
}

bool NSOperation::isCancelled() const {
  LockGuard guard(state_->mutex);
  return state_->cancelled;
}

bool NSOperation::isExecuting() const {
  LockGuard guard(state_->mutex);
  return state_->stage == State::Stage::Executing;
}

bool NSOperation::isFinished() const {
  LockGuard guard(state_->mutex);
  return state_->stage == State::Stage::Finished;
}

void NSOperation::waitUntilFinished() const {
  LockGuard guard(state_->mutex);
  while (state_->stage != State::Stage::Finished) state_->finished.wait(state_->mutex);
}

void NSOperation::setCompletionBlock(std::function<void()> block) {
  LockGuard guard(state_->mutex);
  std::swap(state_->completionBlock, block);
}

void NSOperation::addDependency(const NSOperationRef& operation) {
  LockGuard guard(state_->mutex);
  state_->dependencies.push_back(operation);
}

std::vector<NSOperationRef> NSOperation::dependencies() const {
  LockGuard guard(state_->mutex);
  return state_->dependencies;
}

std::string NSOperation::description() const {
  static constexpr LogFormat<std::string, std::uint64_t> kFormat("<%s: 0x%llx>");
  return kFormat.render(classNameOf(*this), reinterpret_cast<std::uintptr_t>(this));
}

void NSOperation::finish() {
  const auto self = weak_from_this().lock();
  std::function<void()> completion;
  std::vector<std::function<void()>> observers;
  std::vector<NSOperationRef> dependencies;  // let go of, so that chains do not pile up
  {
    LockGuard guard(state_->mutex);
    if (std::exchange(state_->stage, State::Stage::Finished) == State::Stage::Finished) return;
    completion = std::exchange(state_->completionBlock, nullptr);
    observers.swap(state_->finishObservers);
    dependencies.swap(state_->dependencies);
    state_->finished.notifyAll();
  }
  if (completion) completion();
  for (const auto& observer : observers) observer();
}

void NSOperation::whenFinished(std::function<void()> observer) {
  {
    LockGuard guard(state_->mutex);
    if (state_->stage != State::Stage::Finished) {
      state_->finishObservers.push_back(std::move(observer));
      return;
    }
  }
  observer();
}

// ---- The queue -------------------------------------------------------------------------------

namespace {

class BlockOperation final : public NSOperation {
 public:
  explicit BlockOperation(std::function<void()> block) : block_(std::move(block)) {}

 protected:
  void main() override { block_(); }

 private:
  const std::function<void()> block_;
};

}  // namespace

struct NSOperationQueue::State : std::enable_shared_from_this<NSOperationQueue::State> {
  struct Entry {
    NSOperationRef operation;
    std::size_t unfinishedDependencies = 0;
    bool isRunning = false;
  };

  mutable Mutex mutex;
  mutable Condition allFinished;
  std::map<std::uint64_t, Entry> entries GUARDED_BY(mutex);  ///< by order of adding
  std::uint64_t lastNumber GUARDED_BY(mutex) = 0;
  std::deque<std::uint64_t> ready GUARDED_BY(mutex);  ///< may name entries that are gone
  std::size_t running GUARDED_BY(mutex) = 0;
  std::size_t maximum GUARDED_BY(mutex) = kDefaultMaxConcurrentOperationCount;
  bool suspended GUARDED_BY(mutex) = false;

  void add(const NSOperationRef& operation) {
    const auto dependencies = operation->dependencies();
    std::uint64_t number = 0;
    {
      LockGuard guard(mutex);
      number = ++lastNumber;
      // One more than there are, so that it does not become ready before all are registered.
      entries.emplace(number, Entry{operation, dependencies.size() + 1});
    }
    const auto self = shared_from_this();
    for (const auto& dependency : dependencies) {
      dependency->whenFinished([self, number] { self->oneLess(number); });
    }
    operation->whenFinished([self, number] { self->finished(number); });
    oneLess(number);
  }

  /// One thing less that the operation waits for.
  void oneLess(std::uint64_t number) {
    {
      LockGuard guard(mutex);
      const auto found = entries.find(number);
      if (found == entries.end() || --found->second.unfinishedDependencies > 0) return;
      ready.push_back(number);
    }
    startReady();
  }

  void finished(std::uint64_t number) {
    Entry released;  // destroyed after the lock was left
    {
      LockGuard guard(mutex);
      const auto found = entries.find(number);
      released = std::move(found->second);
      entries.erase(found);
      if (released.isRunning) --running;
      if (entries.empty()) allFinished.notifyAll();
    }
    startReady();
  }

  void startReady() {
    std::vector<NSOperationRef> starting;
    {
      LockGuard guard(mutex);
      while (!suspended && !ready.empty() && running < maximum) {
        const auto found = entries.find(ready.front());
        ready.pop_front();
        if (found == entries.end()) continue;
        found->second.isRunning = true;
        ++running;
        starting.push_back(found->second.operation);
      }
    }
    for (auto& operation : starting) {
      ThreadPool::shared().async([started = std::move(operation)] { started->start(); });
    }
  }
};

NSOperationQueue::NSOperationQueue() : state_(std::make_shared<State>()) {}

NSOperationQueue::~NSOperationQueue() = default;

void NSOperationQueue::addOperation(const NSOperationRef& operation) { state_->add(operation); }

void NSOperationQueue::addOperationWithBlock(std::function<void()> block) {
  addOperation(std::make_shared<BlockOperation>(std::move(block)));
}

std::vector<NSOperationRef> NSOperationQueue::operations() const {
  std::vector<NSOperationRef> out;
  LockGuard guard(state_->mutex);
  for (const auto& [number, entry] : state_->entries) out.push_back(entry.operation);
  return out;
}

void NSOperationQueue::setMaxConcurrentOperationCount(std::size_t count) {
  {
    LockGuard guard(state_->mutex);
    state_->maximum = count;
  }
  state_->startReady();
}

void NSOperationQueue::setSuspended(bool suspended) {
  {
    LockGuard guard(state_->mutex);
    state_->suspended = suspended;
  }
  state_->startReady();
}

bool NSOperationQueue::isSuspended() const {
  LockGuard guard(state_->mutex);
  return state_->suspended;
}

void NSOperationQueue::cancelAllOperations() {
  for (const auto& operation : operations()) operation->cancel();
}

void NSOperationQueue::waitUntilAllOperationsAreFinished() const {
  LockGuard guard(state_->mutex);
  while (!state_->entries.empty()) state_->allFinished.wait(state_->mutex);
}

}  // namespace yomber
