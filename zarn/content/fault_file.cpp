#include "zarn/content/fault_file.h"

#include <fcntl.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <string_view>

#include "platform/foundation/descriptor_path.h"
#include "platform/foundation/fault_attributes.h"
#include "platform/foundation/fault_points.h"
#include "platform/ostrell/constants.h"
#include "platform/rozzel/hashed_copy.h"
#include "zarn/lent_mode.h"

namespace yomber {
namespace {

FaultPoint evictLeased("zarn.evict.leased");
FaultPoint evictRecorded("zarn.evict.recorded");
FaultPoint evictMarked("zarn.evict.marked");
FaultPoint evictSynced("zarn.evict.synced");
FaultPoint evictPunched("zarn.evict.punched");
FaultPoint settleUnmarked("zarn.settle.unmarked");

NSErrorRef refusal(const std::string& reason) {
  return NSError::errorWithDomain(QSOstrellErrorDomain, QSOstrellErrorCannotEvict,
                                  {{NSLocalizedDescriptionKey, reason}});
}

}  // namespace

std::string readHead(int file) {
  std::string head(kKeptBytes, '\0');
  const ssize_t length = pread(file, head.data(), head.size(), 0);
  head.resize(length > 0 ? static_cast<std::size_t>(length) : 0);
  return head;
}

bool hasContentOf(int file, const FaultRecord& record) {
  RZAsset found;
  return !rz_hashFile(file, {}, found) && found == record.content;
}

// Giving up.

std::unique_ptr<Eviction> Eviction::begin(const std::string& path, const FileStamp& expected,
                                          const FaultRecord& record, NSErrorRef* error) {
  ChangedFile file = ChangedFile::open(path, error);
  if (!file.isValid()) return nullptr;
  std::unique_ptr<Eviction> result(new Eviction(std::move(file)));
  if (!result->lease_.isHeld()) {
    storeError(error, refusal("it is open somewhere"));
    return nullptr;
  }
  const ChangedFile& opened = result->file_;
  result->wasFault_ = isFault(opened.get());
  if (!result->wasFault_ && FileStamp::of(opened.status()) != expected) {
    storeError(error, refusal("it has changed since it was confirmed in the store"));
    return nullptr;
  }
  if (evictLeased.hit()) {
    storeError(error, opened.failure(EIO));
    return nullptr;
  }
  if (NSErrorRef failure = result->mark(record)) {
    storeError(error, std::move(failure));
    return nullptr;
  }
  return result;
}

NSErrorRef Eviction::mark(FaultRecord record) {
  if (file_.status().st_size > static_cast<off_t>(kKeptBytes)) {
    if (NSErrorRef error = file_.holdDate()) return error;
    record.head = headChecksum(readHead(file_.get()));
  }
  isMarked_ = true;
  // While an old fill of this boot counts, the new record changes nothing; the old one never counts
  // for this content.
  if (!wasFault_) {
    if (NSErrorRef error = file_.setAttribute(kFaultAttribute, record.encoded())) return error;
    if (evictRecorded.hit()) return file_.failure(EIO);
  }
  if (NSErrorRef error = file_.removeAttribute(kFilledAttribute)) return error;
  marked_ = stampOf(file_.get());
  return evictMarked.hit() ? file_.failure(ENOSPC) : nullptr;
}

NSErrorRef Eviction::sync() const { return file_.sync(); }

NSErrorRef Eviction::finish(FileStamp& after) {
  if (evictSynced.hit()) return file_.failure(EIO);
  // Who waits for the lease gets the file with its content; the mark goes when we do.
  if (!lease_.isHeld()) return refusal("it was opened meanwhile");
  if (stampOf(file_.get()) != marked_) return refusal("it has changed meanwhile");
  isMarked_ = false;
  if (NSErrorRef error = file_.punch()) return error;
  (void)evictPunched.hit();
  if (file_.status().st_size > static_cast<off_t>(kKeptBytes)) {
    if (NSErrorRef error = file_.putDatesBack()) return error;
  }
  after = stampOf(file_.get());
  return nullptr;
}

Eviction::~Eviction() {
  if (!isMarked_ || wasFault_) return;
  (void)file_.removeAttribute(kFaultAttribute);
  (void)file_.removeAttribute(kHeldDateAttribute);
}

// Looking.

namespace {

bool wasFilled(int file) { return fgetxattr(file, kFilledAttribute, nullptr, 0) >= 0; }

/// `record` is of a larger file than what is kept.
FaultCondition conditionOfLarge(int file, FaultExamination& found) {
  const FileStamp& stamp = found.stamp;
  const bool hasHole = hasHoleFrom(file, kKeptBytes, stamp.size);
  if (stamp.size == found.record.content.size) {
    const bool isTouched =
        hasDataFrom(file, kKeptBytes) || headChecksum(readHead(file)) != found.record.head;
    const bool hasOurDate = stamp.mtime == found.record.mtime;
    // Whoever writes may put the date back. What an earlier boot has filled may not have come to
    // the disk: that is nobody's writing.
    found.isInterrupted = heldDate(file) || (isTouched && hasOurDate && !wasFilled(file));
    if (found.isInterrupted || !isTouched || hasOurDate) return FaultCondition::Pristine;
  }
  return hasHole ? FaultCondition::PartlyWritten : FaultCondition::Rewritten;
}

FaultCondition conditionOfSmall(int file, const FaultExamination& found) {
  const bool isSame =
      found.stamp.size == found.record.content.size && hasContentOf(file, found.record);
  return isSame ? FaultCondition::Pristine : FaultCondition::Rewritten;
}

}  // namespace

FaultExamination examineFault(int file) {
  FaultExamination result;
  result.stamp = stampOf(file);
  bool isDamaged = false;
  const auto record = readFaultRecord(file, isDamaged);
  if ((!record && !isDamaged) || !isFault(file)) return result;
  if (!record) {
    result.condition = FaultCondition::Damaged;
    return result;
  }
  result.record = *record;
  result.condition = record->content.size > kKeptBytes ? conditionOfLarge(file, result)
                                                       : conditionOfSmall(file, result);
  return result;
}

NSErrorRef removeFaultMarks(const std::string& path, std::uint64_t inode, FileStamp& before,
                            FileStamp& after) {
  // Not opened for reading or writing: that would keep others from leasing it.
  const FileDescriptor file(open(path.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
  struct stat status{};
  if (!file || fstat(file.get(), &status) != 0) return NSError::errorWithErrno(errno, path);
  if (status.st_ino != inode) return NSError::errorWithErrno(ESTALE, path);
  before = FileStamp::of(status);
  const std::string self = pathOfDescriptor(file.get());
  // The fault first: without it the others mean nothing.
  for (const char* name : {kFaultAttribute, kFilledAttribute, kHeldDateAttribute}) {
    const int number = withWritePermission(file.get(), [&] {
      return removexattr(self.c_str(), name) == 0 || errno == ENODATA ? 0 : errno;
    });
    if (number != 0) return NSError::errorWithErrno(number, path);
    if (settleUnmarked.hit()) return NSError::errorWithErrno(EIO, path);
  }
  after = stampOf(file.get());
  return nullptr;
}

std::optional<RZAsset> hashUnchanged(int file, const FileStamp& stamp, NSErrorRef* error) {
  RZAsset result;
  NSErrorRef failure = stampOf(file) == stamp ? nullptr : NSError::errorWithErrno(EAGAIN);
  if (!failure) failure = rz_hashFile(file, {}, result);
  if (!failure && stampOf(file) != stamp) failure = NSError::errorWithErrno(EAGAIN);
  if (!failure) return result;
  storeError(error, std::move(failure));
  return std::nullopt;
}

}  // namespace yomber
