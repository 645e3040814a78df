#include "zarn/content/content_core.h"

#include <sys/stat.h>

#include <algorithm>
#include <unordered_map>
#include <utility>

#include "platform/foundation/date.h"
#include "platform/foundation/log.h"
#include "platform/ostrell/constants.h"
#include "zarn/busy_files.h"
#include "zarn/change_times.h"
#include "zarn/row_queries.h"
#include "zarn/schema.h"
#include "zarn/write_transaction.h"

namespace yomber {
namespace {

constexpr std::int64_t kNanosecondsInMillisecond = 1'000'000;
constexpr std::chrono::milliseconds kTickOfForeignClocks{10};

ContentEngine::Options withClock(ContentEngine::Options options) {
  if (!options.clock) options.clock = [] { return NSDate::now().nanoseconds(); };
  return options;
}

/// Reads what jobs need to know; of each folder only once.
class SubjectReader {
 public:
  SubjectReader(const ItemStore& items, Connection& connection)
      : items_(items),
        connection_(connection),
        mayBePinned_(hasPins(connection)),
        isAnythingShared_(hasShares(connection)) {}

  JobSubject read(const Job& job) {
    if (std::exchange(account_, job.account) != job.account) folders_.clear();
    JobSubject subject;
    subject.job = job;
    const auto stored = findJob(connection_, job.item, job.kind);
    if (job.seq == 0 && stored) subject.job = *stored;
    subject.isStale = job.seq != 0 && (!stored || stored->seq != job.seq);
    subject.row = findByID(connection_, job.item);
    subject.content = findContent(connection_, job.item);
    if (subject.row) locate(subject);
    return subject;
  }

 private:
  struct Folder {
    std::string path;   ///< empty when it is gone
    ZoneSource source;  ///< of what is in it
    bool isInTrash = false;
    bool isPinned = false;
  };

  void locate(JobSubject& subject) {
    const ItemRow& row = *subject.row;
    const Folder& folder = folderOf(row.parent);
    if (row.isContainerFolder()) {
      subject.path = items_.layout().documents(row.extra->containerID);
      subject.zone = RZRecordZoneID(row.extra->containerID);
    } else {
      if (!folder.path.empty()) subject.path = folder.path + '/' + row.nameOnDisk();
      subject.zone = folder.source.zone;
      subject.share = folder.source.share;
    }
    const auto own = isAnythingShared_ ? findShare(connection_, row.id) : std::nullopt;
    if (own && givesItsZone(*own) && own->account == account_) {
      subject.zone = own->zone;
      subject.share = own;
    }
    const bool isKept = subject.content && !isSharedZone(subject.content->zone);
    if (subject.zone.zoneName().empty() && folder.isInTrash && isKept)
      subject.zone = subject.content->zone;
    if (subject.zone.zoneName().empty())
      subject.zone = RZRecordZoneID(QSUbiquitousDefaultContainerID);
    subject.isPinned = folder.isPinned || (subject.content && subject.content->isPinned);
  }

  const Folder& folderOf(std::uint64_t id) {
    const auto [found, isNew] = folders_.try_emplace(id);
    Folder& folder = found->second;
    const auto chain = isNew ? findChain(connection_, id) : std::nullopt;
    if (!chain) return folder;
    folder.path = items_.physicalPath(*chain);
    folder.isInTrash = chain->place == kTrashID;
    folder.isPinned = mayBePinned_ && isPinned(connection_, id);
    folder.source = findZoneSource(connection_, chain->rows, account_);
    return folder;
  }

  const ItemStore& items_;
  Connection& connection_;
  const bool mayBePinned_;
  const bool isAnythingShared_;
  std::int64_t account_ = 0;  ///< of the job that is read: no other's shares are its business
  std::unordered_map<std::uint64_t, Folder> folders_;
};

std::shared_ptr<JobQueue> makeQueue(const ItemStore& items, const ContentEngine::Options& given) {
  JobQueue::Options options;
  if (given.clock) options.tick = kTickOfForeignClocks;
  options.clock = withClock(given).clock;
  return std::make_shared<JobQueue>(items.database(), std::move(options));
}

}  // namespace

ContentCore::ContentCore(std::shared_ptr<ItemStore> itemStore, std::shared_ptr<Scanner> itemScanner,
                         ContentEngine::Options engineOptions)
    : items(std::move(itemStore)),
      scanner(std::move(itemScanner)),
      options(withClock(engineOptions)),
      queue(makeQueue(*items, engineOptions)),
      participant(std::make_shared<ContentParticipant>(
          queue, options.clock, std::chrono::nanoseconds(options.uploadPause).count())),
      drawer(options.drawer ? options.drawer : std::make_shared<DocumentDrawer>()) {
  // Jobs of changes that come while nobody is signed in are those of who was last.
  (void)database().read([&](Connection& connection) {
    queue->setAccount(metaInteger(connection, meta::kLastAccount));
  });
}

std::shared_ptr<ContentStore> ContentCore::store() const {
  LockGuard guard(mutex_);
  return store_;
}

std::string ContentCore::account() const {
  LockGuard guard(mutex_);
  return account_;
}

std::shared_ptr<ContentStore> ContentCore::storeOf(std::int64_t account) const {
  LockGuard guard(mutex_);
  return storeKey_ == account ? store_ : nullptr;
}

void ContentCore::setStore(std::shared_ptr<ContentStore> store, const std::string& account) {
  LockGuard signing(signingMutex_);
  const bool isSignedIn = store != nullptr;
  queue->setStoreOpen(false);
  isAccountStored_ = !isSignedIn || storeAccount(account);
  {
    LockGuard guard(mutex_);
    store_ = std::move(store);
    account_ = account;
    storeKey_ = isAccountStored_ ? queue->account() : kNoAccount;
  }
  isOffline_ = false;
  if (isSignedIn && isAccountStored_) probe();
}

bool ContentCore::storeAccount(const std::string& account) {
  const std::int64_t before = queue->account();
  std::int64_t key = 0;
  const NSErrorRef error = database().write([&](WriteTransaction& transaction) {
    Connection& connection = transaction.connection();
    key = accountKey(connection, account);
    claimForAccount(connection, key);
    setMetaInteger(connection, meta::kLastAccount, key);
    // Here, where jobs are made: one made for nobody after the claim would wait for ever.
    queue->setAccount(key);
    return NSErrorRef();
  });
  if (error) {
    log_error(defaultLog(), "[ERROR] jobs wait, for the account cannot be stored: %@", error);
  }
  queue->setAccount(error ? before : key);  // what it has read meanwhile was not committed
  return !error;
}

void ContentCore::storeAccountAgain() {
  LockGuard signing(signingMutex_);
  if (isAccountStored_) return;
  isAccountStored_ = storeAccount(account());
  if (!isAccountStored_) return;
  {
    LockGuard guard(mutex_);
    storeKey_ = queue->account();
  }
  probe();
}

void ContentCore::noteOutOfReach() {
  if (isOffline_.exchange(true)) return;
  log_default(defaultLog(), "[NOTICE] the store is out of reach; jobs wait until it is back");
  queue->setStoreOpen(false);
}

void ContentCore::probe() {
  const auto current = store();
  if (!current) return;
  if (current->checkReachability()) return noteOutOfReach();
  if (isOffline_.exchange(false)) log_default(defaultLog(), "[NOTICE] the store is back");
  queue->setStoreOpen(true);
}

NSErrorRef ContentCore::readSubjects(const std::vector<Job>& jobs,
                                     std::vector<JobSubject>& subjects) const {
  subjects.clear();
  return database().read([&](Connection& connection) {
    const ReadTransaction transaction(connection);
    SubjectReader reader(*items, connection);
    for (const Job& job : jobs) subjects.push_back(reader.read(job));
  });
}

std::int64_t ContentCore::nextAttempt(std::uint32_t attempts) const {
  constexpr std::uint32_t kDoublings = 20;
  const std::int64_t first = options.firstPause.count();
  const std::int64_t pause = first << std::min(attempts > 0 ? attempts - 1 : 0, kDoublings);
  return now() +
         std::min<std::int64_t>(pause, options.longestPause.count()) * kNanosecondsInMillisecond;
}

void ContentCore::postpone(Connection& connection, Job job, const NSErrorRef& error) const {
  ++job.attempts;
  job.state = isOverQuota(error) ? JobState::OverQuota : JobState::Retrying;
  job.due = nextAttempt(job.attempts);
  job.error = error;
  updateJob(connection, job);
}

void ContentCore::noteRefused(std::uint64_t item, const RZRecordZoneID& zone, bool isForbidden) {
  {
    LockGuard guard(mutex_);
    (isForbidden ? refused_.forbidden : refused_.changed)[zone].insert(item);
  }
  if (didRefuse) didRefuse();
}

ContentCore::Refused ContentCore::takeRefused() {
  LockGuard guard(mutex_);
  return std::exchange(refused_, {});
}

NSErrorRef ContentCore::settleWritten(const std::string& path, const FaultExamination& found) {
  NSErrorRef error;
  if (found.condition == FaultCondition::Rewritten) {
    FileStamp before;
    FileStamp after;
    error = removeFaultMarks(path, found.stamp.inode, before, after);
  } else if (found.condition == FaultCondition::PartlyWritten ||
             found.condition == FaultCondition::Mixed) {
    FileDescriptor content;
    const auto ours = store();
    if (ours) error = ours->open(found.record.content, content);
    // What is not there will not come: then what was written counts more than the head.
    if (error && isOutOfReach(error)) return error;
    const std::string head = content ? readHead(content.get()) : "";
    std::string rescued;
    error = rescuePartialWrite(path, found.condition, found.record, head, rescued);
    if (!error) (void)scanner->scanLocation(rescued, &error);
  } else if (found.condition == FaultCondition::Damaged) {
    return NSError::errorWithDomain(
        NSCocoaErrorDomain, NSFileReadCorruptFileError,
        {{NSLocalizedDescriptionKey,
          std::string("The file's mark cannot be understood; remove the file, or put another in "
                      "its place.")},
         {NSFilePathErrorKey, path}});
  }
  if (!error) (void)scanner->scanLocation(path, &error);
  return error;
}

void ContentCore::lookAgain(const JobSubject& subject, const FileStamp& stored) const {
  const std::string& path = subject.path;
  if (path.empty()) return;
  struct stat status{};
  const bool isSame = lstat(path.c_str(), &status) == 0 && FileStamp::of(status) == stored;
  const bool isDescribed =
      subject.row && isDescribedBy(*subject.row, readItemAttributes(path.c_str()));
  if (isSame && isDescribed) return;
  if (isSame && subject.row) forgetChangeTime(subject.row->id);
  (void)scanner->scanLocation(path);
}

void ContentCore::forgetChangeTime(std::uint64_t item) const {
  (void)items->database()->write([item](WriteTransaction& transaction) {
    if (auto row = findByID(transaction.connection(), item)) {
      --row->ctime;
      transaction.updateQuietly(*row);
    }
    return NSErrorRef();
  });
}

BusyFile::BusyFile(const ContentCore& core, std::uint64_t inode)
    : database_(core.items->database()), inode_(inode) {
  database_->busyFiles().add(inode_);
}

BusyFile::BusyFile(BusyFile&& other) noexcept
    : database_(other.database_), inode_(std::exchange(other.inode_, 0)) {}

BusyFile::~BusyFile() {
  if (inode_ != 0) database_->busyFiles().remove(inode_);
}

bool storeLocalState(WriteTransaction& transaction, std::uint64_t item, const FileStamp& before,
                     const FileStamp& after, LocalContent local) {
  Connection& connection = transaction.connection();
  auto content = findContent(connection, item);
  const bool isKnown = local != LocalContent::Unread || (content && content->stamp == before);
  if (isKnown && content && content->stamp.hasSameContent(after)) {
    content->stamp.ctime = after.ctime;
    storeContent(connection, *content);
  }
  const auto row = findByID(connection, item);
  if (!row || row->inode != before.inode) return true;
  const bool isSeen = isKnown || row->ctime == before.ctime;
  ItemRow changed = *row;
  changed.flags = local == LocalContent::Away ? changed.flags & ~row_flag::kDownloaded
                                              : changed.flags | row_flag::kDownloaded;
  if (isSeen) {
    changed.size = after.size;
    changed.mtime = after.mtime;
    changed.ctime = after.ctime;
  }
  const bool isShownSame =
      changed.flags == row->flags && changed.size == row->size && changed.mtime == row->mtime;
  if (!isShownSame) {
    (void)transaction.update(*row, changed);
  } else if (changed.ctime != row->ctime) {
    transaction.updateQuietly(changed);
  }
  return isSeen;
}

}  // namespace yomber
