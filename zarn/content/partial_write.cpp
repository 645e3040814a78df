// What somebody wrote into a fault, brought to a file of its own.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <vector>

#include "platform/foundation/bounced_name.h"
#include "platform/foundation/log.h"
#include "zarn/content/fault_file.h"

namespace yomber {
namespace {

constexpr std::size_t kPiece = 1 << 20;

int copyRange(int from, int to, off_t begin, off_t end) {
  std::vector<char> buffer(kPiece);
  while (begin < end) {
    const auto length = std::min<std::size_t>(buffer.size(), static_cast<std::size_t>(end - begin));
    const ssize_t got = pread(from, buffer.data(), length, begin);
    if (got < 0) return errno;
    if (got == 0) return 0;
    if (pwrite(to, buffer.data(), static_cast<std::size_t>(got), begin) != got) {
      return errno != 0 ? errno : EIO;
    }
    begin += got;
  }
  return 0;
}

/// Holes stay holes.
int copyWritten(int from, int to, off_t size) {
  if (ftruncate(to, size) != 0) return errno;
  for (off_t at = 0; at < size;) {
    const off_t data = lseek(from, at, SEEK_DATA);
    if (data < 0) return errno == ENXIO ? 0 : errno;
    const off_t hole = lseek(from, data, SEEK_HOLE);
    if (hole < 0) return errno;
    if (const int number = copyRange(from, to, data, std::min(hole, size))) return number;
    at = hole;
  }
  return 0;
}

bool isSameRange(int left, int right, off_t begin, off_t end) {
  std::vector<char> ours(kPiece);
  std::vector<char> theirs(kPiece);
  while (begin < end) {
    const auto length = std::min<std::size_t>(kPiece, static_cast<std::size_t>(end - begin));
    const ssize_t got = pread(left, ours.data(), length, begin);
    if (got <= 0 || pread(right, theirs.data(), static_cast<std::size_t>(got), begin) != got) {
      return false;
    }
    if (!std::equal(ours.begin(), ours.begin() + got, theirs.begin())) return false;
    begin += got;
  }
  return true;
}

bool syncFolderOf(const std::string& path) {
  const std::string folder = path.substr(0, path.rfind('/') + 1);
  const FileDescriptor opened(open(folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  return opened && fsync(opened.get()) == 0;
}

FileDescriptor makeSibling(const std::string& path, mode_t mode, std::string& made) {
  const std::size_t slash = path.rfind('/');
  const std::string folder = path.substr(0, slash + 1);
  FileDescriptor file;
  // The original's own name is taken too; races are decided by the exclusive creation.
  (void)bouncedName(path.substr(slash + 1), [&](const std::string& name) {
    made = folder + name;
    file = FileDescriptor(open(made.c_str(), O_RDWR | O_CREAT | O_EXCL | O_CLOEXEC, mode));
    return !file && errno == EEXIST;
  });
  return file;
}

}  // namespace

NSErrorRef openElsewhereError(const std::string& path) {
  return NSError::errorWithDomain(
      NSPOSIXErrorDomain, EBUSY,
      {{NSFilePathErrorKey, path},
       {NSLocalizedDescriptionKey,
        std::string("it is open for writing in another program, without its content; close it "
                    "there, then try again")}});
}

bool hasForeignBytes(int file, const FaultRecord& record, int content) {
  const std::string head = readHead(file);
  if (headChecksum(head) != record.head) return true;
  struct stat status{};
  if (fstat(file, &status) != 0) return true;
  for (off_t at = kKeptBytes; at < status.st_size;) {
    const off_t data = lseek(file, at, SEEK_DATA);
    if (data < 0) return errno != ENXIO;
    const off_t hole = lseek(file, data, SEEK_HOLE);
    if (hole < 0 || !isSameRange(file, content, data, std::min(hole, status.st_size))) return true;
    at = hole;
  }
  return false;
}

NSErrorRef rescuePartialWrite(const std::string& path, FaultCondition condition,
                              const FaultRecord& record, const std::string& head,
                              std::string& rescued) {
  NSErrorRef error;
  ChangedFile file = ChangedFile::open(path, &error);
  if (!file.isValid()) return error;
  // Its writer may not have finished.
  const FileLease lease(file.get());
  if (lease.state() != FileLease::State::Held) return openElsewhereError(path);
  const FaultExamination found = examineFault(file.get());
  const bool isStillSo = condition == FaultCondition::Mixed
                             ? found.condition == FaultCondition::Pristine && found.isInterrupted
                             : found.condition == condition;
  if (!isStillSo) return file.failure(EAGAIN);
  const FileDescriptor copy = makeSibling(path, file.status().st_mode & 0777U, rescued);
  if (!copy) return file.failure(errno);
  int number = copyWritten(file.get(), copy.get(), file.status().st_size);
  if (number == 0 && fsync(copy.get()) != 0) number = errno;
  if (number == 0 && !syncFolderOf(rescued)) number = errno;
  // Nobody has got in meanwhile: what follows takes away what they would have written.
  if (number == 0 && lease.state() == FileLease::State::Lost) number = EAGAIN;
  if (number != 0) {
    unlink(rescued.c_str());
    return file.failure(number);
  }
  log_default(defaultLog(),
              "[NOTICE] %@ was written to while its content was away; what was written is in %@",
              path, rescued);
  error = file.setAttribute(kHeldDateAttribute, std::to_string(record.mtime));
  if (!error) error = file.holdDate();
  if (!error && ftruncate(file.get(), static_cast<off_t>(record.content.size)) != 0) {
    error = file.failure(errno);
  }
  if (!error) error = file.punch();
  // Other bytes would be neither the content nor anybody's.
  if (!error && headChecksum(head) == record.head) error = file.writeHead(head);
  return error ? error : file.putDatesBack();
}

}  // namespace yomber
