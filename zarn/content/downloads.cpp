// Downloads: filling faults in their places, and taking their marks off later.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "platform/foundation/fault_attributes.h"
#include "platform/foundation/fault_points.h"
#include "platform/foundation/log.h"
#include "platform/ostrell/constants.h"
#include "zarn/content/content_core.h"
#include "zarn/row_queries.h"
#include "zarn/write_transaction.h"

namespace yomber {
namespace {

FaultPoint downloadNoted("zarn.download.noted");
FaultPoint downloadFilled("zarn.download.filled");
FaultPoint settleSynced("zarn.settle.synced");

constexpr int kAttempts = 3;

NSErrorRef noSuchFile(const std::string& path) {
  return NSError::errorWithDomain(NSCocoaErrorDomain, NSFileNoSuchFileError,
                                  {{NSFilePathErrorKey, path}});
}

NSErrorRef notSignedIn() {
  return NSError::errorWithDomain(
      QSOstrellErrorDomain, QSOstrellErrorLoggedOut,
      {{NSLocalizedDescriptionKey,
        std::string("nobody is signed in to the drive: yomber account sign-in NAME")}});
}

NSErrorRef ofAnotherAccount(const std::string& account) {
  return NSError::errorWithDomain(
      QSOstrellErrorDomain, QSOstrellErrorLoggedOut,
      {{NSLocalizedDescriptionKey,
        "its content belongs to the account \"" + account + "\"; sign in to that one"}});
}

/// Leaves the file closed: nobody else may have it open when it is decided on.
FaultExamination examineAt(const std::string& path) {
  const FileDescriptor file(
      open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC | O_NOCTTY));
  return file ? examineFault(file.get()) : FaultExamination{};
}

struct Download {
  JobSubject subject;
  bool isByItself = false;  ///< goes on without anybody who waits
  std::uint64_t inode = 0;
  FillOutcome filled;
  NSErrorRef error;
};

class DownloadBatch {
 public:
  explicit DownloadBatch(ContentCore& core) : core_(core), store_(core.store()) {}

  void run(const std::vector<Job>& jobs) {
    std::vector<JobSubject> subjects;
    if (NSErrorRef error = core_.readSubjects(jobs, subjects)) {
      for (const Job& job : jobs) answer(job.item, error);
      core_.noteStored(error);
      return;
    }
    for (std::size_t i = 0; i < subjects.size(); ++i) {
      if (subjects[i].isStale) continue;
      const bool isByItself = jobs[i].seq != 0 || subjects[i].isPinned;
      // Asked for once more than there were wishes, or taken back.
      if (!isByItself && !core_.wishes.isWanted(subjects[i].job.item)) continue;
      Download& download = downloads_.emplace_back();
      download.subject = std::move(subjects[i]);
      download.isByItself = isByItself;
    }
    runTogether();
  }

 private:
  void runTogether() {
    if (downloads_.empty()) return;
    noteJobs();
    std::vector<BusyFile> busy;
    for (Download& download : downloads_) {
      if (!download.error) download.error = fill(download, busy);
    }
    (void)downloadFilled.hit();
    const NSErrorRef error = store();
    core_.noteStored(error);
    busy.clear();
    for (Download& download : downloads_) {
      if (error && !download.error) download.error = error;
      if (!download.error) core_.lookAgain(download.subject, download.filled.after);
      finish(download);
    }
    downloads_.clear();
  }

  /// What changes a file before it is whole again is written down first.
  void noteJobs() {
    std::vector<Download*> unnoted;
    for (Download& download : downloads_) {
      const auto& row = download.subject.row;
      const bool isNoted = download.subject.job.seq != 0 || !row || row->size <= kKeptBytes;
      if (!isNoted) unnoted.push_back(&download);
    }
    if (unnoted.empty()) return;
    const NSErrorRef error = core_.database().write([&](WriteTransaction& transaction) {
      for (Download* download : unnoted) {
        Job& job = download->subject.job;
        const std::int64_t now = core_.now();
        addJob(transaction.connection(), job.item, JobKind::Download, job.account, now, now);
        const auto added = findJob(transaction.connection(), job.item, JobKind::Download);
        if (added) job = *added;
      }
      return NSErrorRef();
    });
    for (Download* download : unnoted) download->error = error;
    (void)downloadNoted.hit();
  }

  [[nodiscard]] bool isWanted(const Download& download) const {
    if (core_.queue->isEnding()) return false;
    return download.isByItself || core_.wishes.isWanted(download.subject.job.item);
  }

  NSErrorRef fill(Download& download, std::vector<BusyFile>& busy) {
    NSErrorRef error;
    for (int attempt = 0; attempt < kAttempts; ++attempt) {
      if (!download.subject.row || download.subject.path.empty()) return noSuchFile({});
      error = fillOnce(download, busy);
      if (!error || !error->is(NSPOSIXErrorDomain, EAGAIN)) break;
      // Somebody has written to the fault.
      const std::string& path = download.subject.path;
      FaultExamination found = examineAt(path);
      if (download.filled.isMixed && found.isInterrupted) found.condition = FaultCondition::Mixed;
      if (NSErrorRef failure = core_.settleWritten(path, found)) return failure;
    }
    if (error && error->is(NSPOSIXErrorDomain, ENOENT)) {
      (void)core_.scanner->scanLocation(download.subject.path, nullptr);
      return noSuchFile(download.subject.path);
    }
    return error;
  }

  NSErrorRef fillOnce(Download& download, std::vector<BusyFile>& busy) {
    const JobSubject& subject = download.subject;
    struct stat status{};
    if (lstat(subject.path.c_str(), &status) != 0) {
      return NSError::errorWithErrno(errno, subject.path);
    }
    download.inode = status.st_ino;
    if (status.st_size > static_cast<off_t>(kKeptBytes)) busy.emplace_back(core_, status.st_ino);
    const auto shown = progressOf(subject.job.item);
    for (const auto& progress : shown) progress->setTotalUnitCount(status.st_size);
    const auto goesOn = [&](std::uint64_t done) {
      for (const auto& progress : shown) {
        progress->setCompletedUnitCount(static_cast<std::int64_t>(done));
      }
      return isWanted(download);
    };
    const FaultSource source{.copy =
                                 [&](const FaultRecord& record, int file,
                                     const std::function<bool(std::uint64_t)>& watch) {
                                   NSErrorRef error = whyNotOurs(record);
                                   return error ? error : store_->copy(record.content, file, watch);
                                 },
                             .open =
                                 [&](const FaultRecord& record, FileDescriptor& content) {
                                   NSErrorRef error = whyNotOurs(record);
                                   return error ? error : store_->open(record.content, content);
                                 }};
    return fillFault(subject.path, source, goesOn, download.filled);
  }

  [[nodiscard]] NSErrorRef whyNotOurs(const FaultRecord& record) const {
    if (!store_) return notSignedIn();
    const bool isOurs = record.account.empty() || record.account == core_.account();
    return isOurs ? nullptr : ofAnotherAccount(record.account);
  }

  [[nodiscard]] std::vector<NSProgressRef> progressOf(std::uint64_t item) const {
    std::vector<NSProgressRef> result;
    if (auto running = core_.queue->running(item)) result.push_back(running->progress);
    if (auto wished = core_.wishes.progress(item)) result.push_back(wished);
    return result;
  }

  NSErrorRef store() {
    bool hasSettling = false;
    NSErrorRef error = core_.database().write([&](WriteTransaction& transaction) {
      for (Download& download : downloads_) {
        if (download.error) {
          storeFailure(transaction.connection(), download);
          continue;
        }
        storeSuccess(transaction, download);
        hasSettling = true;
      }
      return NSErrorRef();
    });
    if (hasSettling) core_.queue->noteJobs(JobKind::Settle);
    return error;
  }

  void storeSuccess(WriteTransaction& transaction, Download& download) const {
    Connection& connection = transaction.connection();
    const Job& job = download.subject.job;
    const FileStamp& after = download.filled.after;
    FileStamp before = after;
    before.inode = download.inode;
    const auto local = download.filled.wasHere ? LocalContent::Unread : LocalContent::Verified;
    const bool isSeen = storeLocalState(transaction, job.item, before, after, local);
    if (!isSeen) download.filled.after = {};  // has it scanned
    if (job.seq != 0) removeJob(connection, job);
    const std::int64_t now = core_.now();
    const std::int64_t pause = std::chrono::nanoseconds(core_.options.settlePause).count();
    addJob(connection, job.item, JobKind::Settle, job.account, now + pause, now);
  }

  void storeFailure(Connection& connection, const Download& download) const {
    const Job& job = download.subject.job;
    if (job.seq == 0 || core_.queue->isEnding()) return;
    const bool isKept = download.isByItself && download.subject.row;
    if (!isKept) {
      removeJob(connection, job);
    } else if (!isOutOfReach(download.error)) {
      core_.postpone(connection, job, download.error);
    }
  }

  void finish(const Download& download) {
    const std::uint64_t item = download.subject.job.item;
    if (isOutOfReach(download.error)) core_.noteOutOfReach();
    if (!download.error) core_.finished.fetch_add(1);
    const bool isCancelled =
        download.error && download.error->is(NSCocoaErrorDomain, NSUserCancelledError);
    // Given up, and wished for again meanwhile.
    if (isCancelled && !core_.queue->isEnding() && core_.wishes.isWanted(item)) {
      const auto& row = download.subject.row;
      return core_.queue->pushUrgent(item, row ? row->size : 0);
    }
    answer(item, download.error);
  }

  void answer(std::uint64_t item, const NSErrorRef& error) {
    for (auto& completion : core_.wishes.take(item)) {
      if (completion) completion(error);
    }
  }

  ContentCore& core_;
  const std::shared_ptr<ContentStore> store_;
  std::vector<Download> downloads_;
};

}  // namespace

void doDownloads(ContentCore& core, const std::vector<Job>& jobs) { DownloadBatch(core).run(jobs); }

namespace {

struct Settling {
  JobSubject subject;
  FileStamp before;
  FileStamp after;
  bool isHere = false;
  bool isLater = false;
};

/// Whether the file is one to take the marks off; what it is otherwise is found out as well.
bool isFilled(Settling& settling) {
  const std::string& path = settling.subject.path;
  const FileDescriptor file(open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
  struct stat status{};
  if (path.empty()) return false;
  if (!file || fstat(file.get(), &status) != 0) {
    // One that may not be read now keeps its marks, and is seen to again.
    settling.isLater = errno == EACCES || errno == EMFILE || errno == ENFILE;
    return false;
  }
  settling.before = FileStamp::of(status);
  settling.after = settling.before;
  settling.isHere = !isFault(file.get());
  bool isDamaged = false;
  return settling.isHere && readFaultRecord(file.get(), isDamaged);
}

/// Up to so many are synced one by one. A sync of the file system waits for what all others have
/// written as well; for few files that costs more than it saves.
constexpr std::size_t kFewFilled = 16;

int syncOne(const Settling& settling) {
  const FileDescriptor file(open(settling.subject.path.c_str(),
                                 O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC | O_NOCTTY));
  struct stat status{};
  if (!file || fstat(file.get(), &status) != 0) return errno;
  if (status.st_ino != settling.before.inode) return ESTALE;
  return fdatasync(file.get()) == 0 ? 0 : errno;
}

/// What was written to them is on the disk then; where it is not, that is left for later.
void syncFilled(const ContentCore& core, const std::vector<Settling*>& filled) {
  if (filled.size() > kFewFilled) {
    const FileDescriptor tree(
        open(core.items->layout().tree().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (tree && syncfs(tree.get()) == 0) return;
    log_error(defaultLog(), "[ERROR] filled files cannot be synced: errno %d", errno);
    for (Settling* settling : filled) settling->isLater = true;
    return;
  }
  for (Settling* settling : filled) {
    const int number = syncOne(*settling);
    settling->isLater = number != 0;
    if (number == 0 || number == ENOENT || number == ESTALE) continue;
    log_error(defaultLog(), "[ERROR] a filled file cannot be synced: errno %d", number);
  }
}

}  // namespace

void doSettling(ContentCore& core, const std::vector<Job>& jobs) {
  std::vector<JobSubject> subjects;
  if (NSErrorRef error = core.readSubjects(jobs, subjects)) {
    log_error(defaultLog(), "[ERROR] what was filled cannot be read: %@", error);
    core.noteStored(error);
    return;
  }
  std::vector<Settling> all;
  all.reserve(subjects.size());
  std::vector<Settling*> filled;
  for (JobSubject& subject : subjects) {
    if (subject.isStale) continue;
    all.push_back({.subject = std::move(subject), .before = {}, .after = {}});
    if (isFilled(all.back())) filled.push_back(&all.back());
  }
  syncFilled(core, filled);
  (void)settleSynced.hit();
  for (Settling* settling : filled) {
    settling->isLater =
        settling->isLater || removeFaultMarks(settling->subject.path, settling->before.inode,
                                              settling->before, settling->after) != nullptr;
  }
  const NSErrorRef error = core.database().write([&](WriteTransaction& transaction) {
    for (Settling& settling : all) {
      const Job& job = settling.subject.job;
      if (settling.isLater) {
        core.postpone(transaction.connection(), job, NSError::errorWithErrno(EIO));
        continue;
      }
      removeJob(transaction.connection(), job);
      if (settling.before.inode == 0) continue;
      const auto local = settling.isHere ? LocalContent::Unread : LocalContent::Away;
      const bool isSeen =
          storeLocalState(transaction, job.item, settling.before, settling.after, local);
      if (!isSeen) settling.after = {};  // has it scanned
    }
    return NSErrorRef();
  });
  if (error) log_error(defaultLog(), "[ERROR] filled files cannot be noted: %@", error);
  core.noteStored(error);
  for (const Settling& settling : all) {
    if (settling.before.inode != 0) core.lookAgain(settling.subject, settling.after);
  }
}

}  // namespace yomber
