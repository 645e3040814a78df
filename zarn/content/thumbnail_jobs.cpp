// Thumbnails of what was uploaded without: an old drive's, and those that were not made in time.
#include <cerrno>
#include <utility>
#include <vector>

#include "platform/foundation/fault_points.h"
#include "platform/foundation/log.h"
#include "platform/rozzel/errors.h"
#include "zarn/content/content_core.h"
#include "zarn/content/thumbnail_maker.h"
#include "zarn/content/thumbnail_rows.h"
#include "zarn/row_queries.h"
#include "zarn/schema.h"
#include "zarn/write_transaction.h"

namespace yomber {
namespace {

using Outcome = ThumbnailSubject::Outcome;

FaultPoint thumbnailMade("zarn.thumbnail.made");
FaultPoint thumbnailSaved("zarn.thumbnail.saved");

constexpr std::chrono::minutes kPatience{10};
constexpr std::int64_t kSweptAtOnce = 2000;
constexpr std::int64_t kAllSwept = -1;

/// Whether another attempt would be refused as well.
bool isForGood(const NSErrorRef& refusal) {
  return rz_isError(refusal, RZErrorPermissionFailure) ||
         rz_isError(refusal, RZErrorZoneNotFound) || rz_isError(refusal, RZErrorUnknownItem);
}

class ThumbnailBatch {
 public:
  ThumbnailBatch(ContentCore& core, std::shared_ptr<ContentStore> store)
      : core_(core), store_(std::move(store)) {}

  void add(const JobSubject& subject) {
    jobs_.push_back(subject);
    ThumbnailSubject& wanted = wanted_.emplace_back();
    const bool isThere = subject.row && subject.row->kind == ItemKind::Document &&
                         subject.content && subject.content->content;
    const bool mayWrite = !subject.share || subject.share->mayWrite;
    if (!isThere || !mayWrite) return;
    wanted.name = subject.row->name;
    wanted.content = *subject.content->content;
  }

  void run() {
    ThumbnailMaker(core_, store_).make(wanted_, kPatience);
    if (thumbnailMade.hit() || core_.queue->isEnding()) return;
    for (const ThumbnailSubject& wanted : wanted_) {
      if (isOutOfReach(wanted.error)) return core_.noteOutOfReach();
    }
    std::vector<RecordThumbnail> records;
    std::vector<std::size_t> places;
    for (std::size_t i = 0; i < jobs_.size(); ++i) {
      if (wanted_[i].outcome != Outcome::Ready) continue;
      places.push_back(i);
      records.push_back({.item = jobs_[i].job.item,
                         .zone = jobs_[i].content->zone,
                         .content = wanted_[i].content,
                         .thumbnail = *wanted_[i].thumbnail});
    }
    saved_.assign(jobs_.size(), {});
    std::vector<ContentStore::Saved> saved;
    const NSErrorRef failure = store_->saveThumbnails(records, saved);
    if (isOutOfReach(failure)) return core_.noteOutOfReach();
    for (std::size_t i = 0; i < places.size(); ++i) saved_[places[i]] = saved[i];
    if (thumbnailSaved.hit()) return;
    const NSErrorRef error = core_.database().write([&](WriteTransaction& transaction) {
      for (std::size_t i = 0; i < jobs_.size(); ++i) store(transaction.connection(), i);
      return NSErrorRef();
    });
    if (error) log_error(defaultLog(), "[ERROR] thumbnails cannot be noted: %@", error);
    core_.noteStored(error);
  }

 private:
  void store(Connection& connection, std::size_t place) {
    const Job& job = jobs_[place].job;
    const ThumbnailSubject& wanted = wanted_[place];
    if (wanted.isNew) storeThumbnail(connection, {wanted.content, wanted.thumbnail});
    if (wanted.outcome == Outcome::StoreFailed)
      return core_.postpone(connection, job, wanted.error);
    // Its maker died at upload, and here again.
    if (wanted.outcome == Outcome::Later) storeThumbnail(connection, {wanted.content, {}});
    if (wanted.outcome == Outcome::Unavailable)
      setMetaInteger(connection, meta::kThumbnailsMissed, 1);
    const NSErrorRef& error = saved_[place].error;
    if (error && !isForGood(error)) return core_.postpone(connection, job, error);
    removeJob(connection, job);
    if (!saved_[place].tag.empty()) noteTag(connection, place);
  }

  void noteTag(Connection& connection, std::size_t place) {
    auto content = findContent(connection, jobs_[place].job.item);
    if (!content || content->content != wanted_[place].content) return;
    content->tag = saved_[place].tag;
    storeContent(connection, *content);
  }

  ContentCore& core_;
  const std::shared_ptr<ContentStore> store_;
  std::vector<JobSubject> jobs_;
  std::vector<ThumbnailSubject> wanted_;    ///< one for each
  std::vector<ContentStore::Saved> saved_;  ///< one for each
};

}  // namespace

void doThumbnails(ContentCore& core, const std::vector<Job>& jobs) {
  const auto store = jobs.empty() ? nullptr : core.storeOf(jobs.front().account);
  if (!store) return;  // signed out meanwhile
  std::vector<JobSubject> subjects;
  if (const NSErrorRef error = core.readSubjects(jobs, subjects)) {
    log_error(defaultLog(), "[ERROR] what is to be drawn cannot be read: %@", error);
    core.noteStored(error);
    return;
  }
  ThumbnailBatch batch(core, store);
  for (const JobSubject& subject : subjects)
    if (!subject.isStale) batch.add(subject);
  batch.run();
}

void beginThumbnailSweep(const ContentCore& core, WriteTransaction& transaction) {
  Connection& connection = transaction.connection();
  const std::int64_t abilities = core.drawer->abilities();
  const bool isAsBefore = metaInteger(connection, meta::kThumbnailAbilities) == abilities;
  if (isAsBefore && metaInteger(connection, meta::kThumbnailsMissed) == 0) return;
  setMetaInteger(connection, meta::kThumbnailAbilities, abilities);
  setMetaInteger(connection, meta::kThumbnailsMissed, 0);
  setMetaInteger(connection, meta::kThumbnailsSweptUpTo, 0);
}

bool sweepThumbnails(const ContentCore& core, WriteTransaction& transaction) {
  Connection& connection = transaction.connection();
  const std::int64_t at = metaInteger(connection, meta::kThumbnailsSweptUpTo);
  if (at == kAllSwept) return true;
  std::vector<std::uint64_t> documents;
  std::int64_t last = kAllSwept;
  {
    StatementUse statement(connection.prepared(
        "SELECT seq,id,kind,name FROM item WHERE seq>?1 ORDER BY seq LIMIT ?2"));
    statement->bindInteger(1, at);
    statement->bindInteger(2, kSweptAtOnce);
    while (statement->step()) {
      last = statement->integer(0);
      const bool isDocument =
          statement->integer(2) == static_cast<std::int64_t>(ItemKind::Document);
      if (isDocument && core.drawer->mayDraw(std::string(statement->bytes(3))))
        documents.push_back(statement->id(1));
    }
  }
  const std::int64_t now = core.now();
  for (const std::uint64_t id : documents) {
    const auto content = findContent(connection, id);
    // What is yet to be uploaded gets its thumbnail then.
    if (!content || !content->content || findThumbnail(connection, *content->content)) continue;
    addJob(connection, id, JobKind::Thumbnail, content->account, now, now);
  }
  setMetaInteger(connection, meta::kThumbnailsSweptUpTo, last);
  return last == kAllSwept;
}

}  // namespace yomber
