// Uploads: reading documents, making the store's records what they are, and confirming that.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <memory>
#include <utility>
#include <vector>

#include "platform/foundation/fault_attributes.h"
#include "platform/foundation/fault_points.h"
#include "platform/foundation/log.h"
#include "platform/foundation/unnoticed_reads.h"
#include "zarn/content/content_core.h"
#include "zarn/content/thumbnail_maker.h"
#include "zarn/content/thumbnail_rows.h"
#include "zarn/row_queries.h"
#include "zarn/write_transaction.h"

namespace yomber {
namespace {

FaultPoint uploadRead("zarn.upload.read");
FaultPoint uploadReading("zarn.upload.reading");
FaultPoint uploadStaged("zarn.upload.staged");
FaultPoint uploadSynced("zarn.upload.synced");
FaultPoint uploadCommitted("zarn.upload.committed");
FaultPoint uploadConfirmed("zarn.upload.confirmed");

constexpr const char* kOfNoBoot = "none";

/// So much is read before it is synced and committed together.
constexpr std::uint64_t kGroupBytes = 64 << 20;
constexpr int kReadings = 3;
/// Up to so many are synced one by one, more by syncing the file system.
constexpr std::size_t kFewFiles = 4;

bool isContentGone(const NSErrorRef& error) {
  return rz_isError(error->underlyingError(), RZErrorAssetMissing) ||
         rz_isError(error->underlyingError(), RZErrorAssetDamaged);
}

/// One document on its way.
struct Upload {
  JobSubject subject;
  enum class Kind { Save, Remove, Nothing, Failed } kind = Kind::Failed;
  ContentRow confirmed;  ///< what will be so when the store has it
  std::optional<RZRecordZoneID> previousZone;
  std::string owner;                        ///< another account, whose content it is
  std::optional<std::int64_t> recordOwner;  ///< another account, whose record it is
  bool isFault = false;                     ///< only the store can have its content
  bool isToSettle = false;                  ///< it is here, and still marked
  bool isPreviousLeft = false;              ///< its removal from there was refused
  ThumbnailSubject thumbnail;
  NSErrorRef error;
};

class UploadGroup {
 public:
  UploadGroup(ContentCore& core, std::shared_ptr<ContentStore> store)
      : core_(core), store_(std::move(store)) {}

  void add(JobSubject subject) {
    Upload& upload = uploads_.emplace_back();
    upload.subject = std::move(subject);
    prepare(upload);
    if (bytes_ >= kGroupBytes) finish();
  }

  void finish() {
    NSErrorRef error = noteSaving();
    if (!error) error = syncDocuments();
    if (!error) error = commitAssets();
    if (!error) makeThumbnails();
    if (!error) error = saveRecords();
    confirm(error);
    uploads_.clear();
    group_.reset();
    bytes_ = 0;
  }

 private:
  void prepare(Upload& upload) {
    JobSubject& subject = upload.subject;
    upload.confirmed.id = subject.job.item;
    upload.confirmed.account = subject.job.account;
    if (subject.content) upload.confirmed = *subject.content;
    if (!subject.row) {
      const bool hasRecord = subject.content && subject.content->hasRecord();
      upload.kind = hasRecord ? Upload::Kind::Remove : Upload::Kind::Nothing;
      return;
    }
    if (subject.row->isFolder()) return prepareFolder(upload);
    if (subject.row->kind != ItemKind::Document || subject.path.empty()) {
      upload.kind = Upload::Kind::Nothing;
      return;
    }
    upload.error = read(upload);
    upload.kind = upload.error ? Upload::Kind::Failed : Upload::Kind::Save;
    const bool isNothing = !upload.error && (!upload.owner.empty() || isInStore(upload));
    if (isNothing) upload.kind = Upload::Kind::Nothing;
  }

  /// Only in shares folders have records.
  static void prepareFolder(Upload& upload) {
    const JobSubject& subject = upload.subject;
    const bool isRecorded = subject.content && subject.content->isRecorded();
    const auto& share = subject.share;
    upload.kind = Upload::Kind::Nothing;
    if (isRecorded && subject.content->account != subject.job.account) {
      upload.recordOwner = subject.content->account;
      return;
    }
    if (!share) {
      if (isRecorded && isSharedZone(subject.content->zone)) upload.kind = Upload::Kind::Remove;
      return;
    }
    if (!share->isOwn() && share->root == subject.row->id) return;
    if (!isInStore(upload)) upload.kind = Upload::Kind::Save;
  }

  /// Whether the store's record needs no change.
  static bool isInStore(Upload& upload) {
    const auto& before = upload.subject.content;
    ContentRow& after = upload.confirmed;
    const bool isElsewhere = before && before->hasRecord() && before->zone != upload.subject.zone;
    if (isElsewhere) upload.previousZone = before->zone;
    after.zone = upload.subject.zone;
    after.parent = upload.subject.row->parent;
    after.name = upload.subject.row->name;
    return before && before->content == after.content && !before->tag.empty() &&
           before->zone == after.zone && before->parent == after.parent &&
           before->name == after.name && before->stamp.mtime == after.stamp.mtime;
  }

  NSErrorRef read(Upload& upload) {
    const std::string& path = upload.subject.path;
    FileDescriptor file(
        open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC | O_NOCTTY));
    if (!file) return look(upload, errno);
    readUnnoticed(file.get());
    if (uploadRead.hit()) return NSError::errorWithErrno(EIO, path);
    const FaultExamination found = examineFault(file.get());
    switch (found.condition) {
      case FaultCondition::NoFault: {
        // Marked as filled: a copy of one that was so, for which nobody has a job.
        bool isDamaged = false;
        const auto record = readFaultRecord(file.get(), isDamaged);
        upload.isToSettle = record.has_value();
        const auto& before = upload.subject.content;
        NSErrorRef error = readDocument(upload, std::move(file));
        // What we have filled ourselves is no copy, whatever its date says.
        const bool isOurs = before && before->stamp.inode == upload.confirmed.stamp.inode;
        const bool isCopiedTooSoon = !error && record && !isOurs &&
                                     upload.confirmed.stamp.mtime == record->mtime &&
                                     upload.confirmed.stamp.size == record->content.size &&
                                     upload.confirmed.content != record->content;
        return isCopiedTooSoon ? unfill(path) : error;
      }
      case FaultCondition::Pristine:
        return readFault(upload, found);
      default:
        break;
    }
    file = FileDescriptor();  // nobody else may have it open for that
    if (NSErrorRef error = core_.settleWritten(path, found)) return error;
    return NSError::errorWithErrno(EAGAIN, path);  // as what it is now, the next time
  }

  /// A copy of a fault that was made while that was filled: it has the mark, but not the content.
  NSErrorRef unfill(const std::string& path) const {
    NSErrorRef error;
    const ChangedFile file = ChangedFile::open(path, &error);
    if (file.isValid()) error = file.setAttribute(kFilledAttribute, kOfNoBoot);
    if (error) return error;
    (void)core_.scanner->scanLocation(path);
    return NSError::errorWithErrno(EAGAIN, path);  // as the fault that it is, the next time
  }

  /// The row is behind the disk.
  NSErrorRef look(const Upload& upload, int number) {
    const std::string& path = upload.subject.path;
    // A file that does not carry its id yet may have moved: only a scan of both places knows it
    // again, and the observer makes one.
    const bool mayHaveMoved =
        number == ENOENT && (upload.subject.row->flags & row_flag::kStamped) == 0;
    if (!mayHaveMoved) (void)core_.scanner->scanLocation(path);
    return NSError::errorWithErrno(number, path);
  }

  NSErrorRef readFault(Upload& upload, const FaultExamination& found) const {
    const std::string& account = found.record.account;
    if (!account.empty() && account != core_.account()) {
      upload.owner = account;
      return nullptr;
    }
    upload.isFault = true;
    upload.confirmed.content = found.record.content;
    upload.confirmed.stamp = found.stamp;
    return nullptr;
  }

  NSErrorRef readDocument(Upload& upload, FileDescriptor file) {
    const FileStamp before = upload.confirmed.stamp;
    if (NSErrorRef error = readContent(upload, file.get())) return error;
    if (upload.confirmed.stamp == before) return nullptr;
    if (unsynced_.size() >= kFewFiles) file = FileDescriptor();
    unsynced_.push_back(std::move(file));
    return nullptr;
  }

  /// Where others save as well, whose save it was must be known however this process ends.
  NSErrorRef noteSaving() {
    std::vector<const ContentRow*> saving;
    for (const Upload& upload : uploads_) {
      const ContentRow& confirmed = upload.confirmed;
      if (upload.kind == Upload::Kind::Save && confirmed.content && isSharedZone(confirmed.zone))
        saving.push_back(&confirmed);
    }
    if (saving.empty()) return nullptr;
    return core_.database().write([&](WriteTransaction& transaction) {
      for (const ContentRow* const each : saving)
        storeSaving(transaction.connection(), each->id, *each->content, each->stamp);
      return NSErrorRef();
    });
  }

  /// What this disk could still forget, its document and the row with its id, must not be told to
  /// the store: after a loss of power, what was left of it would go there as a change.
  NSErrorRef syncDocuments() {
    const std::vector<FileDescriptor> files = std::exchange(unsynced_, {});
    if (files.empty()) return nullptr;
    const std::string& tree = core_.items->layout().tree();
    bool isSynced = true;
    if (files.size() <= kFewFiles) {
      for (const FileDescriptor& file : files) isSynced = isSynced && fsync(file.get()) == 0;
    } else {
      const FileDescriptor folder(open(tree.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
      isSynced = folder && syncfs(folder.get()) == 0;
    }
    return isSynced ? core_.database().makeDurable() : NSError::errorWithErrno(errno, tree);
  }

  NSErrorRef readContent(Upload& upload, int file) {
    struct stat status{};
    if (fstat(file, &status) != 0) return NSError::errorWithErrno(errno, upload.subject.path);
    if (!S_ISREG(status.st_mode)) return look(upload, ESTALE);
    const StampedLook look = lookAtStamp(file);
    const FileStamp& stamp = look.stamp;
    ContentRow& confirmed = upload.confirmed;
    if (confirmed.content && confirmed.stamp == stamp) return nullptr;
    if (confirmed.content && confirmed.stamp.hasSameContent(stamp)) {
      NSErrorRef error;
      const auto hashed = hashUnchanged(file, stamp, &error);
      if (!hashed) return error;
      confirmed.stamp.ctime = look.toRemember().ctime;
      if (*hashed == *confirmed.content) return nullptr;
    }
    return take(upload, file, look);
  }

  /// What the store has refused for want of room is not copied there only to hear it again.
  [[nodiscard]] NSErrorRef askForRoom(const Upload& upload, std::uint64_t size) const {
    if (upload.subject.job.state != JobState::OverQuota) return nullptr;
    const auto& before = upload.subject.content;
    return store_->checkRoom(upload.subject.zone, size,
                             before && before->content ? before->content->size : 0);
  }

  NSErrorRef take(Upload& upload, int file, StampedLook look) {
    NSErrorRef error = askForRoom(upload, look.stamp.size);
    if (error) return error;
    if (!group_) group_ = store_->newGroup(&error);
    if (!group_) return error;
    const auto running = core_.queue->running(upload.subject.job.item);
    if (running) running->progress->setTotalUnitCount(static_cast<std::int64_t>(look.stamp.size));
    bool isSame = true;
    const auto goesOn = [&](std::uint64_t done) {
      if (running) running->progress->setCompletedUnitCount(static_cast<std::int64_t>(done));
      if (done < look.stamp.size && uploadReading.hit()) return false;
      isSame = lookAtStamp(file).stamp == look.stamp;  // or else all of it is for nothing
      return isSame && !core_.queue->isEnding();
    };
    for (int reading = 0; reading < kReadings; ++reading) {
      RZAsset content;
      error = store_->take(*group_, file, goesOn, content);
      if (error && isSame) return error;
      const StampedLook after = lookAtStamp(file);
      if (!error) bytes_ += content.size;
      if (!error && after.stamp == look.stamp && content.size == look.stamp.size) {
        upload.confirmed.content = content;
        upload.confirmed.stamp = look.toRemember();
        return uploadStaged.hit() ? NSError::errorWithErrno(EIO) : nullptr;
      }
      look = after;
    }
    return NSError::errorWithErrno(EAGAIN, upload.subject.path);  // somebody is writing to it
  }

  NSErrorRef commitAssets() {
    if (!group_) return nullptr;
    NSErrorRef error = store_->commit(*group_);
    if (!error && uploadSynced.hit()) error = NSError::errorWithErrno(EIO);
    return error;
  }

  void makeThumbnails() {
    ThumbnailMaker maker(core_, store_);
    std::vector<Upload*> candidates;
    std::vector<ThumbnailSubject> subjects;
    for (Upload& upload : uploads_) {
      const ContentRow& confirmed = upload.confirmed;
      if (upload.kind != Upload::Kind::Save || !confirmed.content) continue;
      if (!maker.isCandidate(confirmed.name, *confirmed.content)) continue;
      candidates.push_back(&upload);
      subjects.push_back({.name = confirmed.name, .content = *confirmed.content});
    }
    maker.make(subjects, core_.options.drawingPatience);
    for (std::size_t i = 0; i < candidates.size(); ++i)
      candidates[i]->thumbnail = std::move(subjects[i]);
  }

  /// Of a record that others may have changed.
  static std::string knownTag(const std::optional<ContentRow>& content) {
    return content && isSharedZone(content->zone) ? content->tag : std::string();
  }

  static StoredDocument documentOf(const Upload& upload) {
    const ContentRow& confirmed = upload.confirmed;
    const auto& share = upload.subject.share;
    const auto& before = upload.subject.content;
    StoredDocument document{.item = confirmed.id,
                            .zone = confirmed.zone,
                            .previousZone = upload.previousZone,
                            .parent = confirmed.parent,
                            .name = confirmed.name,
                            .mtime = confirmed.stamp.mtime,
                            .btime = upload.subject.row->btime,
                            .content = confirmed.content.value_or(RZAsset()),
                            .thumbnail = upload.thumbnail.thumbnail};
    document.isFolder = upload.subject.row->isFolder();
    if (document.isFolder) document.mtime = upload.subject.row->mtime;
    if (upload.previousZone) document.previousTag = knownTag(before);
    if (!share) return document;
    document.isPlacedByEach = !share->isOwn() && share->root == confirmed.id;
    if (before && before->zone == confirmed.zone) document.tag = before->tag;
    return document;
  }

  NSErrorRef saveRecords() {
    std::vector<StoredDocument> documents;
    std::vector<RemovedDocument> removed;
    std::vector<Upload*> saving;
    std::vector<Upload*> removing;
    for (Upload& upload : uploads_) {
      if (upload.kind == Upload::Kind::Remove) {
        removing.push_back(&upload);
        removed.push_back(
            {upload.subject.job.item, upload.confirmed.zone, knownTag(upload.subject.content)});
      } else if (upload.kind == Upload::Kind::Save) {
        saving.push_back(&upload);
        documents.push_back(documentOf(upload));
      }
    }
    std::vector<ContentStore::Saved> saved;
    std::vector<NSErrorRef> refused;
    if (NSErrorRef error = store_->remove(removed, refused)) return error;
    if (NSErrorRef error = store_->save(documents, saved)) return error;
    for (std::size_t i = 0; i < removing.size(); ++i) removing[i]->error = refused[i];
    for (std::size_t i = 0; i < saving.size(); ++i) {
      saving[i]->confirmed.tag = saved[i].tag;
      saving[i]->error = saved[i].error;
      saving[i]->isPreviousLeft = saved[i].isPreviousLeft;
      if (saved[i].error) saving[i]->kind = Upload::Kind::Failed;
    }
    return uploadCommitted.hit() ? NSError::errorWithErrno(EIO) : nullptr;
  }

  /// `failure` is of all that was to go to the store.
  void confirm(const NSErrorRef& failure) {
    const bool isAway = isOutOfReach(failure);
    const NSErrorRef error = core_.database().write([&](WriteTransaction& transaction) {
      for (Upload& upload : uploads_) {
        const bool isConcerned =
            upload.kind == Upload::Kind::Save || upload.kind == Upload::Kind::Remove;
        if (failure && isConcerned) upload.error = failure;
        store(transaction, upload);
      }
      return NSErrorRef();
    });
    // Not every change is told of: one through a map is not. Without a look the row would stay.
    for (const std::string& path : std::exchange(behind_, {}))
      (void)core_.scanner->scanLocation(path);
    if (error) log_error(defaultLog(), "[ERROR] uploads cannot be confirmed: %@", error);
    core_.noteStored(error);
    if (isAway) core_.noteOutOfReach();
    if (std::exchange(hasSettling_, false)) core_.queue->noteJobs(JobKind::Settle);
    if (std::exchange(hasThumbnails_, false)) core_.queue->noteJobs(JobKind::Thumbnail);
    (void)uploadConfirmed.hit();
  }

  void store(WriteTransaction& transaction, const Upload& upload) {
    Connection& connection = transaction.connection();
    const Job& job = upload.subject.job;
    if (isOutOfReach(upload.error)) return core_.noteOutOfReach();
    if (upload.error) {
      if (upload.error->is(NSCocoaErrorDomain, NSUserCancelledError)) return;  // we are ending
      noteRefused(upload);
      if (isContentGone(upload.error)) {
        if (upload.isFault) return giveUp(connection, upload);
        readAnewNextTime(connection, job.item);
      }
      return core_.postpone(connection, job, upload.error);
    }
    if (upload.kind != Upload::Kind::Nothing) core_.finished.fetch_add(1);
    removeJob(connection, job);
    removeSavings(connection, job.item);
    if (!upload.owner.empty())
      return leaveTo(connection, upload, accountKey(connection, upload.owner));
    if (upload.recordOwner) return leaveTo(connection, upload, *upload.recordOwner);
    if (upload.isToSettle && !findJob(connection, job.item, JobKind::Settle)) {
      addJob(connection, job.item, JobKind::Settle, job.account, core_.now(), core_.now());
      hasSettling_ = true;
    }
    if (!upload.subject.row) return storeRemoved(connection, job);
    if (upload.subject.row->isFolder()) return storeFolder(connection, upload);
    if (upload.subject.row->kind != ItemKind::Document || !upload.confirmed.content) return;
    noteThumbnail(connection, upload);
    if (!storeConfirmed(transaction, upload)) behind_.push_back(upload.subject.path);
  }

  /// A folder that came back meanwhile has no other job: its row is as it was.
  void storeRemoved(Connection& connection, const Job& job) const {
    removeContent(connection, job.item);
    const auto row = findByID(connection, job.item);
    if (!row) return;
    const auto account =
        row->isFolder() ? whoseFolderIsBehind(connection, *row) : std::optional(job.account);
    if (account) addJob(connection, job.item, JobKind::Upload, *account, core_.now(), core_.now());
  }

  /// Whether the record that made a save needless is gone, as was found out meanwhile: others have
  /// removed it, and what they removed is back.
  static bool isForgotten(const Upload& upload, const std::optional<ContentRow>& now) {
    return !now && upload.kind == Upload::Kind::Nothing;
  }

  /// Whether what others have saved since was taken over before this was confirmed: that counts.
  static bool isOvertaken(const Upload& upload, const std::optional<ContentRow>& now) {
    const auto& before = upload.subject.content;
    return now && isSharedZone(now->zone) && now->tag != upload.confirmed.tag &&
           (!before || now->tag != before->tag);
  }

  /// The store has lost what is confirmed there, and this disk still has it.
  static void readAnewNextTime(Connection& connection, std::uint64_t item) {
    auto content = findContent(connection, item);
    if (!content || !content->content) return;
    content->content.reset();
    storeContent(connection, *content);
  }

  /// A document without content whose content nobody has: trying again changes nothing.
  static void giveUp(Connection& connection, const Upload& upload) {
    Job job = upload.subject.job;
    ++job.attempts;
    job.state = JobState::Retrying;
    job.due = kNeverDue;
    job.error = NSError::errorWithDomain(
        NSCocoaErrorDomain, NSFileReadCorruptFileError,
        {{NSLocalizedDescriptionKey,
          "the content of \"" + upload.subject.row->name +
              "\" is neither here nor in the store any more; ask whoever shared it to share it "
              "again, then remove this one"},
         {NSUnderlyingErrorKey, upload.error}});
    updateJob(connection, job);
    log_error(defaultLog(), "[ERROR] given up: %@", job.error);
  }

  void noteRefused(const Upload& upload) const {
    const RZRecordZoneID& zone =
        upload.isPreviousLeft ? *upload.previousZone : upload.confirmed.zone;
    const bool isForbidden = rz_isError(upload.error, RZErrorPermissionFailure);
    const bool isChanged = rz_isError(upload.error, RZErrorServerRecordChanged) ||
                           rz_isError(upload.error, RZErrorUnknownItem) ||
                           rz_isError(upload.error, RZErrorZoneNotFound);
    if (isSharedZone(zone) && (isForbidden || isChanged))
      core_.noteRefused(upload.subject.job.item, zone, isForbidden);
  }

  void storeFolder(Connection& connection, const Upload& upload) const {
    if (upload.kind == Upload::Kind::Nothing) return;
    ContentRow folder;
    if (upload.kind == Upload::Kind::Save) folder = upload.confirmed;
    folder.id = upload.subject.job.item;
    folder.account = upload.subject.job.account;
    const auto now = findContent(connection, folder.id);
    folder.isPinned = now && now->isPinned;
    if (!isOvertaken(upload, now)) storeContent(connection, folder);
    const auto row = findByID(connection, folder.id);
    // Removed, renamed or moved meanwhile.
    const auto account = row ? whoseFolderIsBehind(connection, *row) : folder.account;
    if (account) addJob(connection, folder.id, JobKind::Upload, *account, core_.now(), core_.now());
  }

  void noteThumbnail(Connection& connection, const Upload& upload) {
    const ThumbnailSubject& made = upload.thumbnail;
    if (made.isNew) storeThumbnail(connection, {made.content, made.thumbnail});
    if (made.outcome == ThumbnailSubject::Outcome::None ||
        made.outcome == ThumbnailSubject::Outcome::Ready)
      return;
    addJob(connection, upload.subject.job.item, JobKind::Thumbnail, upload.subject.job.account,
           core_.now(), core_.now());
    hasThumbnails_ = true;
  }

  /// A copy of another account's fault, or its folder: nothing of ours.
  void leaveTo(Connection& connection, const Upload& upload, std::int64_t owner) const {
    const std::int64_t now = core_.now();
    addJob(connection, upload.subject.job.item, JobKind::Upload, owner, now, now);
  }

  /// False when the row is behind the disk.
  bool storeConfirmed(WriteTransaction& transaction, const Upload& upload) {
    Connection& connection = transaction.connection();
    ContentRow confirmed = upload.confirmed;
    const std::int64_t now = core_.now();
    const auto known = findContent(connection, confirmed.id);
    if (isForgotten(upload, known) || isOvertaken(upload, known)) {
      const std::int64_t account = known ? known->account : confirmed.account;
      addJob(connection, confirmed.id, JobKind::Upload, account, now, now);
      core_.queue->noteJobs(JobKind::Upload);
      return true;
    }
    if (known) confirmed.isPinned = known->isPinned;
    storeContent(connection, confirmed);
    const auto row = findByID(connection, confirmed.id);
    if (!row) {  // removed meanwhile
      addJob(connection, confirmed.id, JobKind::Upload, confirmed.account, now, now);
      return true;
    }
    // It came into a share, or out of one, while it was on its way.
    if (zoneOf(connection, row->id, confirmed.zone, confirmed.account) != confirmed.zone) {
      addJob(connection, confirmed.id, JobKind::Upload, confirmed.account, now, now);
      core_.queue->noteJobs(JobKind::Upload);
    }
    ItemRow after = *row;
    if (isConfirmed(after, confirmed)) after.flags |= row_flag::kUploaded;
    if (after.flags != row->flags) {
      (void)transaction.update(*row, after);
    } else if (!isConfirmed(after, confirmed) && after.inode == confirmed.stamp.inode) {
      // The row is behind the disk, or was changed meanwhile: to be seen to again.
      transaction.updateQuietly(after);
      return after.size == confirmed.stamp.size && after.mtime == confirmed.stamp.mtime;
    }
    return true;
  }

  ContentCore& core_;
  const std::shared_ptr<ContentStore> store_;
  std::unique_ptr<RZAssetGroup> group_;
  std::vector<Upload> uploads_;
  /// Documents that were read; closed from the fifth on.
  std::vector<FileDescriptor> unsynced_;
  std::vector<std::string> behind_;  ///< documents whose rows are
  std::uint64_t bytes_ = 0;
  bool hasSettling_ = false;
  bool hasThumbnails_ = false;
};

}  // namespace

void doUploads(ContentCore& core, const std::vector<Job>& jobs) {
  const auto store = jobs.empty() ? nullptr : core.storeOf(jobs.front().account);
  if (!store) return;  // signed out meanwhile
  std::vector<JobSubject> subjects;
  if (const NSErrorRef error = core.readSubjects(jobs, subjects)) {
    log_error(defaultLog(), "[ERROR] what is to be uploaded cannot be read: %@", error);
    core.noteStored(error);
    return;
  }
  UploadGroup group(core, store);
  for (JobSubject& subject : subjects) {
    if (core.queue->isEnding() || core.isOffline()) break;
    if (!subject.isStale) group.add(std::move(subject));
  }
  group.finish();
}

}  // namespace yomber
