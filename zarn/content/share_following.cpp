// Shares: following what others change.
#include <algorithm>
#include <cerrno>
#include <utility>

#include "platform/foundation/log.h"
#include "zarn/content/share_errors.h"
#include "zarn/content/share_leaving.h"
#include "zarn/content/share_pull.h"
#include "zarn/content/shares.h"
#include "zarn/row_queries.h"
#include "zarn/tree_layout.h"
#include "zarn/write_transaction.h"

namespace yomber {
namespace {

const RZRecordZone* findZone(const std::vector<RZRecordZone>& zones, const RZRecordZoneID& id) {
  const auto found = std::find_if(zones.begin(), zones.end(),
                                  [&](const RZRecordZone& zone) { return zone.zoneID == id; });
  return found == zones.end() ? nullptr : &*found;
}

/// Under which name what is shared can be put into the drive.
std::string nameFor(const RZShare& share) {
  for (const std::string& name : {share.title(), share.ownerName()}) {
    if (isPossibleName(name) && !isExcludedName(name)) return name;
  }
  return "Shared item";
}

/// What came to be recorded elsewhere, while nobody knew that it is shared, says nothing of whether
/// the share has it.
void forgetRecordsElsewhere(Connection& connection, const ShareRow& share) {
  std::vector<std::uint64_t> rest{share.root};
  while (!rest.empty()) {
    const std::uint64_t id = rest.back();
    rest.pop_back();
    for (const std::uint64_t child : findChildIDs(connection, id)) rest.push_back(child);
    auto content = findContent(connection, id);
    if (!content || !content->content || content->zone == share.zone) continue;
    content->content.reset();
    storeContent(connection, *content);
  }
}

/// The shared item. What was only just put here may not have been looked at.
std::optional<ItemRow> findRoot(const ContentCore& core, const ShareRow& share, NSErrorRef& error) {
  auto root = core.items->itemByID(share.root, &error);
  const bool mayBeNew = !error && !root && !share.isOwn() && !share.zoneTag.empty();
  const auto beside =
      mayBeNew ? core.items->itemAtPath(folderBesideShare(core, share)) : std::nullopt;
  if (!beside) return root;
  error = core.scanner->scanFolders({beside->id});
  return error ? std::nullopt : core.items->itemByID(share.root, &error);
}

}  // namespace

Shares::Shares(std::shared_ptr<ContentCore> core, Options options)
    : core_(std::move(core)), options_(options) {
  core_->didRefuse = [this] { poke(); };
}

Shares::~Shares() { stop(); }

void Shares::start() {
  if (!thread_.joinable()) thread_ = std::thread([this] { work(); });
}

void Shares::stop() {
  {
    LockGuard guard(mutex_);
    isEnding_ = true;
    changed_.notifyAll();
  }
  if (thread_.joinable()) thread_.join();
}

void Shares::poke() {
  LockGuard guard(mutex_);
  isPoked_ = true;
  changed_.notifyAll();
}

NSErrorRef Shares::Failures::of(const RZRecordZoneID& zone) const {
  const auto found = ofZones.find(zone);
  return ofAll || found == ofZones.end() ? ofAll : found->second;
}

NSErrorRef Shares::Failures::any() const {
  return ofAll || ofZones.empty() ? ofAll : ofZones.begin()->second;
}

void Shares::work() {
  Failures last;
  for (;;) {
    {
      LockGuard guard(mutex_);
      const auto next = std::chrono::steady_clock::now() + options_.interval;
      while (!isEnding_ && !isPoked_) {
        if (!changed_.waitUntil(mutex_, next)) break;
      }
      if (isEnding_) return;
      isPoked_ = false;
    }
    Failures failures;
    {
      LockGuard working(working_);
      failures = pass();
    }
    logNew(failures, last);
    last = std::move(failures);
  }
}

void Shares::logNew(const Failures& failures, const Failures& before) {
  const auto isNew = [](const NSErrorRef& error, const NSErrorRef& known) {
    return error && !isOutOfReach(error) &&
           (!known || known->description() != error->description());
  };
  if (isNew(failures.ofAll, before.ofAll))
    log_error(defaultLog(), "[ERROR] shares cannot be followed: %@", failures.ofAll);
  for (const auto& [zone, error] : failures.ofZones) {
    if (isNew(error, before.of(zone)))
      log_error(defaultLog(), "[ERROR] the share %@ cannot be followed: %@", zone.description(),
                error);
  }
}

Shares::Failures Shares::pass() {
  Session session;
  Failures failures;
  // What was done while no process ran must not be taken for something else.
  if (open(session) || !core_->scanner->hasScannedAll()) return failures;
  failures.ofAll = beginAccount(session);
  if (!failures.ofAll) followZones(session, failures);
  if (!failures.ofAll) takeOverRefused(session, failures);
  return failures;
}

NSErrorRef Shares::beginAccount(const Session& session) {
  if (begun_.contains(session.account)) return nullptr;
  if (begun_.empty()) SharedTree(*core_, *session.store).recover();
  NSErrorRef error = noteRemovalsBeforeStart(session.account);
  if (!error) error = askForWaitingAgain(session.account);
  if (!error) begun_.insert(session.account);
  return error;
}

void Shares::takeOverRefused(const Session& session, Failures& failures) {
  const ContentCore::Refused refused = core_->takeRefused();
  for (const bool isForbidden : {false, true}) {
    for (const auto& [zone, items] : isForbidden ? refused.forbidden : refused.changed) {
      std::optional<ShareRow> share;
      NSErrorRef error = core_->database().read([&](Connection& connection) {
        share = findShareOfZone(connection, session.account, zone);
      });
      if (!error && share && !share->isLeaving())
        error = SharePull(*core_, session.store, *share).takeOver(items, isForbidden);
      // The jobs are tried again, and refused again.
      if (isOutOfReach(error)) failures.ofAll = error;
      if (failures.ofAll) return;
      if (error) failures.ofZones[zone] = error;
    }
  }
}

/// Whatever came of it before: there may be room now, or another program that knows more.
NSErrorRef Shares::askForWaitingAgain(std::int64_t account) const {
  bool isAnyPostponed = false;
  NSErrorRef error = core_->database().read(
      [&](Connection& connection) { isAnyPostponed = hasPostponedRecords(connection, account); });
  if (error || !isAnyPostponed) return error;
  return core_->database().write([&](WriteTransaction& transaction) {
    makeAllWaitingRecordsDue(transaction.connection(), account);
    return NSErrorRef();
  });
}

NSErrorRef Shares::noteRemovalsBeforeStart(std::int64_t account) const {
  std::vector<ShareRow> shares;
  NSErrorRef error = core_->database().read(
      [&](Connection& connection) { shares = findShares(connection, account); });
  for (const ShareRow& share : shares) {
    if (!error) error = yomber::noteRemovalsBeforeStart(*core_, share);
  }
  return error;
}

void Shares::followZones(const Session& session, Failures& failures) {
  const ContentStore& store = *session.store;
  Zones own;
  Zones foreign;
  NSErrorRef error =
      contentError(store.engine()->fetchZones(store.databaseOf(RZDatabaseScope::Private), own));
  if (!error)
    error = contentError(
        store.engine()->fetchZones(store.databaseOf(RZDatabaseScope::Shared), foreign));
  std::vector<ShareRow> shares;
  const auto read = [&](Connection& connection) {
    shares = findShares(connection, session.account);
  };
  if (!error) error = core_->database().read(read);
  failures.ofAll = error;
  for (const Zones* const zones : {&own, &foreign}) {
    if (!failures.ofAll) adoptNew(session, *zones, shares, failures);
  }
  if (!failures.ofAll) failures.ofAll = core_->database().read(read);
  if (failures.ofAll) return;
  for (const ShareRow& share : shares) {
    error = follow(session.store, share, share.isOwn() ? own : foreign);
    if (isOutOfReach(error) || core_->queue->isEnding()) {
      failures.ofAll = error;
      return;
    }
    if (error) failures.ofZones[share.zone] = error;
  }
}

void Shares::adoptNew(const Session& session, const Zones& zones,
                      const std::vector<ShareRow>& known, Failures& failures) {
  for (const RZRecordZone& zone : zones) {
    const bool isKnown = std::any_of(known.begin(), known.end(), [&](const ShareRow& share) {
      return share.zone == zone.zoneID;
    });
    if (!isSharedZone(zone.zoneID) || isKnown) continue;
    const NSErrorRef error = adopt(session, zone);
    if (isOutOfReach(error)) {
      failures.ofAll = error;
      return;
    }
    if (error) failures.ofZones[zone.zoneID] = error;
  }
}

NSErrorRef Shares::adopt(const Session& session, const RZRecordZone& zone) {
  RZShareRef share;
  NSErrorRef error = session.store->fetchShare(zone.zoneID, share);
  if (error) return isNoShare(error) ? nullptr : error;
  const auto root = itemOfRecord(share->rootRecordID().recordName());
  if (!root) return nullptr;
  ShareRow row;
  row.root = *root;
  row.account = session.account;
  row.zone = zone.zoneID;
  if (row.isOwn()) return adoptOwn(std::move(row), *share);
  row.mayWrite = zone.permission == RZZonePermission::ReadWrite;
  return adoptForeign(std::move(row), *share);
}

/// One that was accepted, here before the process ended, or by this account elsewhere.
NSErrorRef Shares::adoptForeign(ShareRow row, const RZShare& share) {
  row.isFolder = share.type() == RZShareTypeFolder;
  row.title = nameFor(share);
  bool isPossible = false;
  NSErrorRef error = core_->database().read(
      [&](Connection& connection) { isPossible = canBecome(connection, row); });
  if (error) return error;
  if (!isPossible) {
    if (refused_.insert(row.zone).second)
      log_error(defaultLog(), "[ERROR] \"%@\" cannot be followed: another item has its identifier",
                row.title);
    return nullptr;
  }
  refused_.erase(row.zone);
  return core_->database().write([&](WriteTransaction& transaction) {
    Connection& connection = transaction.connection();
    if (!canBecome(connection, row)) return NSErrorRef();
    forgetRecordsElsewhere(connection, row);
    storeShare(connection, row);
    return NSErrorRef();
  });
}

bool Shares::canBecome(Connection& connection, const ShareRow& row) {
  if (findShare(connection, row.root)) return false;
  const auto item = findByID(connection, row.root);
  if (!item) return true;
  // Of a database that was lost, the files still carry it.
  const bool isMarked = (item->flags & row_flag::kShared) != 0;
  const bool isSameKind = row.isFolder ? item->isFolder() : item->kind == ItemKind::Document;
  return isMarked && isSameKind && !findShareAbove(connection, row.root);
}

/// One that was saved just before the process ended, or before the database was lost.
NSErrorRef Shares::adoptOwn(ShareRow row, const RZShare& share) const {
  NSErrorRef error;
  const auto item = core_->items->itemByID(row.root, &error);
  if (!item) return error;
  bool isOthers = false;  // another account's, or shared with this one
  error = core_->database().read([&](Connection& connection) {
    const auto known = findShare(connection, row.root);
    isOthers = known && (known->account != row.account || !known->isOwn());
  });
  if (error || isOthers) return error;
  row.isFolder = item->isFolder();
  row.title = share.title();
  return beginOwn(std::move(row));
}

void Shares::followPermission(const ContentStore& store, ShareRow& share) const {
  const SharedTree tree(*core_, store);
  const auto root = core_->items->itemByID(share.root);
  std::vector<ItemRow> rest;
  if (root) rest.push_back(*root);
  while (!rest.empty()) {
    const ItemRow row = std::move(rest.back());
    rest.pop_back();
    const auto path = core_->items->physicalPath(row.id);
    if (!path) continue;
    tree.setWritable(*path, share.mayWrite);
    if (row.id == share.root) (void)tree.markShared(*path, true);
    (void)core_->scanner->scanLocation(*path, nullptr);
    if (!row.isFolder()) continue;
    for (ItemRow& child : core_->items->children(row.id)) rest.push_back(std::move(child));
  }
}

NSErrorRef Shares::follow(const std::shared_ptr<ContentStore>& store, ShareRow share,
                          const Zones& zones) {
  if (share.isLeaving()) return leaveShare(*core_, store, share);
  NSErrorRef error;
  const RZRecordZone* const zone = findZone(zones, share.zone);
  const auto root = findRoot(*core_, share, error);
  if (error) return error;
  const bool wasHere = share.isOwn() || !share.zoneTag.empty();
  const bool isMissing = wasHere && (!root || (!share.isOwn() && root->isTrashed()));
  if (!isMissing) missing_.erase(share.root);
  const bool hasGone = isMissing && !missing_.insert(share.root).second;
  bool isShared = zone != nullptr;
  RZShareRef record;
  if (zone != nullptr && (hasGone || zone->changeTag != share.zoneTag)) {
    error = store->fetchShare(share.zone, record);
    // What others share is left when its zone has gone as well.
    if (share.isOwn() && rz_isError(error, RZErrorUnknownItem)) isShared = false;
    if (error && isShared) return error;
  }
  if (isShared && hasGone) {  // the item was removed here
    error = contentError(store->engine()->destroyShare(store->databaseOf(share.zone), *record));
    if (error) return error;
    isShared = false;
  }
  if (!isShared) {
    const auto last = zone != nullptr ? LastSaves::InZone : LastSaves::Gone;
    return endShare(*core_, store, std::move(share), last);
  }
  const bool mayWrite = share.isOwn() || zone->permission == RZZonePermission::ReadWrite;
  const bool isOtherwise = std::exchange(share.mayWrite, mayWrite) != mayWrite;
  if (isOtherwise) followPermission(*store, share);
  bool hasWaiting = false;
  error = core_->database().read([&](Connection& connection) {
    hasWaiting = !findWaitingRecords(connection, share.root, core_->now(), 1).empty();
  });
  const bool isBehind = zone->changeTag != share.zoneTag;
  if (!error && (isBehind || hasWaiting)) error = SharePull(*core_, store, share).run();
  if (error || (!isBehind && !isOtherwise)) return error;
  if (!core_->items->itemByID(share.root)) return nullptr;  // on its way
  share.zoneTag = zone->changeTag;
  return core_->database().write([&](WriteTransaction& transaction) {
    storeShare(transaction.connection(), share);
    return NSErrorRef();
  });
}

}  // namespace yomber
