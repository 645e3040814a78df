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

NSErrorRef rescuePartialWrite(const std::string& path, const FaultRecord& record,
                              std::string& rescued) {
  NSErrorRef error;
  ChangedFile file = ChangedFile::open(path, &error);
  if (!file.isValid()) return error;
  // Its writer may not have finished.
  const FileLease lease(file.get());
  if (!lease.isHeld()) return file.failure(EAGAIN);
  if (examineFault(file.get()).condition != FaultCondition::PartlyWritten) {
    return file.failure(EAGAIN);
  }
  const FileDescriptor copy = makeSibling(path, file.status().st_mode & 0777U, rescued);
  if (!copy) return file.failure(errno);
  int number = copyWritten(file.get(), copy.get(), file.status().st_size);
  if (number == 0 && fsync(copy.get()) != 0) number = errno;
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
  return error ? error : file.putDatesBack();
}

}  // namespace yomber
