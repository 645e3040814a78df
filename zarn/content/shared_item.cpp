#include "zarn/content/shared_item.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <limits>

#include "platform/foundation/fault_attributes.h"
#include "platform/ostrell/constants.h"
#include "zarn/content/fault_file.h"
#include "zarn/content/shared_tree.h"
#include "zarn/tree_layout.h"

namespace yomber {

std::optional<std::uint64_t> itemOfRecord(std::string_view recordName) {
  std::uint64_t id = 0;
  const char* const end = recordName.data() + recordName.size();
  const auto [rest, failure] = std::from_chars(recordName.data(), end, id);
  constexpr auto kLargest = static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max());
  if (failure != std::errc() || rest != end || id < kFirstIssuedID || id > kLargest)
    return std::nullopt;
  return id;
}

std::optional<SharedRecord> SharedRecord::read(const RZRecord& record) {
  SharedRecord result;
  const auto id = itemOfRecord(record.recordID().recordName());
  const auto* const name = record.valueForKey<std::string>(kQSRecordKeyName);
  const auto* const parent = record.valueForKey<std::int64_t>(kQSRecordKeyParent);
  const auto* const content = record.valueForKey<RZAsset>(kQSRecordKeyContent);
  const auto* const modified = record.valueForKey<NSDate>(kQSRecordKeyModified);
  result.isFolder = record.recordType() == kQSRecordTypeFolder;
  const bool isItem = result.isFolder || record.recordType() == kQSRecordTypeDocument;
  if (!isItem || !id || name == nullptr || parent == nullptr) return std::nullopt;
  if (!isPossibleName(*name) || isExcludedName(*name)) return std::nullopt;
  if (!result.isFolder && content == nullptr) return std::nullopt;
  result.id = *id;
  result.name = *name;
  result.parent = static_cast<std::uint64_t>(*parent);
  if (content != nullptr) result.content = *content;
  if (modified != nullptr) result.mtime = modified->nanoseconds();
  result.tag = record.changeTag();
  return result;
}

bool saysTheSame(const SharedRecord& record, const ContentRow& known) {
  if (record.tag == known.tag) return true;
  return record.name == known.name && record.parent == known.parent &&
         (record.isFolder || known.content == record.content);
}

bool isUnsaved(const std::string& path, const std::optional<ContentRow>& content,
               FileStamp* looked) {
  struct stat status{};
  if (lstat(path.c_str(), &status) != 0) return false;
  if (!S_ISREG(status.st_mode) || !content || !content->content) return true;
  const FileDescriptor file(
      open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC | O_NOCTTY));
  // One that is being filled lets nobody in, and holds nothing but what comes from the store.
  if (!file) return errno != EWOULDBLOCK || !isFaultAtPath(path);
  const FaultExamination found = examineFault(file.get());
  if (looked != nullptr) *looked = found.stamp;
  if (found.condition == FaultCondition::Pristine) return found.record.content != *content->content;
  if (found.condition != FaultCondition::NoFault) return true;
  const StampedLook look = lookAtStamp(file.get());
  if (looked != nullptr) *looked = look.toRemember();
  if (look.stamp == content->stamp) return false;
  if (look.stamp.size != content->content->size) return true;
  const auto hashed = hashUnchanged(file.get(), look.stamp, nullptr);
  return !hashed || *hashed != *content->content;
}

}  // namespace yomber
