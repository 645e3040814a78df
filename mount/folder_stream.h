#pragma once

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <utility>
#include <vector>

#include "mount/places.h"
#include "platform/foundation/file_descriptor.h"
#include "platform/foundation/lock.h"

namespace yomber {

/// An open folder that is being listed: the entries on the disk, at the positions that its file
/// system gives them, and behind them, in the root, what that shows although it lies elsewhere.
///
/// Thread-safety: one thread at a time, which holds `mutex`.
class FolderStream {
 public:
  /// `shown` is empty save in the root.
  FolderStream(FileDescriptor folder, std::vector<Places::ShownBase> shown)
      : folder_(std::move(folder)), shown_(std::move(shown)) {}

  struct Entry {
    const char* name = nullptr;  ///< on the disk, valid until the next `seek`; nil at the end
    std::uint64_t inode = 0;
    unsigned char type = 0;                    ///< DT_…
    off_t next = 0;                            ///< the position behind it
    const Places::ShownBase* shown = nullptr;  ///< what it is when it is none on the disk
  };

  // Each answers 0 or an errno.

  /// Continues at a position that an entry had as its `next`; 0 is the beginning.
  [[nodiscard]] int seek(off_t position);
  /// The entry at the position that was sought, or behind the one that was taken last. The same one
  /// until it is taken.
  [[nodiscard]] int look(Entry& entry);
  void take(const Entry& entry);

  [[nodiscard]] int descriptor() const { return folder_.get(); }

  Mutex mutex;
  /// Whoever lists it looks at every entry. Set before it is listed.
  bool isWalked = false;

 private:
  const FileDescriptor folder_;
  const std::vector<Places::ShownBase> shown_;
  std::vector<char> buffer_;
  std::size_t used_ = 0;    ///< bytes of the buffer whose entries were taken
  std::size_t filled_ = 0;  ///< bytes of the buffer
  off_t position_ = 0;
  bool isBehindDisk_ = false;
};

}  // namespace yomber
