#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <utility>

#include "platform/foundation/error.h"
#include "zarn/content/changed_file.h"
#include "zarn/content/fault_record.h"
#include "zarn/content/file_lease.h"

namespace yomber {

/// A file whose content is being given up, in three steps, so that the sync in the middle can be
/// shared by many files.
///
///   1. `begin` opens the file, makes sure that it is the one meant and that nobody has it open,
///   and
///      marks it as a fault.
///   2. The caller makes the marks durable, with `sync` or by syncing the file system.
///   3. `finish` gives up the blocks. Size, dates, mode, attributes and inode stay.
///
/// Before the third step the content is still all there: an object that is dropped earlier takes
/// the mark back. A process that ends in between leaves a fault; `begin` on it goes on from there.
///
/// For one thread at a time.
class Eviction {
 public:
  /// Fails with QSOstrellErrorDomain 6 and the reason when the file is open, or not as `expected`
  /// (every part of it counts); with the system's error otherwise.
  static std::unique_ptr<Eviction> begin(const std::string& path, const FileStamp& expected,
                                         const FaultRecord& record, NSErrorRef* error);
  ~Eviction();
  Eviction(const Eviction&) = delete;
  Eviction& operator=(const Eviction&) = delete;

  [[nodiscard]] NSErrorRef sync() const;
  /// `after` is what the file is then.
  [[nodiscard]] NSErrorRef finish(FileStamp& after);

 private:
  explicit Eviction(ChangedFile file) : file_(std::move(file)), lease_(file_.get()) {}
  NSErrorRef mark(FaultRecord record);

  ChangedFile file_;
  FileLease lease_;
  FileStamp marked_;       ///< as it was after it was marked
  bool wasFault_ = false;  ///< an earlier process marked it
  bool isMarked_ = false;
};

/// What is found at the place of a fault.
enum class FaultCondition {
  NoFault,        ///< the content is here, or there is no mark
  Pristine,       ///< as we left it, or left it half-way; its date or its name may be others
  Mixed,          ///< we left it half-way, and somebody wrote into it since; see `hasForeignBytes`
  Rewritten,      ///< somebody has written all there is: their content counts
  PartlyWritten,  ///< somebody has written into it: their bytes stand between holes
  Damaged,        ///< its mark cannot be understood
};

struct FaultExamination {
  FaultCondition condition = FaultCondition::NoFault;
  FaultRecord record;
  FileStamp stamp;
  /// Left half-way while it was filled or given up, or written to by somebody who put the date
  /// back: what is in it is to be compared.
  bool isInterrupted = false;
};
/// Looks at an open file. Never answers Mixed.
[[nodiscard]] FaultExamination examineFault(int file);

/// Takes the marks off a file that somebody has rewritten, or whose content is known to be whole
/// and on the disk, provided that it still has that inode. `before` and `after` are what it was and
/// is then.
[[nodiscard]] NSErrorRef removeFaultMarks(const std::string& path, std::uint64_t inode,
                                          FileStamp& before, FileStamp& after);

/// Brings what somebody wrote into a fault (`condition` PartlyWritten or Mixed) to a new file next
/// to it, and makes the fault what it was before; `head` are the bytes that it kept, as the store
/// has them. Answers where the new file is. EBUSY while anybody has the fault open.
[[nodiscard]] NSErrorRef rescuePartialWrite(const std::string& path, FaultCondition condition,
                                            const FaultRecord& record, const std::string& head,
                                            std::string& rescued);

/// Whether an interrupted fault, open as `file`, holds any byte that is not the content's, open as
/// `content`. An error of reading counts as one.
[[nodiscard]] bool hasForeignBytes(int file, const FaultRecord& record, int content);

/// NSPOSIXErrorDomain EBUSY: it is open in another program.
[[nodiscard]] NSErrorRef openElsewhereError(const std::string& path);

/// The bytes that a fault keeps.
[[nodiscard]] std::string readHead(int file);
/// Hashes the whole file.
[[nodiscard]] bool hasContentOf(int file, const FaultRecord& record);

/// Where a fault's content comes from.
struct FaultSource {
  /// Writes the content into an open file at the same offsets, and fails unless it is verified to
  /// be that of the record. Calls `goesOn` about once a MiB with the bytes done, and gives up with
  /// NSCocoaErrorDomain 3072 when that answers false.
  std::function<NSErrorRef(const FaultRecord& record, int file,
                           const std::function<bool(std::uint64_t)>& goesOn)>
      copy;
  /// A descriptor of the content, not verified.
  std::function<NSErrorRef(const FaultRecord& record, FileDescriptor& content)> open;
};

/// What came of a filling.
struct FillOutcome {
  FileStamp after;       ///< what the file is then
  bool isMixed = false;  ///< see below
  bool wasHere = false;  ///< there was nothing to fill, and what is there was not looked at
};

/// Fills a fault in its place. Its content can be read from then on, in this boot of the machine;
/// once it was synced, `removeFaultMarks` makes it an ordinary file. A file whose content is here
/// already is a success. Fails leaving a fault.
///
/// Nobody's writing is lost, and nothing that is mixed with it is marked as filled:
///   - While somebody has it open for writing it is refused, with NSPOSIXErrorDomain EBUSY.
///   - Who opens it meanwhile waits for the content; a writer for whom the system would not let us
///     wait any longer gets the fault as it was, and the filling fails with EBUSY.
///   - Where somebody had it open for reading only, others may come to write: blocks that appear
///     where we have not been, and the hash at the end, tell. Then, as after an interruption,
///     nothing is taken back, and the next filling compares what it finds: with `isMixed` set and
///     EAGAIN when it is not all the content's.
[[nodiscard]] NSErrorRef fillFault(const std::string& path, const FaultSource& source,
                                   const std::function<bool(std::uint64_t)>& goesOn,
                                   FillOutcome& outcome);

/// The SHA-256 and size of an open file, provided that it does not change meanwhile; nothing with
/// an error (EAGAIN when it does).
[[nodiscard]] std::optional<RZAsset> hashUnchanged(int file, const FileStamp& stamp,
                                                   NSErrorRef* error);

}  // namespace yomber
