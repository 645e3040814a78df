#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <unordered_map>
#include <vector>

#include "platform/foundation/error.h"
#include "platform/foundation/lock.h"
#include "platform/foundation/progress.h"

namespace yomber {

/// Who waits for which item's content.
///
/// Thread-safety: every operation may be called on any thread.
class Wishes {
 public:
  using Completion = std::function<void(NSErrorRef)>;

  /// Answers the wish's number. `progress` is the item's.
  std::uint64_t add(std::uint64_t item, Completion completion, NSProgressRef& progress) {
    LockGuard guard(mutex_);
    Item& its = items_[item];
    if (!its.progress) its.progress = NSProgress::progressWithTotalUnitCount(0);
    progress = its.progress;
    its.completions.emplace(++lastNumber_, std::move(completion));
    return lastNumber_;
  }
  /// The completion of a wish that is taken back; empty when it was answered before.
  [[nodiscard]] Completion remove(std::uint64_t item, std::uint64_t number) {
    LockGuard guard(mutex_);
    const auto found = items_.find(item);
    if (found == items_.end()) return {};
    const auto wish = found->second.completions.find(number);
    if (wish == found->second.completions.end()) return {};
    Completion completion = std::move(wish->second);
    found->second.completions.erase(wish);
    if (found->second.completions.empty()) items_.erase(found);
    return completion;
  }
  [[nodiscard]] bool isWanted(std::uint64_t item) const {
    LockGuard guard(mutex_);
    return items_.contains(item);
  }
  /// Null when nobody waits.
  [[nodiscard]] NSProgressRef progress(std::uint64_t item) const {
    LockGuard guard(mutex_);
    const auto found = items_.find(item);
    return found == items_.end() ? nullptr : found->second.progress;
  }
  /// Everybody who waits for the item; they wait no longer.
  [[nodiscard]] std::vector<Completion> take(std::uint64_t item) {
    LockGuard guard(mutex_);
    const auto found = items_.find(item);
    if (found == items_.end()) return {};
    std::vector<Completion> result;
    for (auto& [number, completion] : found->second.completions) {
      result.push_back(std::move(completion));
    }
    items_.erase(found);
    return result;
  }
  [[nodiscard]] std::vector<Completion> takeAll() {
    LockGuard guard(mutex_);
    std::vector<Completion> result;
    for (auto& [item, its] : items_) {
      for (auto& [number, completion] : its.completions) result.push_back(std::move(completion));
    }
    items_.clear();
    return result;
  }

 private:
  struct Item {
    NSProgressRef progress;
    std::map<std::uint64_t, Completion> completions;
  };
  mutable Mutex mutex_;
  std::unordered_map<std::uint64_t, Item> items_ GUARDED_BY(mutex_);
  std::uint64_t lastNumber_ GUARDED_BY(mutex_) = 0;
};

}  // namespace yomber
