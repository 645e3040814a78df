#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <set>
#include <string>
#include <unordered_map>
#include <vector>

#include "zarn/content/content_core.h"
#include "zarn/content/shared_item.h"
#include "zarn/content/shared_tree.h"

namespace yomber {

/// Takes over what changed in the zone of one share: the records decide, but nothing that the store
/// does not have is lost.
///
/// The token of what was taken over is stored after it was: a process that ends in between does it
/// again, which changes nothing. For one thread at a time.
class SharePull {
 public:
  SharePull(ContentCore& core, std::shared_ptr<ContentStore> store, ShareRow& share)
      : core_(core), store_(std::move(store)), tree_(core, *store_), share_(share) {}

  /// All changes since the last time, page by page. Out of reach, and what cannot be stored, are
  /// failures; items that cannot be taken over now wait for the next time.
  [[nodiscard]] NSErrorRef run();
  /// Single items as the store has them. `refused`: what was done to them here was refused, so that
  /// they become what the store has.
  [[nodiscard]] NSErrorRef takeOver(const std::set<std::uint64_t>& items, bool refused);

 private:
  using Items = std::vector<SharedItem>;

  NSErrorRef takeOverWaiting();
  NSErrorRef waitFor(const std::vector<std::uint64_t>& unreadable);
  NSErrorRef startAgain();
  NSErrorRef applyPage(Items items, const RZChangeToken* token);
  NSErrorRef read(Items& items) const;
  void locate(Connection& connection, SharedItem& item) const;

  /// Whether the items are as the store has them now, or as they were when a page was made.
  enum class Age : bool { OfPage, OfNow };
  void makeRoom(Items& items, Age age);
  [[nodiscard]] bool hasIDOfAnother(const SharedItem& item) const;

  // New ones.
  NSErrorRef callOffRemovals(const Items& items);
  NSErrorRef addNew(Items& items);
  void addFolders(Items& items);
  void addFolder(SharedItem& item, const std::string& folder);
  /// Where the item belongs; empty when that is not known here (yet).
  [[nodiscard]] std::string folderFor(const SharedItem& item);
  void placeNew(SharedItem& item, const std::string& folder);
  /// Asked for again later and later, but for what somebody has open: that is with the next pass.
  void wait(const SharedItem& item, const NSErrorRef& error = nullptr);

  // Known ones.
  void applyKnown(SharedItem& item);
  void applyContent(SharedItem& item);
  void applyPlace(SharedItem& item);
  NSErrorRef removeRecordElsewhere(SharedItem& item) const;
  void applyRemoval(SharedItem& item);
  void forget(const SharedItem& item);
  void moveToTrash(const SharedItem& item, const FileStamp& seen);
  void removeFolder(SharedItem& item);
  void moveOut(SharedItem& item);
  [[nodiscard]] std::string folderForCopies(const SharedItem& item) const;
  NSErrorRef clearOut(const SharedItem& item);
  void forgetPlacedBelow(const std::vector<DirtyFolder>& folders);
  NSErrorRef noteUnseenRemovals();

  enum class Step : bool { Prepared, Done };
  NSErrorRef storeContents(const Items& items, const RZChangeToken* token, Step step);
  void noteRoot(Connection& connection);
  [[nodiscard]] ContentRow contentOf(const SharedItem& item) const;
  [[nodiscard]] bool isNew(const SharedItem& item) const;
  void applyAll(Items& items);
  void noteDirty(std::uint64_t folder, const std::string& path);
  NSErrorRef scan();

  ContentCore& core_;
  const std::shared_ptr<ContentStore> store_;
  const SharedTree tree_;
  ShareRow& share_;
  std::unordered_map<std::uint64_t, std::string> newFolders_;  ///< of this page, where they are
  std::unordered_map<std::uint64_t, std::string> staged_;      ///< of this page
  std::set<std::uint64_t> waiting_;                            ///< could not be taken over now
  std::set<std::uint64_t> busy_;                               ///< of these, those in use
  std::set<std::uint64_t> settled_;                            ///< were taken over, or need not be
  std::set<std::uint64_t> forgotten_;                          ///< have no record any more
  struct Placed {
    std::string path;
    std::uint64_t folder = 0;
  };
  std::unordered_map<std::uint64_t, Placed> placed_;  ///< new on this page, where they were put
  std::string rootPath_;     ///< where the shared item was put on this page
  bool isAtEnd_ = false;     ///< there are no more changes
  bool hasFolders_ = false;  ///< this page has brought some
  std::map<std::uint64_t, std::set<std::string>> dirty_;  ///< names to be scanned, by folder
  std::unordered_map<std::uint64_t, bool> inside_;        ///< folders that were asked about
};

/// What an earlier process had put here, and somebody had removed before anybody looked: that goes
/// to the store. To be called when the whole tree was scanned, before anything is taken over.
[[nodiscard]] NSErrorRef noteRemovalsBeforeStart(ContentCore& core, const ShareRow& share);

/// The folder in which what a share's items leave behind is put: the one that the shared item is
/// in, the drive's own where that cannot be.
[[nodiscard]] std::string folderBesideShare(const ContentCore& core, const ShareRow& share);

}  // namespace yomber
