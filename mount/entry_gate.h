#pragma once

#include <array>
#include <atomic>
#include <cstdint>
#include <shared_mutex>

namespace yomber {

/// Keeps entries and attributes from being told for good that were looked at before a change of
/// which the kernel has been told already.
///
/// Who tells an entry asks `now` before it looks, and tells while it holds a Telling. Who learns of
/// a change calls `change` before it tells the kernel. Thread-safety: any threads.
class EntryGate {
 public:
  using Moment = std::uint64_t;

  /// Of a folder's entries, or of what has that inode itself.
  [[nodiscard]] Moment now(std::uint64_t folder) const { return shard(folder).changes.load(); }

  /// An entry of the folder with that inode, or what has it, has changed. Waits for those who are
  /// telling.
  void change(std::uint64_t folder) { change(shard(folder)); }
  /// Anything may have changed.
  void changeAll() {
    for (Shard& shard : shards_) change(shard);
  }

  /// What is told while it lives, the kernel gets before it is told of any later change.
  class Telling {
   public:
    Telling(EntryGate& gate, std::uint64_t folder, Moment begun)
        : lock_(gate.shard(folder).telling), holds_(gate.now(folder) == begun) {}
    /// Whether nothing has changed since; else what is told must not be kept.
    [[nodiscard]] bool holds() const { return holds_; }

   private:
    std::shared_lock<std::shared_mutex> lock_;
    const bool holds_;
  };

 private:
  static constexpr std::size_t kShards = 64;
  struct Shard {
    std::atomic<Moment> changes = 0;
    std::shared_mutex telling;
  };

  [[nodiscard]] Shard& shard(std::uint64_t folder) const { return shards_[folder % kShards]; }
  static void change(Shard& shard) {
    shard.changes.fetch_add(1);
    const std::unique_lock<std::shared_mutex> wait(shard.telling);
  }

  mutable std::array<Shard, kShards> shards_;
};

}  // namespace yomber
