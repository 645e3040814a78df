#include "zarn/content/content_participant.h"

#include <algorithm>
#include <vector>

#include "zarn/content/share_rows.h"
#include "zarn/row_queries.h"
#include "zarn/schema.h"
#include "zarn/write_transaction.h"

namespace yomber {
namespace {

constexpr std::int64_t kSweptAtOnce = 2000;
constexpr std::int64_t kAllSwept = -1;
/// For how many pauses what goes on changing waits.
constexpr std::int64_t kMostPauses = 10;

bool isSameFileContent(const ItemRow& row, const FileStamp& stamp) {
  return row.inode == stamp.inode && row.size == stamp.size && row.mtime == stamp.mtime;
}

}  // namespace

bool isConfirmed(const ItemRow& row, const ContentRow& content) {
  return content.content && isSameFileContent(row, content.stamp) && row.name == content.name &&
         row.parent == content.parent;
}

std::optional<std::int64_t> whoseFolderIsBehind(Connection& connection, const ItemRow& row) {
  if (row.isContainerFolder() || row.id < kFirstIssuedID) return std::nullopt;
  const auto share = findShareAbove(connection, row.id);
  const auto content = findContent(connection, row.id);
  const bool isRecorded = content && content->isRecorded();
  const bool isShared = share && givesItsZone(*share);
  // It goes first, by whoever has made it.
  if (isRecorded && (!isShared || content->account != share->account)) return content->account;
  if (!isShared) return std::nullopt;
  const bool isPlacedByEach = !share->isOwn() && share->root == row.id;
  if (isPlacedByEach) return std::nullopt;
  const bool isBehind = !isRecorded || content->zone != share->zone || content->name != row.name ||
                        content->parent != row.parent;
  return isBehind ? std::optional(share->account) : std::nullopt;
}

void ContentParticipant::noteFolder(Connection& connection, const ItemRow& row, Made& made) const {
  const auto account = whoseFolderIsBehind(connection, row);
  if (!account) return;
  const std::int64_t now = clock_();
  addJob(connection, row.id, JobKind::Upload, *account, now, now);
  made.hasUploads = true;
}

/// Once it is left alone: the steps of a save are one upload.
void ContentParticipant::addUpload(Connection& connection, std::uint64_t id,
                                   std::int64_t account) const {
  const std::int64_t now = clock_();
  const auto before = findJob(connection, id, JobKind::Upload);
  const bool isPausing = before && before->state == JobState::Waiting && before->due > now;
  const std::int64_t since = isPausing ? std::min(before->created, now) : now;
  const std::int64_t due = std::min(now + uploadPause_, since + kMostPauses * uploadPause_);
  addJob(connection, id, JobKind::Upload, account, due, since);
}

void ContentParticipant::noteDocument(Connection& connection, const ItemRow& row, Made& made) {
  const auto content = findContent(connection, row.id);
  const bool isHere = (row.flags & row_flag::kDownloaded) != 0;
  const bool isMarked = (row.flags & row_flag::kUploaded) != 0;
  // A ctime of its own may hide a change that kept size and date.
  const bool isDone = content && isMarked && isConfirmed(row, *content) &&
                      (!isHere || row.ctime == content->stamp.ctime);
  const std::int64_t account = content && content->content ? content->account : queue_->account();
  if (!isDone) {
    addUpload(connection, row.id, account);
    made.hasUploads = true;
  }
  const bool isToCome = !isHere && !findJob(connection, row.id, JobKind::Download);
  if (isToCome && isPinned(connection, row.id)) {
    const std::int64_t now = clock_();
    addJob(connection, row.id, JobKind::Download, account, now, now);
    made.hasDownloads = true;
  }
}

/// Whether an item's record stays with others, although the item has gone from here.
bool ContentParticipant::isLeft(Connection& connection, const ContentRow& content) {
  if (content.zone.ownerName() == RZCurrentUserDefaultName) return false;
  const auto share = findShareOfZone(connection, content.account, content.zone);
  if (!share || share->isLeaving() || share->root == content.id) return true;
  // With the shared item goes what is in it: that is leaving the share.
  return !findByID(connection, share->root);
}

void ContentParticipant::noteRemoval(Connection& connection, std::uint64_t id, Made& made) {
  removeJobsOf(connection, id);
  const auto content = findContent(connection, id);
  if (!content) return;
  if (!content->isRecorded() || isLeft(connection, *content)) return removeContent(connection, id);
  const std::int64_t now = clock_();
  addJob(connection, id, JobKind::Upload, content->account, now, now);
  made.hasUploads = true;
}

/// What is below may be very much: it is seen to in parts, later.
void ContentParticipant::noteMovedFolder(Connection& connection, const ItemChange& change,
                                         Made& made) {
  const bool isElsewhere = zoneOf(connection, change.parentBefore, {}, {}) !=
                               zoneOf(connection, change.row.parent, {}, {}) &&
                           !findShare(connection, change.row.id);
  if (!isElsewhere && !hasPins(connection)) return;
  const std::int64_t now = clock_();
  addJob(connection, change.row.id, JobKind::Spread, queue_->account(), now, now);
  made.hasSpreads = true;
}

std::function<void()> ContentParticipant::announcement(const Made& made) const {
  if (!made.hasUploads && !made.hasDownloads && !made.hasSpreads) return {};
  return [queue = queue_, made] {
    if (made.hasUploads) queue->noteJobs(JobKind::Upload);
    if (made.hasDownloads) queue->noteJobs(JobKind::Download);
    if (made.hasSpreads) queue->noteJobs(JobKind::Spread);
  };
}

std::function<void()> ContentParticipant::willCommit(WriteTransaction& transaction) {
  Connection& connection = transaction.connection();
  Made made;
  for (const ItemChange& change : transaction.changes()) {
    if (change.isDead()) {
      noteRemoval(connection, change.row.id, made);
    } else if (change.row.isFolder()) {
      if (change.hasMoved()) noteMovedFolder(connection, change, made);
      if (const auto row = findByID(connection, change.row.id)) noteFolder(connection, *row, made);
    } else if (change.row.kind == ItemKind::Document) {
      // As it is now: it may have changed several times.
      const auto row = findByID(connection, change.row.id);
      if (row) noteDocument(connection, *row, made);
    }
  }
  for (const ItemRow& touched : transaction.touched()) {
    const auto row = findByID(connection, touched.id);
    if (row && row->kind == ItemKind::Document) noteDocument(connection, *row, made);
  }
  return announcement(made);
}

bool ContentParticipant::sweep(WriteTransaction& transaction) {
  Connection& connection = transaction.connection();
  std::int64_t at = metaInteger(connection, meta::kSweptUpTo);
  if (at == kAllSwept) return true;
  std::vector<ItemRow> rows;
  {
    StatementUse statement(connection.prepared("SELECT " YOMBER_ROW_COLUMNS
                                               ",seq FROM item WHERE seq>?1 AND seq<=?2 "
                                               "ORDER BY seq LIMIT ?3"));
    statement->bindInteger(1, at);
    statement->bindInteger(2, metaInteger(connection, meta::kStampedUpTo));
    statement->bindInteger(3, kSweptAtOnce);
    while (statement->step()) {
      readRow(*statement, rows.emplace_back());
      at = statement->integer(kRowColumnCount);
    }
  }
  if (rows.empty()) {
    StatementUse others(connection.prepared("SELECT 1 FROM item WHERE seq>?1 LIMIT 1"));
    others->bindInteger(1, at);
    if (!others->step()) setMetaInteger(connection, meta::kSweptUpTo, kAllSwept);
    return true;
  }
  Made made;
  for (const ItemRow& row : rows) {
    const bool isKnown = row.kind != ItemKind::Document || findContent(connection, row.id) ||
                         findJob(connection, row.id, JobKind::Upload);
    if (!isKnown) noteDocument(connection, row, made);
  }
  setMetaInteger(connection, meta::kSweptUpTo, at);
  return false;
}

std::uint64_t countUnswept(Connection& connection) {
  const std::int64_t at = metaInteger(connection, meta::kSweptUpTo);
  if (at == kAllSwept) return 0;
  StatementUse statement(connection.prepared(
      "SELECT COUNT(*) FROM item WHERE seq>?1 AND kind=?2"
      " AND NOT EXISTS (SELECT 1 FROM content WHERE content.id=item.id)"
      " AND NOT EXISTS (SELECT 1 FROM job WHERE job.item=item.id AND job.kind=?3)"));
  statement->bindInteger(1, at);
  statement->bindInteger(2, static_cast<std::int64_t>(ItemKind::Document));
  statement->bindInteger(3, static_cast<std::int64_t>(JobKind::Upload));
  return statement->step() ? statement->id(0) : 0;
}

}  // namespace yomber
