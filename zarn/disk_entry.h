#pragma once

#include <compare>
#include <cstdint>
#include <string>
#include <vector>

namespace yomber {

/// Something on disk that may have changed.
struct DiskEntry {
  std::uint64_t folder = 0;  ///< its inode number
  /// On disk. Empty: any entry of the folder, and the folder itself. ".": its own attributes only.
  std::string name;

  friend auto operator<=>(const DiskEntry&, const DiskEntry&) = default;
};

/// Told of what is seen to happen on disk, at once, before anything is scanned.
class DiskEventSink {
 public:
  virtual ~DiskEventSink() = default;
  /// Whether anybody wants to be told. Cheap; called for everything that happens.
  [[nodiscard]] virtual bool wantsEvents() const = 0;
  /// Must not block. Called on the thread that saw it, with no lock held.
  virtual void entriesDidChange(const std::vector<DiskEntry>& entries) = 0;
  /// Anything may have changed.
  virtual void didLoseTrack() = 0;
};

}  // namespace yomber
