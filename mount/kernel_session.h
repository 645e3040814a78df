#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <string>

#include "mount/fuse.h"
#include "mount/node_table.h"
#include "platform/foundation/error.h"

namespace yomber {

class FileSystem;

/// The mount as the kernel sees it: a session with its requests, and what it is told of itself.
///
/// Thread-safety: every operation may be called on any thread, `run` on one.
class KernelSession {
 public:
  struct Options {
    std::string mountPoint;
    bool allowOthers = false;    ///< users other than the one who mounts may use it
    bool isPrivileged = false;   ///< devices, set-id bits and reading past us are for root only
    bool mayPassThrough = true;  ///< off for comparison
  };

  /// Mounts. A mount that a process left behind there is taken away first. Nil and an error that
  /// says what to do otherwise.
  static std::unique_ptr<KernelSession> mount(FileSystem& files, const Options& options,
                                              NSErrorRef* error);
  /// Unmounts.
  ~KernelSession();
  KernelSession(const KernelSession&) = delete;
  KernelSession& operator=(const KernelSession&) = delete;

  /// Answers requests until the mount is taken away, or `end` is called. 0 or an errno.
  [[nodiscard]] int run();
  /// Has `run` return. From any thread, as long as the session lives.
  void end();

  [[nodiscard]] FileSystem& files() const { return files_; }

  /// Whether the kernel can read and write files by itself.
  [[nodiscard]] bool canPassThrough() const { return canPassThrough_; }
  /// Gives the kernel an open file to read and write by itself. Its number; 0 when it does not take
  /// it, as then it never does.
  [[nodiscard]] int openBacking(int descriptor);
  void closeBacking(int number);

  // What the kernel keeps and no longer holds. It may have forgotten it: then nothing happens. None
  // may be called while a request about the folder or file is waited for.

  /// The entry is another one, or gone.
  void entryIsOther(const Node& folder, const std::string& name);
  /// The entry may be another one: it is looked up before it is used again.
  void entryMayBeOther(const Node& folder, const std::string& name);
  void attributesAreOther(const Node& node);
  /// Content and attributes.
  void contentIsOther(const Node& node);

 private:
  KernelSession(FileSystem& files, const Options& options) : files_(files), options_(options) {}
  NSErrorRef begin();

  static ssize_t readRequest(int descriptor, void* buffer, std::size_t size, void* self);
  static ssize_t writeReply(int descriptor, iovec* parts, int count, void* self);
  void noteOffer(const void* request, std::size_t size);

  FileSystem& files_;
  const Options options_;
  fuse_session* session_ = nullptr;
  bool isMounted_ = false;
  std::atomic<bool> isOver_ = false;
  /// The number of the one in which both sides say what they can. What changes is told by other
  /// threads, maybe before it is answered.
  std::atomic<std::uint64_t> firstRequest_ = 0;
  std::atomic<bool> isSettled_ = false;  ///< what both can
  bool canMapDirect_ = false;
  bool canTakeSetIDAway_ = false;
  std::atomic<bool> canPassThrough_ = false;
};

/// How the kernel names nodes.
[[nodiscard]] fuse_ino_t numberOf(const Node& node);

}  // namespace yomber
