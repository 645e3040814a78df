#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "mount/content_waits.h"
#include "mount/desktop_thumbnails.h"
#include "mount/entry_gate.h"
#include "mount/entry_notices.h"
#include "mount/folder_descriptors.h"
#include "mount/folder_stream.h"
#include "mount/fuse.h"
#include "mount/kernel_session.h"
#include "mount/local_space.h"
#include "mount/node_table.h"
#include "mount/open_files.h"
#include "mount/places.h"
#include "platform/foundation/thread_pool.h"

namespace yomber {

class FolderListing;

/// The drive as a folder: every request of the kernel, carried out on the tree.
///
/// Nothing here waits for anybody, except requests that need content which is away: those are
/// answered when it has come, and hold no thread meanwhile. What has to be on the disk first is
/// waited for on threads of its own. Every operation answers its request exactly once.
/// Thread-safety: any number of requests at a time.
class FileSystem {
 public:
  FileSystem(std::unique_ptr<Places> places, std::shared_ptr<ContentRequests> requests);
  ~FileSystem();
  FileSystem(const FileSystem&) = delete;
  FileSystem& operator=(const FileSystem&) = delete;

  void setSession(KernelSession* session) { session_ = session; }
  /// Who keeps local content within a bound, if anybody.
  void setLocalSpace(LocalSpace* space) { space_ = space; }
  /// Who fills the desktop's store of thumbnails, if anybody.
  void setThumbnails(DesktopThumbnails* thumbnails) { thumbnails_ = thumbnails; }
  [[nodiscard]] DesktopThumbnails* thumbnails() const { return thumbnails_; }
  /// The entry of the folder with that inode has appeared, changed or gone.
  void noteChangedEntry(std::uint64_t folder, const std::string& nameOnDisk);
  /// Whether changes are told to us as they happen: what the kernel is told holds until then, and
  /// for a moment only otherwise.
  void setIsTold(bool isTold) { isTold_ = isTold; }
  /// Whether the kernel takes entries without their attributes where it asks for them with these:
  /// then it is for us to say who gets them.
  void setChoosesAttributes(bool chooses) { choosesAttributes_ = chooses; }

  [[nodiscard]] NodeTable& nodes() { return nodes_; }
  [[nodiscard]] Places& places() { return *places_; }
  [[nodiscard]] FolderDescriptors& folders() { return folders_; }
  [[nodiscard]] EntryGate& gate() { return gate_; }
  [[nodiscard]] EntryNotices& entryNotices() { return entryNotices_; }
  [[nodiscard]] ContentWaits& contentWaits() { return waits_; }
  [[nodiscard]] Node& root() const { return *root_; }
  [[nodiscard]] Node& nodeOf(fuse_ino_t number) const;
  /// Whether a read of the node may be waiting for content.
  [[nodiscard]] bool mayWaitForContent(const Node& node) const {
    return openFiles_.mayWaitForContent(node);
  }
  /// The node of something that the root shows although it lies elsewhere.
  [[nodiscard]] Node& nodeOfBase(std::uint32_t base);

  // --- entries.cpp
  void lookup(fuse_req_t request, Node& folder, const char* name);
  void forget(fuse_req_t request, Node& node, std::uint64_t lookups);
  void forgetMany(fuse_req_t request, std::size_t count, fuse_forget_data* forgotten);

  // --- attributes.cpp
  void getattr(fuse_req_t request, Node& node, fuse_file_info* info);
  void setattr(fuse_req_t request, Node& node, struct stat* wanted, int which,
               fuse_file_info* info);
  void readlink(fuse_req_t request, Node& node);
  void statfs(fuse_req_t request, Node& node);
  void setxattr(fuse_req_t request, Node& node, const char* name, const char* value,
                std::size_t size, int flags);
  void getxattr(fuse_req_t request, Node& node, const char* name, std::size_t size);
  void listxattr(fuse_req_t request, Node& node, std::size_t size);
  void removexattr(fuse_req_t request, Node& node, const char* name);

  // --- folders.cpp
  void opendir(fuse_req_t request, Node& folder, fuse_file_info* info);
  void readdir(fuse_req_t request, Node& folder, std::size_t size, off_t offset,
               fuse_file_info* info);
  void readdirplus(fuse_req_t request, Node& folder, std::size_t size, off_t offset,
                   fuse_file_info* info);
  void releasedir(fuse_req_t request, Node& folder, fuse_file_info* info);
  void fsyncdir(fuse_req_t request, Node& folder, int isDataOnly, fuse_file_info* info);

  // --- names.cpp
  void mknod(fuse_req_t request, Node& folder, const char* name, mode_t mode, dev_t device);
  void mkdir(fuse_req_t request, Node& folder, const char* name, mode_t mode);
  void symlink(fuse_req_t request, const char* target, fuse_ino_t folder, const char* name);
  void link(fuse_req_t request, Node& node, fuse_ino_t folder, const char* name);
  void unlink(fuse_req_t request, Node& folder, const char* name);
  void rmdir(fuse_req_t request, Node& folder, const char* name);
  void rename(fuse_req_t request, Node& folder, const char* name, fuse_ino_t newFolder,
              const char* newName, unsigned flags);

  // --- files.cpp
  void create(fuse_req_t request, Node& folder, const char* name, mode_t mode,
              fuse_file_info* info);
  void open(fuse_req_t request, Node& node, fuse_file_info* info);
  void release(fuse_req_t request, Node& node, fuse_file_info* info);

  // --- contents.cpp
  void read(fuse_req_t request, Node& node, std::size_t size, off_t offset, fuse_file_info* info);
  void write(fuse_req_t request, Node& node, const char* bytes, std::size_t size, off_t offset,
             fuse_file_info* info);
  void fsync(fuse_req_t request, Node& node, int isDataOnly, fuse_file_info* info);
  void fallocate(fuse_req_t request, Node& node, int mode, off_t offset, off_t length,
                 fuse_file_info* info);
  void lseek(fuse_req_t request, Node& node, off_t offset, int whence, fuse_file_info* info);
  void copyFileRange(fuse_req_t request, Node& source, off_t sourceOffset,
                     fuse_file_info* sourceInfo, fuse_ino_t target, off_t targetOffset,
                     fuse_file_info* targetInfo, std::size_t length, int flags);

 private:
  [[nodiscard]] static OpenFile& fileOf(const fuse_file_info* info);
  [[nodiscard]] static FolderStream& streamOf(const fuse_file_info* info);

  /// A descriptor of a node (of its place at least), and what keeps it open.
  struct Descriptor {
    int number = -1;
    FileDescriptor owned;
    SharedDescriptor folder;
    std::shared_ptr<OpenFile> file;
  };
  [[nodiscard]] int descriptorOf(Node& node, Descriptor& descriptor);
  /// Calls `use(folder descriptor, name)`, which answers 0 or an errno, with a node's place: again
  /// when it is not found there, since it may be being moved. ESTALE when it has none.
  [[nodiscard]] int inPlace(const Node& node, const std::function<int(int, const char*)>& use);
  /// Of the node itself, in its place or where it is open.
  [[nodiscard]] int statusOf(Node& node, struct statx& status);
  /// A file that is being filled shows the date that it will get back.
  static void putRight(int folder, const char* name, struct statx& status);
  [[nodiscard]] std::string nameOnDisk(const Node& folder, const char* name) const;
  /// The location of a node as the drive has it; nothing when it was removed.
  [[nodiscard]] std::optional<std::string> locationOf(const Node& node) const;
  /// Nothing when it was removed.
  [[nodiscard]] std::optional<DesktopThumbnails::Folder> desktopFolder(const Node& folder) const;
  [[nodiscard]] bool isShownBase(const Node& folder, const char* name) const;

  /// How long the kernel may keep what is told of a folder's entries, or of a folder itself.
  [[nodiscard]] double longestTime(const Node& folder) const;
  [[nodiscard]] fuse_entry_param entryOf(const Node& folder, const Node& node,
                                         const struct statx& status, bool holds) const;
  /// Answers with what was looked at since `begun`.
  void answerAttributes(fuse_req_t request, Node& node, struct statx status,
                        EntryGate::Moment begun);
  /// Looks until nothing changes meanwhile, then answers.
  void lookAndAnswer(fuse_req_t request, Node& folder, int descriptor, const std::string& name);
  /// Answers with an entry that was looked at; the kernel knows it from then on.
  void answerFound(fuse_req_t request, Node& folder, const std::string& name,
                   const struct statx& status, const EntryGate::Telling& telling);
  /// Looks at what was just made, and answers with it.
  void answerMade(fuse_req_t request, Node& folder, int descriptor, const std::string& name);
  void answerBase(fuse_req_t request, std::uint32_t base);
  /// Makes an entry with `make(folder descriptor, name)`, which answers 0 or -1, for the caller.
  void makeEntry(fuse_req_t request, Node& folder, const char* name, mode_t mode,
                 const std::function<int(int, const char*, mode_t)>& make);
  /// The mode with which something is made that is somebody else's in a moment.
  [[nodiscard]] static mode_t firstMode(fuse_req_t request, mode_t mode);
  [[nodiscard]] int giveToCaller(fuse_req_t request, int folder, const char* name,
                                 mode_t mode) const;
  /// What the kernel may still use of a node when its entry has been removed; nil when there is
  /// none.
  [[nodiscard]] static SharedDescriptor remainsOf(const NodeUse& node, int descriptor,
                                                  const std::string& name);
  void removeEntry(fuse_req_t request, Node& folder, const char* name, int flags);
  /// Of an entry to another place; whoever asks for it keeps the folders alive.
  struct Move {
    Node* folder = nullptr;
    std::string name;  ///< on disk
    Node* newFolder = nullptr;
    std::string newName;
    unsigned flags = 0;
    std::shared_ptr<const EntryNotices::Hold> hold;  ///< when the move waits
  };
  void renameNow(fuse_req_t request, const Move& move);
  /// An exchange moves two.
  [[nodiscard]] static std::vector<Move> bothWays(const Move& move);
  /// Whether a folder goes to where the drive leaves things alone.
  [[nodiscard]] bool takesFolderOut(const Move& move);
  [[nodiscard]] bool holdsFaults(const Move& move);
  /// Whether it needs an answer of the host first.
  [[nodiscard]] bool isToBeAsked(const Move& move);
  [[nodiscard]] bool lacksContent(const Node& folder, const std::string& name);
  /// Asks of the last of `toAsk` and brings what it needs, then of the others, then moves. Waits.
  void askThenRename(fuse_req_t request, const Move& move, std::vector<Move> toAsk);

  /// Opens a file for whoever asks: as `openInPlace`.
  [[nodiscard]] int openNode(Node& node, int flags, FileDescriptor& content, FileDescriptor& place);
  void openFound(fuse_req_t request, Node& node, int flags, FileDescriptor content,
                 FileDescriptor place);
  /// With the entry, for what was made.
  void answerOpen(fuse_req_t request, const std::shared_ptr<OpenFile>& file,
                  const fuse_entry_param* entry);
  std::shared_ptr<OpenFile> addOpen(Node& node, int flags, FileDescriptor content,
                                    FileDescriptor place);
  /// Asks for the content of a node, of which there is a descriptor: also when it was removed.
  void waitForContent(fuse_req_t request, Node& node, int place, ContentWaits::Then then);
  /// How often content that came may be gone again before it is opened.
  static constexpr int kAttempts = 8;
  /// Calls `then` with 0 when the content is here, else with an errno: at once, or later.
  void withContent(fuse_req_t request, const std::shared_ptr<OpenFile>& file,
                   std::function<void(int failure)> then, int attempts = kAttempts);
  void contentOpened(fuse_req_t request, const std::shared_ptr<OpenFile>& file, int failure,
                     std::function<void(int failure)> then, int attempts);
  void truncate(fuse_req_t request, Node& node, off_t size, fuse_file_info* info,
                std::function<void(int failure)> then, int attempts = kAttempts,
                bool mayWaitForDisk = false);
  /// Does what may wait for the disk where it keeps no other request waiting.
  void waitForDisk(std::function<void()> work);

  bool addEntry(Node& folder, const FolderStream& stream, const FolderStream::Entry& entry,
                bool withAttributes, FolderListing& listing);
  [[nodiscard]] int fillListing(Node& folder, FolderStream& stream, off_t offset,
                                bool withAttributes, FolderListing& listing);
  void readFolder(fuse_req_t request, Node& folder, off_t offset, FolderStream& stream,
                  bool withAttributes, FolderListing& listing);

  const std::unique_ptr<Places> places_;
  const std::shared_ptr<ContentRequests> requests_;
  NodeTable nodes_;
  FolderDescriptors folders_;
  OpenFiles openFiles_;
  EntryGate gate_;
  EntryNotices entryNotices_;
  ContentWaits waits_;
  Node* const root_;
  std::atomic<bool> isTold_ = false;
  std::atomic<bool> choosesAttributes_ = false;
  KernelSession* session_ = nullptr;
  LocalSpace* space_ = nullptr;
  DesktopThumbnails* thumbnails_ = nullptr;
  ThreadPool disk_;
};

}  // namespace yomber
