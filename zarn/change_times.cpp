#include "zarn/change_times.h"

#include <ctime>

#include "zarn/folder_snapshot.h"
#include "zarn/item_attributes.h"

namespace yomber {
namespace {

bool isAsKnown(const ItemRow& row, const FolderEntry& entry) {
  return entry.carriesID() && row.inode == entry.inode && row.mode == entry.mode &&
         row.size == entry.size && row.mtime == entry.mtime;
}

ItemAttributes attributesOf(const ItemRow& row) {
  ItemAttributes result;
  result.id = row.id;
  result.isShared = (row.flags & row_flag::kShared) != 0;
  result.isFault = (row.flags & row_flag::kDownloaded) == 0;
  if (row.extra) result.extra = *row.extra;
  result.extra.containerID.clear();
  return result;
}

}  // namespace

std::int64_t coarseNow() {
  timespec now{};
  clock_gettime(CLOCK_REALTIME_COARSE, &now);
  return static_cast<std::int64_t>(now.tv_sec) * 1'000'000'000 + now.tv_nsec;
}

std::optional<std::int64_t> changeTimeAfterOwnWrite(int folder, const std::string& name,
                                                    const ItemRow& row) {
  FolderEntry entry;
  if (!lookAtEntry(folder, name.c_str(), entry)) return std::nullopt;
  if (!entry.isSettled || !isAsKnown(row, entry)) return std::nullopt;
  // Read after the look: what comes later has a later time.
  const auto attributes = readItemAttributes(pathThroughDescriptor(folder, name).c_str());
  if (attributes != attributesOf(row)) return std::nullopt;
  return entry.ctime;
}

}  // namespace yomber
