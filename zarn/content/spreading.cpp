// What a folder's pins, and the container that it came to, mean for what is in it.
#include <algorithm>
#include <span>
#include <vector>

#include "platform/foundation/fault_points.h"
#include "platform/foundation/log.h"
#include "zarn/content/content_core.h"
#include "zarn/row_queries.h"
#include "zarn/write_transaction.h"

namespace yomber {
namespace {

FaultPoint spreadStored("zarn.spread.stored");

/// So many items are seen to in one transaction: others are to get their turn.
constexpr std::size_t kTogether = 500;

/// One folder. The folders in it get jobs of their own, so that one that is interrupted goes on
/// with the next process; doing an item twice changes nothing.
class Spreading {
 public:
  Spreading(ContentCore& core, const Job& job) : core_(core), job_(job) {}

  NSErrorRef run() {
    std::vector<std::uint64_t> ids;
    NSErrorRef error = core_.database().read(
        [&](Connection& connection) { ids = findChildIDs(connection, job_.item); });
    std::span<const std::uint64_t> rest(ids);
    while (!error && !core_.queue->isEnding()) {
      const auto part = rest.first(std::min(rest.size(), kTogether));
      rest = rest.subspan(part.size());
      error = core_.database().write([&](WriteTransaction& transaction) {
        note(transaction.connection(), part);
        if (rest.empty()) removeJob(transaction.connection(), job_);
        return NSErrorRef();
      });
      for (const JobKind kind : {JobKind::Upload, JobKind::Download, JobKind::Spread}) {
        core_.queue->noteJobs(kind);
      }
      (void)spreadStored.hit();
      if (rest.empty()) break;
    }
    return error;
  }

 private:
  void note(Connection& connection, std::span<const std::uint64_t> ids) {
    const bool isBelowPin = isPinned(connection, job_.item);
    const std::int64_t now = core_.now();
    for (const std::uint64_t id : ids) {
      const auto row = findByID(connection, id);
      // What has come or gone since was seen to when it did.
      if (!row || row->parent != job_.item) continue;
      if (row->isFolder()) {
        addJob(connection, id, JobKind::Spread, job_.account, now, now);
        if (const auto account = whoseFolderIsBehind(connection, *row))
          addJob(connection, id, JobKind::Upload, *account, now, now);
      } else if (row->kind == ItemKind::Document) {
        noteDocument(connection, *row, isBelowPin);
      }
    }
  }

  void noteDocument(Connection& connection, const ItemRow& row, bool isBelowPin) {
    const auto content = findContent(connection, row.id);
    const bool isElsewhere =
        content && content->content &&
        content->zone != zoneOf(connection, row.id, content->zone, content->account);
    if (isElsewhere) {
      const std::int64_t now = core_.now();
      addJob(connection, row.id, JobKind::Upload, content->account, now, now);
    }
    followPins(core_, connection, row, isBelowPin || (content && content->isPinned));
  }

  ContentCore& core_;
  const Job job_;
};

}  // namespace

void followPins(const ContentCore& core, Connection& connection, const ItemRow& row,
                bool isPinned) {
  const auto job = findJob(connection, row.id, JobKind::Download);
  const bool isHere = (row.flags & row_flag::kDownloaded) != 0;
  if (isPinned && !isHere && !job) {
    const auto content = findContent(connection, row.id);
    const std::int64_t account =
        content && content->content ? content->account : core.queue->account();
    const std::int64_t now = core.now();
    addJob(connection, row.id, JobKind::Download, account, now, now);
  }
  const auto running = core.queue->running(row.id);
  const bool hasBegun = running && running->job.kind == JobKind::Download;
  if (job && !isPinned && !hasBegun && !core.wishes.isWanted(row.id)) removeJob(connection, *job);
}

void doSpreading(ContentCore& core, const std::vector<Job>& jobs) {
  NSErrorRef error;
  for (const Job& job : jobs) {
    error = Spreading(core, job).run();
    if (error) break;
  }
  if (error) log_error(defaultLog(), "[ERROR] a pin or a move cannot be followed: %@", error);
  core.noteStored(error);
}

}  // namespace yomber
