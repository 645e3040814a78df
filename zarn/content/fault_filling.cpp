// Filling faults in their places.
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>

#include "platform/foundation/fault_attributes.h"
#include "platform/foundation/fault_points.h"
#include "zarn/content/fault_file.h"

namespace yomber {
namespace {

using Clock = std::chrono::steady_clock;

FaultPoint fillBegun("zarn.fill.begun");
FaultPoint fillCopying("zarn.fill.copying");
FaultPoint fillWaited("zarn.fill.waited");
FaultPoint fillVerified("zarn.fill.verified");
FaultPoint fillDated("zarn.fill.dated");
FaultPoint fillFilled("zarn.fill.filled");

NSErrorRef cancellation() {
  return NSError::errorWithDomain(NSCocoaErrorDomain, NSUserCancelledError);
}

/// What is around one filling.
class Filling {
 public:
  Filling(ChangedFile file, const FaultExamination& found, const FaultSource& source)
      : file_(std::move(file)),
        record_(found.record),
        examined_(found.stamp),
        isInterrupted_(found.isInterrupted),
        source_(source),
        lease_(file_.get()) {}

  NSErrorRef run(const std::function<bool(std::uint64_t)>& goesOn, bool& isMixed) {
    isAlone_ = lease_.isHeld();
    lastHeld_ = Clock::now();
    // Written to before others were kept out.
    if (stampOf(file_.get()) != examined_) return file_.failure(EAGAIN);
    if (isInterrupted_) {
      if (NSErrorRef error = compare(isMixed)) return error;
    }
    const std::string head = readHead(file_.get());
    NSErrorRef error = file_.holdDate();
    // What an earlier filling may have left would show where the content has holes.
    if (!error) error = file_.punch();
    if (!error) error = file_.removeAttribute(kFilledAttribute);
    if (!error && fillBegun.hit()) error = file_.failure(ENOSPC);
    if (!error) error = copy(goesOn);
    if (!error) error = verify();
    if (!error && fillVerified.hit()) error = file_.failure(EIO);
    if (!error) error = markFilled();
    if (error && mayTakeBack()) {
      (void)file_.punch();
      (void)file_.writeHead(head);
      (void)file_.putDatesBack();
    }
    return isGivenUp_ ? openElsewhereError(file_.path()) : error;
  }

 private:
  /// What an earlier filling or giving up left, and what somebody wrote since, look the same until
  /// they are compared.
  NSErrorRef compare(bool& isMixed) {
    FileDescriptor content;
    if (NSErrorRef error = source_.open(record_, content)) return error;
    isMixed = hasForeignBytes(file_.get(), record_, content.get());
    return isMixed ? file_.failure(EAGAIN) : nullptr;
  }

  NSErrorRef copy(const std::function<bool(std::uint64_t)>& goesOn) {
    const auto watch = [&](std::uint64_t done) {
      if (fillCopying.hit()) return false;
      if (isAlone_ && !keepsOthersOut()) return false;
      // A writer may take it for his own: it is no fault any more, or has another size.
      if (!isAlone_ && !isStillTheFault()) mayBeWritten_ = true;
      // Blocks where we have not been: somebody else's.
      if (!isAlone_ && !mayBeWritten_ && done < record_.content.size && done > kKeptBytes) {
        mayBeWritten_ = hasDataFrom(file_.get(), done);
      }
      return !mayBeWritten_ && (!goesOn || goesOn(done));
    };
    return source_.copy(record_, file_.get(), watch);
  }

  [[nodiscard]] bool isStillTheFault() const {
    return stampOf(file_.get()).size == record_.content.size &&
           fgetxattr(file_.get(), kFaultAttribute, nullptr, 0) >= 0;
  }

  /// Who wants the file waits for its content, as long as the system lets them. False: a writer
  /// is to get it as it was.
  bool keepsOthersOut() {
    const FileLease::State state = lease_.state();
    const auto now = Clock::now();
    if (state == FileLease::State::Held) {
      lastHeld_ = now;
      return true;
    }
    const auto longest = FileLease::longestWait();
    const bool isOver = fillWaited.hit() || now - lastHeld_ > longest * 3 / 4;
    if (!isOver) return true;
    if (state == FileLease::State::WantedToRead) {
      isAlone_ = false;
      lease_.release();
      return true;
    }
    isGivenUp_ = true;
    // The system may have lost its patience before we asked.
    mayBeWritten_ = now - lastHeld_ >= longest;
    return false;
  }

  /// Whether others were kept out to this moment.
  [[nodiscard]] bool wasAlone() const {
    const bool isLost = lease_.state() == FileLease::State::Lost &&
                        Clock::now() - lastHeld_ >= FileLease::longestWait();
    return isAlone_ && !isLost;
  }

  /// Else the held date stays, and the next filling compares what it finds.
  [[nodiscard]] bool mayTakeBack() const { return !mayBeWritten_ && wasAlone(); }

  /// Blocks of zeros are not written: what was there before would stay.
  [[nodiscard]] bool hasOurHead() const {
    return record_.content.size <= kKeptBytes ||
           headChecksum(readHead(file_.get())) == record_.head;
  }

  /// The content itself is verified as it is written; what others wrote is not.
  NSErrorRef verify() {
    isAlone_ = wasAlone();
    const bool isWhole = stampOf(file_.get()).size == record_.content.size && hasOurHead() &&
                         (isAlone_ || hasContentOf(file_.get(), record_));
    if (isWhole) return nullptr;
    mayBeWritten_ = true;
    return file_.failure(EAGAIN);
  }

  NSErrorRef markFilled() {
    if (NSErrorRef error = file_.putDatesBack()) return error;
    if (fillDated.hit()) return file_.failure(EIO);
    if (NSErrorRef error = file_.setAttribute(kFilledAttribute, bootIdentifier())) return error;
    (void)fillFilled.hit();
    return nullptr;
  }

  ChangedFile file_;
  const FaultRecord record_;
  const FileStamp examined_;
  const bool isInterrupted_;
  const FaultSource& source_;
  FileLease lease_;
  bool isAlone_ = false;
  Clock::time_point lastHeld_;
  bool isGivenUp_ = false;     ///< for a writer who waits
  bool mayBeWritten_ = false;  ///< by somebody else: nothing of it may be taken back
};

/// A small fault has kept all its content, which only needs to be verified. False, with nothing
/// done, where that is not all.
bool fillSmallFault(const std::string& path, const std::function<bool(std::uint64_t)>& goesOn,
                    FileStamp& after, NSErrorRef& error) {
  constexpr int kOpening = O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC | O_NOCTTY;
  const FileDescriptor file(open(path.c_str(), kOpening));
  struct stat status{};
  const bool isSmall = file && fstat(file.get(), &status) == 0 && S_ISREG(status.st_mode) &&
                       status.st_size <= static_cast<off_t>(kKeptBytes);
  if (!isSmall) return false;
  const FaultExamination found = examineFault(file.get());
  if (found.condition != FaultCondition::Pristine) return false;
  if (goesOn && !goesOn(0)) {
    error = cancellation();
    return true;
  }
  if (!hasContentOf(file.get(), found.record)) return false;
  if (fillVerified.hit()) {
    error = NSError::errorWithErrno(EIO, path);
    return true;
  }
  const std::string& boot = bootIdentifier();
  if (fsetxattr(file.get(), kFilledAttribute, boot.data(), boot.size(), 0) != 0) return false;
  (void)fillFilled.hit();
  after = stampOf(file.get());
  return true;
}

}  // namespace

NSErrorRef fillFault(const std::string& path, const FaultSource& source,
                     const std::function<bool(std::uint64_t)>& goesOn, FillOutcome& outcome) {
  outcome = {};
  NSErrorRef error;
  if (fillSmallFault(path, goesOn, outcome.after, error)) return error;
  const bool isWritten = isOpenForWriting(path);
  ChangedFile file = ChangedFile::open(path, &error);
  if (!file.isValid()) return error;
  const int descriptor = file.get();
  const FaultExamination found = examineFault(descriptor);
  if (found.condition == FaultCondition::NoFault) {
    outcome.after = found.stamp;
    outcome.wasHere = true;
    return nullptr;
  }
  if (found.condition != FaultCondition::Pristine) return file.failure(EAGAIN);
  if (goesOn && !goesOn(0)) return cancellation();
  if (found.stamp.size <= kKeptBytes && hasContentOf(descriptor, found.record)) {
    if (fillVerified.hit()) return file.failure(EIO);
    error = file.setAttribute(kFilledAttribute, bootIdentifier());
    (void)fillFilled.hit();
    if (!error) outcome.after = stampOf(descriptor);
    return error;
  }
  if (isWritten) return openElsewhereError(path);
  const FileDescriptor same(fcntl(descriptor, F_DUPFD_CLOEXEC, 0));
  error = Filling(std::move(file), found, source).run(goesOn, outcome.isMixed);
  outcome.after = stampOf(same.get());
  return error;
}

}  // namespace yomber
