#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "tests/harness/child_process.h"

namespace yomber::testing {

/// An ext4 file system on a disk whose power can be cut: what was not synced is lost. It is an
/// image behind `volatile_disk`, mounted by way of a loop device. Needs root.
///
/// Mounted in a namespace of the thread that makes it, and of what that starts: to be made before
/// other threads. For one thread.
class PowerDisk {
 public:
  /// Why this machine cannot have one.
  static std::optional<std::string> reasonItCannotBe();

  /// Made and mounted. Throws when that fails.
  explicit PowerDisk(std::uint64_t bytes);
  ~PowerDisk();
  PowerDisk(const PowerDisk&) = delete;
  PowerDisk& operator=(const PowerDisk&) = delete;

  /// Where the file system is.
  [[nodiscard]] const std::string& mountPoint() const { return mountPoint_; }
  /// The bare disk, and what tells it to be cut.
  [[nodiscard]] std::string diskPath() const { return layer_ + "/disk"; }
  [[nodiscard]] std::string controlPath() const { return layer_ + "/control"; }
  /// Outside of the disk; not lost with it.
  [[nodiscard]] const std::string& outside() const { return directory_; }

  /// The power goes. Blocks that were not synced survive with that probability.
  void cut(std::uint64_t seed, unsigned percent);
  /// How many blocks the last cut lost.
  [[nodiscard]] std::uint64_t lostBlocks() const;
  /// After a cut, when nobody uses the file system any more: takes it off the dead disk.
  void unmount();
  /// The power is back: the journal is replayed, the file system is checked and mounted.
  void comeBack();

 private:
  void command(const std::string& words) const;
  void mount();

  std::string directory_;
  std::string layer_;
  std::string mountPoint_;
  std::unique_ptr<LineProcess> process_;
  bool isMounted_ = false;
};

}  // namespace yomber::testing
