#include "zarn/content/shares.h"

#include <algorithm>
#include <cerrno>
#include <span>
#include <utility>

#include "platform/foundation/fault_points.h"
#include "platform/foundation/hexadecimal.h"
#include "platform/foundation/log.h"
#include "platform/ostrell/constants.h"
#include "zarn/content/share_errors.h"
#include "zarn/content/share_leaving.h"
#include "zarn/content/share_pull.h"
#include "zarn/row_queries.h"
#include "zarn/write_transaction.h"

namespace yomber {
namespace {

FaultPoint shareSaved("zarn.share.saved");
FaultPoint shareNoted("zarn.share.noted");
FaultPoint shareDestroyed("zarn.share.destroyed");
FaultPoint shareAccepted("zarn.share.accepted");

std::string hexOf(std::string_view text) { return hexadecimal(std::as_bytes(std::span(text))); }

RZRecordZoneID zoneOfShare(std::uint64_t root) {
  return RZRecordZoneID(RZShareZonePrefix + std::to_string(root));
}

NSErrorRef refuseToSave(const std::string& owner, const std::string& account) {
  log_default(defaultLog(), "[NOTICE] refused to save the share of %@ for %@", owner, account);
  return rz_error(RZErrorPermissionFailure, "Only its owner may change a share.");
}

}  // namespace

// --- What is asked and done.

NSErrorRef Shares::open(Session& session) const {
  // Together: while an account could not be stored, the queue's is still the one before.
  session.account = core_->queue->account();
  session.store = core_->storeOf(session.account);
  return session.store ? nullptr : notSignedInError();
}

NSErrorRef Shares::openAt(std::string_view path, Session& session, Item& item) const {
  NSErrorRef error = open(session);
  if (error) return error;
  auto row = core_->items->itemAtPath(path, &error);
  if (!row && !error) row = core_->scanner->scanLocation(path, &error);
  if (!row) return error ? error : noSuchSharedItemError(std::string(path));
  return readItem(row->id, item);
}

NSErrorRef Shares::openFor(std::string_view identifier, Session& session, Item& item) const {
  NSErrorRef error = open(session);
  if (error) return error;
  const auto id = rawIDFromIdentifier(identifier);
  return id ? readItem(*id, item) : noSuchSharedItemError(std::string(identifier));
}

NSErrorRef Shares::readItem(std::uint64_t id, Item& item) const {
  bool isThere = false;
  NSErrorRef error = core_->database().read([&](Connection& connection) {
    const auto row = findByID(connection, id);
    isThere = row.has_value();
    if (!row) return;
    item.row = *row;
    item.share = findShareAbove(connection, id);
    item.content = findContent(connection, id);
    const bool isOthers = item.share && item.share->account != core_->queue->account();
    if (item.share && (item.share->isLeaving() || isOthers)) item.share.reset();
  });
  if (!error && !isThere) error = noSuchSharedItemError(std::to_string(id));
  return error;
}

NSErrorRef Shares::checkNesting(Connection& connection, const ItemRow& row) const {
  const bool isPlace = row.id < kFirstIssuedID || row.isContainerFolder();
  if (isPlace)
    return cannotBeSharedError("this has its fixed place in the drive; share a folder in it");
  if (row.isTrashed())
    return cannotBeSharedError("this is in the trash; put it back, then share it");
  if (!row.isFolder() && row.kind != ItemKind::Document)
    return cannotBeSharedError("only documents and folders can be shared");
  const auto above = findShareAbove(connection, row.id);
  const std::int64_t account = core_->queue->account();
  if (above && above->account != account)
    return cannotBeSharedError("\"" + above->title + "\" is shared under the account \"" +
                               accountName(connection, above->account) + "\"; sign in to that one");
  if (above && above->root == row.id) return nullptr;
  if (above)
    return cannotBeSharedError("it lies in \"" + above->title +
                               "\", which is shared already; add people to that");
  for (const ShareRow& share : findShares(connection)) {
    const auto chain = findChain(connection, share.root);
    const bool isBelow =
        chain && std::any_of(chain->rows.begin(), chain->rows.end(),
                             [&](const ItemRow& each) { return each.id == row.id; });
    if (isBelow)
      return cannotBeSharedError("\"" + share.title +
                                 "\" in it is shared already; stop sharing that first");
  }
  return nullptr;
}

NSErrorRef Shares::checkShareable(std::uint64_t id) {
  NSErrorRef reason;
  NSErrorRef error = core_->database().read([&](Connection& connection) {
    const auto row = findByID(connection, id);
    if (!row) {
      reason = noSuchSharedItemError(std::to_string(id));
    } else if (!row->isFolder()) {
      reason = cannotBeSharedError("this is no folder");
    } else {
      reason = checkNesting(connection, *row);
    }
  });
  return error ? error : reason;
}

NSErrorRef Shares::copyShare(std::string_view path, Copied& copied) {
  Session session;
  Item item;
  NSErrorRef error = openAt(path, session, item);
  if (error) return error;
  if (!item.share) return notSharedError(std::string(path));
  error = session.store->fetchShare(item.share->zone, copied.share);
  if (isNoShare(error)) return notSharedError(std::string(path));
  if (!error && item.share->root != item.row.id)
    copied.rootPath = core_->items->logicalPath(item.share->root);
  return error;
}

NSErrorRef Shares::newShare(std::string_view path, RZShareRef& share) {
  Session session;
  Item item;
  NSErrorRef error = openAt(path, session, item);
  if (error) return error;
  NSErrorRef reason;
  error = core_->database().read(
      [&](Connection& connection) { reason = checkNesting(connection, item.row); });
  if (!error && !reason && item.share && !item.share->isOwn())
    reason = cannotBeSharedError("somebody else shares it with you; ask its owner to add people");
  if (error || reason) return error ? error : reason;
  share =
      std::make_shared<RZShare>(RZRecordID(std::to_string(item.row.id), zoneOfShare(item.row.id)),
                                item.row.isFolder() ? RZShareTypeFolder : RZShareTypeDocument,
                                item.row.name, session.store->account());
  return nullptr;
}

/// Whoever saves a share need not have been given it by `newShare`.
NSErrorRef Shares::checkSaved(const Session& session, const RZShare& share,
                              const ItemRow& row) const {
  NSErrorRef reason;
  std::optional<ShareRow> known;
  NSErrorRef error = core_->database().read([&](Connection& connection) {
    reason = checkNesting(connection, row);
    known = findShare(connection, row.id);
  });
  if (error || reason) return error ? error : reason;
  if (known && !known->isOwn())
    return refuseToSave(known->zone.ownerName(), session.store->account());
  const bool isFolder = share.type() == RZShareTypeFolder;
  if (isFolder != row.isFolder())
    return rz_error(RZErrorInvalidArguments, "The share is of another kind than its item.");
  return nullptr;
}

NSErrorRef Shares::save(const RZShare& share, RZShareRef& saved) {
  Session session;
  NSErrorRef error = open(session);
  if (error) return error;
  const RZRecordZoneID& zone = share.recordID().zoneID();
  const auto root = itemOfRecord(share.rootRecordID().recordName());
  if (zone.ownerName() != RZCurrentUserDefaultName)
    return refuseToSave(zone.ownerName(), session.store->account());
  if (!root || zone != zoneOfShare(*root))
    return rz_error(RZErrorInvalidArguments, "This is the share of no item of this drive.");
  LockGuard working(working_);
  Item item;
  error = readItem(*root, item);
  if (!error) error = checkSaved(session, share, item.row);
  if (error) return error;
  const ContentStore& store = *session.store;
  error = contentError(store.engine()->saveShare(store.databaseOf(zone), share, saved));
  if (!error && shareSaved.hit()) error = NSError::errorWithErrno(EIO);
  if (error) return error;
  ShareRow row;
  if (item.share && item.share->root == *root) row = *item.share;
  row.root = *root;
  row.account = session.account;
  row.zone = zone;
  row.isFolder = item.row.isFolder();
  row.title = saved->title();
  error = beginOwn(std::move(row));
  poke();
  return error;
}

/// Gives the item's records to the share's zone, from jobs.
NSErrorRef Shares::beginOwn(ShareRow share) const {
  NSErrorRef error = core_->database().write([&](WriteTransaction& transaction) {
    Connection& connection = transaction.connection();
    const auto known = findShare(connection, share.root);
    const bool isKnown = known && !known->isLeaving();
    if (isKnown) {
      share.token = known->token;
      share.zoneTag = known->zoneTag;
    }
    share.state = ShareRow::State::Active;
    storeShare(connection, share);
    if (isKnown) return NSErrorRef();
    const std::int64_t now = core_->now();
    addJob(connection, share.root, JobKind::Upload, share.account, now, now);
    if (share.isFolder) addJob(connection, share.root, JobKind::Spread, share.account, now, now);
    return NSErrorRef();
  });
  if (error) return error;
  if (shareNoted.hit()) return NSError::errorWithErrno(EIO);
  for (const JobKind kind : {JobKind::Upload, JobKind::Spread}) core_->queue->noteJobs(kind);
  const auto path = core_->items->physicalPath(share.root);
  const auto store = core_->store();
  if (!path || !store) return nullptr;
  error = SharedTree(*core_, *store).markShared(*path, true);
  if (!error) (void)core_->scanner->scanLocation(*path, nullptr);
  return error;
}

NSErrorRef Shares::destroy(const RZShare& share) {
  Session session;
  NSErrorRef error = open(session);
  if (error) return error;
  const RZRecordZoneID& zone = share.recordID().zoneID();
  LockGuard working(working_);
  const ContentStore& store = *session.store;
  error = contentError(store.engine()->destroyShare(store.databaseOf(zone), share));
  if (error && !rz_isError(error, RZErrorZoneNotFound)) return error;
  (void)shareDestroyed.hit();
  std::optional<ShareRow> row;
  error = core_->database().read(
      [&](Connection& connection) { row = findShareOfZone(connection, session.account, zone); });
  if (error || !row) return error;
  error = endShare(*core_, session.store, *std::move(row), LastSaves::InZone);
  poke();  // what has to wait is done when it can be
  return error;
}

NSErrorRef Shares::copyTokens(std::string_view path, Tokens& tokens) {
  Session session;
  Item item;
  NSErrorRef error = openAt(path, session, item);
  if (error) return error;
  if (!item.share) return notSharedError(std::string(path));
  const RZRecordZoneID& zone = item.share->zone;
  const std::string owner = item.share->isOwn() ? session.store->account() : zone.ownerName();
  tokens.share = hexOf(owner) + "-" + zone.zoneName();
  const bool isStored = item.content && item.content->zone == zone;
  tokens.base = isStored ? hexOf(item.content->tag) : std::string();
  return nullptr;
}

NSErrorRef Shares::options(std::string_view identifier, ItemOptions& options) {
  Session session;
  Item item;
  NSErrorRef error = openFor(identifier, session, item);
  if (error || !item.share) return error;
  options.isShared = true;
  options.mayWrite = item.share->mayWrite;
  options.isSharedItself = !item.share->isFolder;
  if (!item.share->isFolder) return nullptr;
  const auto root = core_->items->itemByID(item.share->root, &error);
  if (root) options.folderName = root->name;
  return error;
}

NSErrorRef Shares::refresh(std::string_view identifier) {
  Session session;
  Item item;
  NSErrorRef error = openFor(identifier, session, item);
  if (error) return error;
  LockGuard working(working_);
  error = askForWaitingAgain(session.account);
  if (error) return error;
  const Failures failures = pass();
  if (item.share) return failures.of(item.share->zone);
  return item.row.parent == kNoParent ? failures.any() : failures.ofAll;
}

/// What is shared comes under its own identifier, which nothing else here can have then.
NSErrorRef Shares::checkAccepted(const Session& session, const RZShare& share,
                                 std::uint64_t root) const {
  const RZRecordZoneID& zone = share.recordID().zoneID();
  if (zone.ownerName() == session.store->account()) return nullptr;
  std::optional<ItemRow> other;
  NSErrorRef error = core_->database().read([&](Connection& connection) {
    if (findShareOfZone(connection, session.account, zone)) return;
    other = findByID(connection, root);
  });
  if (error || !other) return error;
  return cannotBeSharedError("another item of this drive, \"" + other->name +
                             "\", has its identifier; remove that one, then accept again");
}

NSErrorRef Shares::accept(const std::string& url, std::string& identifier) {
  Session session;
  NSErrorRef error = open(session);
  if (error) return error;
  const ContentStore& store = *session.store;
  const RZDatabaseID database = store.databaseOf(RZDatabaseScope::Shared);
  RZShareRef share;
  error = contentError(
      store.engine()->acceptShare(database.containerIdentifier, store.account(), url, share));
  if (rz_isError(error, RZErrorPermissionFailure))
    log_default(defaultLog(), "[NOTICE] refused a share's URL to %@", store.account());
  if (rz_isError(error, RZErrorUnknownItem))
    log_default(defaultLog(), "[NOTICE] refused a URL of no share to %@", store.account());
  if (!error && shareAccepted.hit()) error = NSError::errorWithErrno(EIO);
  if (error) return error;
  const auto root = itemOfRecord(share->rootRecordID().recordName());
  if (!root) return rz_error(RZErrorUnknownItem, "What is shared is no item of a drive.");
  const auto kind = share->type() == RZShareTypeFolder ? ItemKind::Folder : ItemKind::Document;
  identifier = itemIdentifier(*root, kind);
  // Its owner's drive may still be giving its records to the share.
  const auto deadline = std::chrono::steady_clock::now() + options_.patience;
  for (;;) {
    {
      LockGuard working(working_);
      error = pass().of(share->recordID().zoneID());
    }
    if (!error) error = checkAccepted(session, *share, *root);
    if (error || core_->items->itemByID(*root)) return error;
    LockGuard guard(mutex_);
    const auto next = std::chrono::steady_clock::now() + std::chrono::milliseconds(100);
    if (isEnding_ || next > deadline) return nullptr;
    (void)changed_.waitUntil(mutex_, next);
  }
}

NSErrorRef Shares::sharesWithMe(std::vector<RZShareRef>& shares) {
  Session session;
  NSErrorRef error = open(session);
  if (error) return error;
  const ContentStore& store = *session.store;
  Zones zones;
  error =
      contentError(store.engine()->fetchZones(store.databaseOf(RZDatabaseScope::Shared), zones));
  for (const RZRecordZone& zone : zones) {
    if (error) break;
    RZShareRef share;
    error = store.fetchShare(zone.zoneID, share);
    if (!error) shares.push_back(std::move(share));
    if (isNoShare(error)) error = nullptr;
  }
  return error;
}

}  // namespace yomber
