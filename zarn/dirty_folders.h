#pragma once

#include <chrono>
#include <cstdint>
#include <deque>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <unordered_map>
#include <utility>
#include <vector>

namespace yomber {

/// What may have changed in one folder.
struct DirtyFolder {
  std::uint64_t id = 0;
  bool isWhole = false;            ///< any entry; `names` is empty then
  bool isDeep = false;             ///< and everything below
  std::vector<std::string> names;  ///< names on this disk, each once, in byte order
  unsigned attempts = 0;           ///< how often it was not found where it was thought to be
};

/// Collects what has to be looked at again, until a scan takes it.
///
/// What is noted is due at once, with two exceptions: while one end of a move has been seen and the
/// other has not, everything waits a moment for it, so that both are taken together; and a file
/// that is being written waits longer, so that it is not scanned with every block.
///
/// Thread-safety: none; the owner guards it.
class DirtyFolders {
 public:
  using Clock = std::chrono::steady_clock;

  explicit DirtyFolders(std::chrono::milliseconds modifyInterval);

  void noteName(std::uint64_t folder, std::string_view name);
  void noteWhole(std::uint64_t folder);
  void noteDeep(std::uint64_t folder);
  /// The file's content is changing.
  void noteModify(std::uint64_t folder, std::string_view name, Clock::time_point now);
  void noteMovedFrom(std::uint32_t cookie, Clock::time_point now);
  void noteMovedTo(std::uint32_t cookie);
  /// The folder is gone.
  void forget(std::uint64_t folder);
  void clear();

  /// When `take` has something to give; nothing while there is nothing.
  [[nodiscard]] std::optional<Clock::time_point> dueTime() const;
  /// What is due at `now`; not kept any longer.
  [[nodiscard]] std::vector<DirtyFolder> take(Clock::time_point now);

 private:
  struct Entry {
    bool isWhole = false;
    bool isDeep = false;
    std::set<std::string, std::less<>> names;
  };
  struct OpenMove {
    std::uint32_t cookie;
    Clock::time_point waitsUntil;
  };
  using Place = std::pair<std::uint64_t, std::string>;

  void promoteModified(Clock::time_point now);

  const std::chrono::milliseconds modifyInterval_;
  std::unordered_map<std::uint64_t, Entry> folders_;
  std::deque<OpenMove> openMoves_;  // oldest first
  std::map<Place, Clock::time_point> modified_;
  std::deque<std::pair<Clock::time_point, Place>> modifiedByTime_;  // oldest first
};

}  // namespace yomber
