// Evictions: giving up content that the store has.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <functional>
#include <memory>
#include <utility>
#include <vector>

#include "platform/foundation/fault_points.h"
#include "platform/foundation/log.h"
#include "platform/foundation/unnoticed_reads.h"
#include "platform/ostrell/constants.h"
#include "zarn/change_times.h"
#include "zarn/content/content_core.h"
#include "zarn/row_queries.h"
#include "zarn/write_transaction.h"

namespace yomber {
namespace {

FaultPoint evictStored("zarn.evict.stored");

/// From so many on, one sync of the file system costs less than theirs.
constexpr std::size_t kManyFiles = 8;

NSErrorRef refusal(const char* reason) {
  return NSError::errorWithDomain(QSOstrellErrorDomain, QSOstrellErrorCannotEvict,
                                  {{NSLocalizedDescriptionKey, std::string(reason)}});
}

struct Departure {
  JobSubject subject;
  std::unique_ptr<Eviction> eviction;
  FileStamp before;
  FileStamp after;
  bool isFault = false;  ///< its content is gone
  /// What the store has is not what is here, or is not there any longer.
  enum class Doubt : std::uint8_t { None, Changed, Lost } doubt = Doubt::None;
  NSErrorRef error;
};

/// Why an item cannot be given up, as far as the rows say.
NSErrorRef reasonInRows(const ContentCore& core, const JobSubject& subject) {
  if (!subject.row) {
    return NSError::errorWithDomain(NSCocoaErrorDomain, NSFileNoSuchFileError);
  }
  if (subject.row->kind != ItemKind::Document) return refusal("only documents can be given up");
  if (subject.isPinned) return refusal("it is pinned");
  if (core.wishes.isWanted(subject.job.item)) return refusal("somebody is about to read it");
  if (!subject.content || !subject.content->content) {
    return refusal("it is not confirmed in the store yet");
  }
  return nullptr;
}

/// Bytes are given up only where the store still has the same ones: dates alone prove nothing,
/// since what is written through a map, or within one tick of the clock, may leave them as they
/// are. Content is the store's, whoever's record has it.
NSErrorRef compareContent(const ContentCore& core, Departure& departure, int file) {
  ContentRow& content = *departure.subject.content;
  if (isOpenForWriting(departure.subject.path)) return refusal("it is open somewhere");
  const auto store = core.store();
  if (!store) return refusal("nobody is signed in, so that the store cannot be asked for it");
  const bool mayBeSame = content.stamp.hasSameContent(departure.before);
  NSErrorRef error = mayBeSame ? store->checkReachability() : nullptr;
  if (error) return error;
  const auto hashed =
      mayBeSame ? hashUnchanged(file, departure.before, nullptr) : std::optional<RZAsset>();
  if (!hashed || *hashed != *content.content) {
    departure.doubt = Departure::Doubt::Changed;
    return refusal("it has changed since it was confirmed in the store");
  }
  error = store->verify(*content.content);
  // Nobody knows then whether it will be there when it is back.
  if (isOutOfReach(error)) return error;
  if (error) {
    departure.doubt = Departure::Doubt::Lost;
    return refusal("the store has lost its content; it is sent there again");
  }
  content.stamp = departure.before;
  return nullptr;
}

/// The stamp of an open file, at a time when a change that is still to come is sure to show in it.
FileStamp settledStamp(int file) {
  while (true) {
    const StampedLook look = lookAtStamp(file);
    if (look.isSettled) return look.stamp;
    waitForTick();
  }
}

/// The name under which the store has the content; empty when it cannot be read.
std::string ownerOf(const ContentCore& core, const ContentRow& content) {
  if (core.storeOf(content.account)) return core.account();
  std::string name;
  (void)core.database().read(
      [&](Connection& connection) { name = accountName(connection, content.account); });
  return name;
}

/// Whether what an interrupted filling or giving up left is all the content's.
bool isOurs(const ContentCore& core, const FaultRecord& record, int file) {
  const auto store = core.store();
  FileDescriptor content;
  return store && !store->open(record.content, content) &&
         !hasForeignBytes(file, record, content.get());
}

NSErrorRef lookAt(const ContentCore& core, Departure& departure) {
  const std::string& path = departure.subject.path;
  const FileDescriptor file(
      open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC | O_NOCTTY));
  struct stat status{};
  if (!file || fstat(file.get(), &status) != 0) return NSError::errorWithErrno(errno, path);
  if (!S_ISREG(status.st_mode)) return refusal("only documents can be given up");
  readUnnoticed(file.get());
  departure.before = settledStamp(file.get());
  if (status.st_nlink > 1) return refusal("it has several names (hard links)");
  const FaultExamination found = examineFault(file.get());
  if (found.condition == FaultCondition::NoFault)
    return compareContent(core, departure, file.get());
  if (found.condition != FaultCondition::Pristine) {
    return refusal("it has changed since it was confirmed in the store");
  }
  // One that an earlier process left half-way is finished.
  if (found.isInterrupted && !isOurs(core, found.record, file.get())) {
    return refusal(
        "it was left half-way, and cannot be told from what was written since; "
        "provide it first");
  }
  departure.isFault = !found.isInterrupted;
  departure.after = departure.before;
  return nullptr;
}

class EvictionBatch {
 public:
  explicit EvictionBatch(ContentCore& core) : core_(core) {}

  /// Returns what tells who waits.
  [[nodiscard]] std::function<void()> run(std::vector<JobSubject> subjects) {
    std::vector<BusyFile> busy;
    for (JobSubject& subject : subjects) {
      if (subject.isStale) continue;
      Departure& departure = departures_.emplace_back();
      departure.subject = std::move(subject);
      departure.error = begin(departure, busy);
    }
    sync();
    for (Departure& departure : departures_) {
      if (departure.error || !departure.eviction) continue;
      // Somebody may have come to wish for it meanwhile.
      if (core_.wishes.isWanted(departure.subject.job.item)) {
        departure.error = refusal("somebody is about to read it");
      } else {
        departure.error = departure.eviction->finish(departure.after);
        departure.isFault = !departure.error;
      }
      departure.eviction.reset();
    }
    store();
    busy.clear();
    for (const Departure& departure : departures_) {
      if (departure.isFault) {
        core_.lookAgain(departure.subject, departure.after);
      }
      if (!departure.error) core_.finished.fetch_add(1);
    }
    return answers();
  }

 private:
  NSErrorRef begin(Departure& departure, std::vector<BusyFile>& busy) {
    if (NSErrorRef error = reasonInRows(core_, departure.subject)) return error;
    if (NSErrorRef error = lookAt(core_, departure)) return error;
    if (departure.isFault) return nullptr;
    const ContentRow& content = *departure.subject.content;
    const std::string owner = ownerOf(core_, content);
    if (owner.empty()) return refusal("it is not confirmed in the store yet");
    if (content.content->size > kKeptBytes) busy.emplace_back(core_, departure.before.inode);
    const FaultRecord record{.item = departure.subject.job.item,
                             .content = *content.content,
                             .mtime = content.stamp.mtime,
                             .head = 0,
                             .tag = content.tag,
                             .account = owner};
    NSErrorRef error;
    departure.eviction = Eviction::begin(departure.subject.path, departure.before, record, &error);
    return error;
  }

  /// The marks must be on the disk before any block is given up. What is all kept gives up none.
  void sync() {
    std::vector<Departure*> marked;
    for (Departure& departure : departures_) {
      const bool isLarge = departure.before.size > kKeptBytes;
      if (departure.eviction && isLarge) marked.push_back(&departure);
    }
    if (marked.size() < kManyFiles) {
      for (Departure* departure : marked) departure->error = departure->eviction->sync();
    } else {
      const FileDescriptor tree(
          open(core_.items->layout().tree().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
      const int number = tree && syncfs(tree.get()) == 0 ? 0 : errno;
      for (Departure* departure : marked) {
        if (number != 0) departure->error = NSError::errorWithErrno(number);
      }
    }
    for (Departure& departure : departures_) {
      if (departure.error) departure.eviction.reset();
    }
  }

  void store() {
    const NSErrorRef error = core_.database().write([&](WriteTransaction& transaction) {
      for (const Departure& departure : departures_) {
        const Job& job = departure.subject.job;
        removeJob(transaction.connection(), job);
        if (departure.doubt != Departure::Doubt::None) doubt(transaction, departure);
        if (departure.error || !departure.isFault) continue;
        (void)storeLocalState(transaction, job.item, departure.before, departure.after,
                              LocalContent::Away);
      }
      return NSErrorRef();
    });
    if (error) log_error(defaultLog(), "[ERROR] evictions cannot be noted: %@", error);
    core_.noteStored(error);
    (void)evictStored.hit();
  }

  /// Has the content looked at once more, and sent to the store where that has another or none.
  static void doubt(WriteTransaction& transaction, const Departure& departure) {
    Connection& connection = transaction.connection();
    auto content = findContent(connection, departure.subject.job.item);
    auto row = findByID(connection, departure.subject.job.item);
    if (!content || !row) return;
    if (departure.doubt == Departure::Doubt::Lost) content->content.reset();
    --content->stamp.ctime;
    storeContent(connection, *content);
    ItemRow after = *row;
    after.flags &= ~row_flag::kUploaded;
    if (after.flags != row->flags) {
      (void)transaction.update(*row, after);
    } else {
      transaction.updateQuietly(after);
    }
  }

  [[nodiscard]] std::function<void()> answers() const {
    std::vector<std::pair<std::uint64_t, NSErrorRef>> results;
    for (const Departure& departure : departures_) {
      results.emplace_back(departure.subject.job.item, departure.error);
    }
    return [&core = core_, results = std::move(results)] {
      for (const auto& [item, error] : results) {
        for (auto& completion : core.evictions.take(item)) {
          if (completion) completion(error);
        }
      }
    };
  }

  ContentCore& core_;
  std::vector<Departure> departures_;
};

}  // namespace

std::function<void()> doEvictions(ContentCore& core, const std::vector<Job>& jobs) {
  std::vector<JobSubject> subjects;
  if (NSErrorRef error = core.readSubjects(jobs, subjects)) {
    log_error(defaultLog(), "[ERROR] what is to be evicted cannot be read: %@", error);
    core.noteStored(error);
    return [] {};
  }
  return EvictionBatch(core).run(std::move(subjects));
}

}  // namespace yomber
