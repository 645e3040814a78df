#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <unordered_map>
#include <utility>
#include <vector>

#include "mount/node_table.h"
#include "platform/foundation/file_descriptor.h"
#include "platform/foundation/lock.h"

namespace yomber {

/// A file that an application has open.
///
/// Its content may be away when it is opened; then it has a descriptor of the place only (O_PATH),
/// which keeps the file through renames and removal, and hinders nobody from filling it.
///
/// Thread-safety: every operation may be called on any thread.
class OpenFile {
 public:
  /// How the kernel reads and writes it: by itself, through its page cache, or by asking each time.
  enum class Way { PassThrough, Cached, Direct };

  /// `flags` are those of open(2); what concerns the opening alone is left out of them.
  OpenFile(NodeUse node, int flags, FileDescriptor content, FileDescriptor place);
  ~OpenFile();
  OpenFile(const OpenFile&) = delete;
  OpenFile& operator=(const OpenFile&) = delete;

  [[nodiscard]] Node& node() const { return *node_.get(); }
  [[nodiscard]] bool isWritable() const;
  /// A descriptor of the content, as long as this object lives; -1 while it is away.
  [[nodiscard]] int content() const { return content_.load(std::memory_order_acquire); }
  /// A descriptor of the file, if only of its place.
  [[nodiscard]] int any() const { return content() >= 0 ? content() : place_.get(); }

  /// Opens the content, which is said to be here. 0 or an errno: EAGAIN when it is still, or again,
  /// away; EINPROGRESS when it has to be settled first and `mayWaitForDisk` is false.
  [[nodiscard]] int openContent(bool mayWaitForDisk);
  /// The first bytes of an evicted file, which it keeps; -1 and an errno (EAGAIN when they are not
  /// to be had, or its content is coming).
  [[nodiscard]] ssize_t readKept(void* bytes, std::size_t size, off_t offset) const;

  Way way = Way::Direct;              ///< set before others see the file
  std::int64_t changeWhenOpened = 0;  ///< ctime, ns
  std::uint64_t bytesWhenOpened = 0;  ///< of disk blocks

 private:
  const NodeUse node_;
  const int flags_;
  std::atomic<int> content_;
  const FileDescriptor place_;
  Mutex mutex_;  ///< one thread opens the content
};

/// Opens a file in its folder without ever waiting for anybody: `content` where the content is
/// here, else `place`. Never truncates, never settles. 0 or an errno. `mayBeAway`: then it is
/// looked at first, since an open, however short, disturbs whoever is filling the file.
[[nodiscard]] int openInPlace(int folder, const char* name, int flags, bool mayBeAway,
                              FileDescriptor& content, FileDescriptor& place);

/// The same for a file of which there is a descriptor, wherever it is.
[[nodiscard]] int openAgain(int descriptor, int flags, FileDescriptor& content,
                            FileDescriptor& place);

/// Content that has just come is marked until it is on the disk: should the power go, it is brought
/// again. What is written to it must not be taken for that, so it is made durable, and the marks
/// go, before. 0 or an errno. May wait for the disk, when there is something to settle.
[[nodiscard]] int settleForWriting(int descriptor);
/// Whether somebody is filling the file, or giving its content up: an open, however short, would
/// disturb him. `descriptor` may be of its place.
[[nodiscard]] bool isBeingChanged(int descriptor);
[[nodiscard]] bool isToBeSettled(int descriptor);
/// Of a file whose old content nobody wants any more. 0 or an errno: it is marked still, and what
/// is written to it would not count.
[[nodiscard]] int takeMarksOff(int descriptor);

/// The files that are open, by node. Thread-safety: every operation may be called on any thread.
class OpenFiles {
 public:
  /// Gives the kernel an open file to read and write by itself: its number, 0 when it does not take
  /// it. And takes it away again.
  struct Backing {
    std::function<int(int descriptor)> open;
    std::function<void(int number)> close;
  };
  explicit OpenFiles(Backing backing) : backing_(std::move(backing)) {}

  /// `wanted` is how present content is to be read. While one has the file open directly, all who
  /// come have: the kernel does not mix the ways on one file.
  std::shared_ptr<OpenFile> add(NodeTable& nodes, Node& node, int flags, FileDescriptor content,
                                FileDescriptor place, OpenFile::Way wanted);
  void remove(OpenFile& file);
  /// What the kernel reads and writes instead of the node; 0: nothing.
  [[nodiscard]] int backingOf(const Node& node) const;
  /// Any open file of the node, one with content first; nil when there is none.
  [[nodiscard]] std::shared_ptr<OpenFile> of(const Node& node) const;
  /// Whether anybody has the node open whose reads may wait for content.
  [[nodiscard]] bool mayWaitForContent(const Node& node) const;
  /// Whether anybody has the node open who may write to it.
  [[nodiscard]] bool mayBeWritten(const Node& node) const;
  [[nodiscard]] std::shared_ptr<OpenFile> shared(const OpenFile& file) const;

 private:
  /// Those of one node.
  struct OfNode {
    std::vector<std::shared_ptr<OpenFile>> files;
    int backing = 0;  ///< one for all who have it open: the kernel mixes no two
  };

  const Backing backing_;
  mutable Mutex mutex_;
  std::unordered_map<const Node*, OfNode> open_ GUARDED_BY(mutex_);
};

}  // namespace yomber
