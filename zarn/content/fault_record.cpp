#include "zarn/content/fault_record.h"

#include <sys/stat.h>
#include <sys/xattr.h>

#include <algorithm>
#include <array>
#include <cerrno>

#include "platform/foundation/fault_attributes.h"
#include "platform/foundation/file_time.h"
#include "zarn/change_times.h"

namespace yomber {
namespace {

constexpr std::size_t kLongestRecord = 2048;

}  // namespace

FileStamp FileStamp::of(const struct stat& status) {
  return {.inode = status.st_ino,
          .size = static_cast<std::uint64_t>(status.st_size),
          .mtime = nanosecondsOf(status.st_mtim),
          .ctime = nanosecondsOf(status.st_ctim)};
}

StampedLook lookAtStamp(int file) {
  struct stat status{};
  const std::int64_t before = coarseNow();
  if (fstat(file, &status) != 0) return {};
  const std::int64_t after = coarseNow();
  const FileStamp stamp = FileStamp::of(status);
  return {stamp, isSettledTime(stamp.ctime, before, after)};
}

std::uint64_t headChecksum(std::string_view bytes) {
  // FNV-1a: somebody's writing is to be noticed, nobody's ill will.
  std::uint64_t sum = 0xcbf29ce484222325ULL;
  for (const char byte : bytes) {
    sum ^= static_cast<unsigned char>(byte);
    sum *= 0x100000001b3ULL;
  }
  return sum;
}

std::optional<FaultRecord> readFaultRecord(int file, bool& isDamaged) {
  std::array<char, kLongestRecord> text{};
  const ssize_t length = fgetxattr(file, kFaultAttribute, text.data(), text.size());
  isDamaged = false;
  if (length < 0 && errno != ERANGE) return std::nullopt;
  auto record = FaultRecord::decode(
      std::string_view(text.data(), static_cast<std::size_t>(std::max<ssize_t>(length, 0))));
  isDamaged = !record;
  return record;
}

bool isFilledInThisBoot(int file) {
  std::array<char, 64> boot{};
  const ssize_t length = fgetxattr(file, kFilledAttribute, boot.data(), boot.size());
  if (length <= 0 || bootIdentifier().empty()) return false;
  return std::string_view(boot.data(), static_cast<std::size_t>(length)) == bootIdentifier();
}

bool isUnfilledFault(int file) {
  return fgetxattr(file, kFaultAttribute, nullptr, 0) >= 0 && !isFilledInThisBoot(file);
}

}  // namespace yomber
