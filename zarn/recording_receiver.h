#pragma once

#include <chrono>
#include <functional>
#include <map>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "platform/foundation/lock.h"
#include "zarn/tree_journal.h"

namespace yomber::test {

/// For tests: notes what a receiver of the journal is told, and answers at once or when it is told
/// to.
class RecordingReceiver final : public JournalReceiver {
 public:
  /// What was told since the last `didStart`, except that `calls` is never forgotten.
  struct Told {
    std::vector<std::string> calls;  ///< "start", "change", "lost"
    std::set<DiskEntry> entries;
    std::map<std::pair<std::uint64_t, std::string>, std::string> names;  ///< those shown otherwise
    std::map<std::string, std::string> containers;                       ///< by location
  };

  void start(std::vector<ShownName> shownNames, Answered answered) override {
    {
      LockGuard guard(mutex_);
      told_.names.clear();
      told_.containers.clear();
    }
    note("start", {.entries = {}, .shownNames = std::move(shownNames)}, std::move(answered));
  }
  void change(JournalBatch batch, Answered answered) override {
    note("change", batch, std::move(answered));
  }
  void loseTrack(Answered answered) override { note("lost", {}, std::move(answered)); }

  /// From now on calls are answered by `answer`.
  void hold() {
    LockGuard guard(mutex_);
    answersAtOnce_ = false;
  }
  /// Waits for a call that is not answered yet, and answers it.
  bool answer(bool taken = true) {
    Answered pending;
    if (!waitUntil([&]() NO_THREAD_SAFETY_ANALYSIS { return pending_ != nullptr; })) return false;
    {
      LockGuard guard(mutex_);
      pending = std::exchange(pending_, nullptr);
    }
    pending(taken);
    return true;
  }
  /// Answers what is held, and everything from then on at once.
  void release() {
    Answered pending;
    {
      LockGuard guard(mutex_);
      answersAtOnce_ = true;
      pending = std::exchange(pending_, nullptr);
    }
    if (pending) pending(true);
  }

  bool waitFor(const std::function<bool(const Told&)>& condition) {
    return waitUntil([&]() NO_THREAD_SAFETY_ANALYSIS { return condition(told_); });
  }
  bool waitForCalls(const std::vector<std::string>& calls) {
    return waitFor([&](const Told& told) { return told.calls == calls; });
  }
  /// Whatever has followed it.
  bool waitForStart() {
    return waitFor([](const Told& told) { return !told.calls.empty(); }) &&
           told().calls.front() == "start";
  }
  bool waitForEntry(const DiskEntry& entry) {
    return waitFor([&](const Told& told) { return told.entries.contains(entry); });
  }
  Told told() {
    LockGuard guard(mutex_);
    return told_;
  }
  void forgetEntries() {
    LockGuard guard(mutex_);
    told_.entries.clear();
  }

 private:
  void note(const char* call, const JournalBatch& batch, Answered answered) {
    {
      LockGuard guard(mutex_);
      told_.calls.emplace_back(call);
      told_.entries.insert(batch.entries.begin(), batch.entries.end());
      for (const auto& name : batch.shownNames) noteName(name);
      if (!answersAtOnce_) pending_ = std::exchange(answered, nullptr);
      changed_.notifyAll();
    }
    if (answered) answered(true);
  }

  void noteName(const ShownName& name) REQUIRES(mutex_) {
    if (!name.location.empty()) {
      told_.containers[name.location] = name.shownName;
      if (name.shownName.empty()) told_.containers.erase(name.location);
    } else if (name.shownName.empty()) {
      told_.names.erase({name.folder, name.name});
    } else {
      told_.names[{name.folder, name.name}] = name.shownName;
    }
  }

  bool waitUntil(const std::function<bool()>& condition) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(20);
    LockGuard guard(mutex_);
    while (!condition()) {
      if (!changed_.waitUntil(mutex_, deadline)) return condition();
    }
    return true;
  }

  Mutex mutex_;
  Condition changed_;
  Told told_ GUARDED_BY(mutex_);
  Answered pending_ GUARDED_BY(mutex_);
  bool answersAtOnce_ GUARDED_BY(mutex_) = true;
};

}  // namespace yomber::test
