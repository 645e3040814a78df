#include "zarn/content/share_leaving.h"

#include <cerrno>
#include <string>
#include <utility>
#include <vector>

#include "platform/foundation/fault_points.h"
#include "platform/foundation/log.h"
#include "platform/ostrell/constants.h"
#include "zarn/content/share_pull.h"
#include "zarn/content/share_remains.h"
#include "zarn/content/shared_tree.h"
#include "zarn/row_queries.h"
#include "zarn/write_transaction.h"

namespace yomber {
namespace {

FaultPoint leaveNoted("zarn.leave.noted");
FaultPoint leaveKept("zarn.leave.kept");
FaultPoint leaveGone("zarn.leave.gone");

NSErrorRef noLongerShared(const std::string& title) {
  return NSError::errorWithDomain(
      NSCocoaErrorDomain, NSFileNoSuchFileError,
      {{NSLocalizedDescriptionKey,
        "\"" + title + "\" is no longer shared with you; ask its owner for a new link"}});
}

/// Who waits for content that will not come hears why.
void endDownloads(ContentCore& core, const GoingItems& items, const NSErrorRef& reason) {
  for (const std::uint64_t id : items.documents) {
    for (auto& completion : core.wishes.take(id)) {
      if (completion) completion(reason);
    }
  }
}

/// The account's own that were moved away must have rows there before the rest loses its rows: an
/// item that is thought to be gone has its record removed.
NSErrorRef checkNobodyStays(const ContentCore& core, const ShareRow& share, const ItemRow& root,
                            const std::string& folder) {
  GoingItems items;
  NSErrorRef error = GoingItems::read(core, root, share.zone, items);
  std::vector<std::uint64_t> folders = items.foldersOfStaying();
  if (error || folders.empty()) return error;
  const auto beside = core.items->itemAtPath(folder);
  if (beside) folders.push_back(beside->id);
  error = core.scanner->scanFolders(folders);
  return error ? error : NSError::errorWithErrno(EAGAIN, folder);
}

NSErrorRef removeItem(ContentCore& core, const SharedTree& tree, const ShareRow& share,
                      const ItemRow& root) {
  GoingItems items;
  NSErrorRef error = GoingItems::read(core, root, share.zone, items);
  if (error) return error;
  endDownloads(core, items, noLongerShared(share.title));
  const auto path = core.items->physicalPath(root.id, &error);
  if (error || !path) return error;
  const std::string folder = folderBesideShare(core, share);
  ShareRemains remains(core, tree, items, folder, path->substr(path->rfind('/') + 1));
  error = remains.keep(*path);
  if (!error) error = checkNobodyStays(core, share, root, folder);
  if (!error && leaveKept.hit()) error = NSError::errorWithErrno(EIO);
  if (!error) error = remains.remove(*path);
  if (!error) error = checkNobodyStays(core, share, root, folder);
  if (error) return error;
  (void)core.scanner->scanLocation(*path, nullptr);
  endDownloads(core, items, noLongerShared(share.title));
  return nullptr;
}

/// What was moved out of the share before it ended is the account's own from now on. The share's
/// record, and what that has, are not its any more.
void makeOwn(WriteTransaction& transaction, const ItemRow& row, ContentRow content,
             std::int64_t now) {
  Connection& connection = transaction.connection();
  content.zone = RZRecordZoneID();
  content.tag.clear();
  const bool isHere = (row.flags & row_flag::kDownloaded) != 0;
  if (isHere || row.isFolder()) content.content.reset();
  storeContent(connection, content);
  ItemRow changed = row;
  changed.flags &= ~row_flag::kUploaded;
  if (changed.flags != row.flags) (void)transaction.update(row, changed);
  addJob(connection, row.id, JobKind::Upload, content.account, now, now);
}

NSErrorRef leaveForeign(ContentCore& core, const ContentStore& store, const ShareRow& share) {
  NSErrorRef error;
  const auto root = core.items->itemByID(share.root, &error);
  if (!error && root) error = removeItem(core, SharedTree(core, store), share, *root);
  if (error) return error;
  (void)leaveGone.hit();
  log_default(defaultLog(), "[NOTICE] \"%@\" is no longer shared with this account", share.title);
  error = core.database().write([&](WriteTransaction& transaction) {
    Connection& connection = transaction.connection();
    for (const std::uint64_t id : contentIn(connection, share.zone)) {
      const auto content = findContent(connection, id);
      if (!content || content->account != share.account) continue;
      if (const auto row = findByID(connection, id)) {
        makeOwn(transaction, *row, *content, core.now());
      } else {
        removeJobsOf(connection, id);
        removeContent(connection, id);
      }
    }
    removeShare(connection, share.root);
    return NSErrorRef();
  });
  core.queue->noteJobs(JobKind::Upload);
  return error;
}

/// Whether the zone has a record still. That would be one that was not taken over, for those of the
/// account's own have moved.
NSErrorRef lookForRecords(const ContentStore& store, const RZRecordZoneID& zone, bool& isEmpty) {
  constexpr std::size_t kTogether = 1000;
  const RZDesiredKeys none{std::vector<std::string>()};
  isEmpty = true;
  RZChangeToken token;
  for (bool hasMore = true; hasMore && isEmpty;) {
    RZChangePage page;
    NSErrorRef error = contentError(
        store.engine()->fetchChanges(store.databaseOf(zone), zone, token, kTogether, none, page));
    if (rz_isError(error, RZErrorZoneNotFound)) return nullptr;
    if (error) return error;
    for (const RZRecordChange& change : page.changes) {
      if (!change.record && !change.error) continue;
      isEmpty = false;
      log_debug(defaultLog(), "the record %@ was not taken over; its zone stays",
                change.recordID.recordName());
    }
    token = page.token;
    hasMore = page.moreComing;
  }
  return nullptr;
}

NSErrorRef finishOwn(ContentCore& core, const ContentStore& store, const ShareRow& share) {
  std::uint64_t left = 0;
  NSErrorRef error = core.database().read(
      [&](Connection& connection) { left = countContentIn(connection, share.zone); });
  if (error || left != 0) return error;
  // Where its owner has removed the item, all that is in the zone goes with it.
  if (core.items->itemByID(share.root, &error)) {
    bool isEmpty = false;
    error = lookForRecords(store, share.zone, isEmpty);
    if (!isEmpty) return error;
  }
  // The rows must not be back in a zone that is gone after a loss of power.
  if (!error) error = core.database().makeDurable();
  if (error) return error;
  error = contentError(store.engine()->deleteZone(store.databaseOf(share.zone), share.zone));
  if (error) return error;
  return core.database().write([&](WriteTransaction& transaction) {
    removeShare(transaction.connection(), share.root);
    return NSErrorRef();
  });
}

/// EBUSY while some of it has to wait: the share may not be left before.
NSErrorRef takeOverLast(ContentCore& core, const std::shared_ptr<ContentStore>& store,
                        ShareRow& share) {
  NSErrorRef error;
  const auto root = core.items->itemByID(share.root, &error);
  if (error || !root) return error;  // its owner has removed it, with all that is in it
  error = SharePull(core, store, share).run();
  if (rz_isError(error, RZErrorZoneNotFound)) return nullptr;
  if (error) return error;
  bool isWaiting = core.queue->isEnding();
  error = core.database().read([&](Connection& connection) {
    isWaiting = isWaiting || hasWaitingRecords(connection, share.root);
  });
  if (error) return error;
  return isWaiting ? NSError::errorWithErrno(EBUSY, share.title) : nullptr;
}

/// The account's own gets its records back into its container's zone.
NSErrorRef noteLeaving(ContentCore& core, ShareRow& share) {
  share.state = ShareRow::State::Leaving;
  NSErrorRef error = core.database().write([&](WriteTransaction& transaction) {
    Connection& connection = transaction.connection();
    storeShare(connection, share);
    if (!share.isOwn()) return NSErrorRef();
    const std::int64_t now = core.now();
    addJob(connection, share.root, JobKind::Upload, share.account, now, now);
    if (share.isFolder) addJob(connection, share.root, JobKind::Spread, share.account, now, now);
    return NSErrorRef();
  });
  if (error) return error;
  for (const JobKind kind : {JobKind::Upload, JobKind::Spread}) core.queue->noteJobs(kind);
  (void)leaveNoted.hit();
  return nullptr;
}

}  // namespace

NSErrorRef endShare(ContentCore& core, const std::shared_ptr<ContentStore>& store, ShareRow share,
                    LastSaves last) {
  NSErrorRef error;
  if (share.isOwn() && !share.isLeaving() && last == LastSaves::InZone)
    error = takeOverLast(core, store, share);
  if (error) return error->is(NSPOSIXErrorDomain, EBUSY) ? nullptr : error;
  error = noteLeaving(core, share);
  return error ? error : leaveShare(core, store, share);
}

NSErrorRef leaveShare(ContentCore& core, const std::shared_ptr<ContentStore>& store,
                      const ShareRow& share) {
  if (!share.isOwn()) return leaveForeign(core, *store, share);
  const auto path = core.items->physicalPath(share.root);
  if (path) {
    (void)SharedTree(core, *store).markShared(*path, false);
    (void)core.scanner->scanLocation(*path, nullptr);
  }
  return finishOwn(core, *store, share);
}

}  // namespace yomber
