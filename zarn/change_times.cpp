#include "zarn/change_times.h"

#include <chrono>
#include <ctime>
#include <thread>

#include "platform/foundation/file_time.h"
#include "zarn/folder_snapshot.h"

namespace yomber {
namespace {

bool isAsKnown(const ItemRow& row, const FolderEntry& entry) {
  return entry.carriesID() && row.inode == entry.inode && row.mode == entry.mode &&
         row.size == entry.size && row.mtime == entry.mtime;
}

}  // namespace

bool isDescribedBy(const ItemRow& row, const ItemAttributes& attributes) {
  ItemExtra extra = row.extra ? *row.extra : ItemExtra{};
  extra.containerID.clear();
  const bool isShared = (row.flags & row_flag::kShared) != 0;
  const bool isOnlyReadable = (row.flags & row_flag::kOnlyReadable) != 0;
  return attributes.id == row.id && attributes.isShared == isShared &&
         attributes.isOnlyReadable == isOnlyReadable && attributes.extra == extra;
}

std::int64_t coarseNow() {
  timespec now{};
  clock_gettime(CLOCK_REALTIME_COARSE, &now);
  return nanosecondsOf(now);
}

void waitForTick() {
  const std::int64_t now = coarseNow();
  while (coarseNow() == now) std::this_thread::sleep_for(std::chrono::milliseconds(1));
}

std::optional<std::int64_t> changeTimeAfterOwnWrite(int folder, const std::string& name,
                                                    const ItemRow& row) {
  FolderEntry entry;
  if (!lookAtEntry(folder, name.c_str(), entry)) return std::nullopt;
  if (!entry.isSettled || !isAsKnown(row, entry)) return std::nullopt;
  // Read after the look: what comes later has a later time.
  const auto attributes = readItemAttributes(pathThroughDescriptor(folder, name).c_str());
  const bool isHere = (row.flags & row_flag::kDownloaded) != 0;
  if (attributes.isFault == isHere || !isDescribedBy(row, attributes)) return std::nullopt;
  return entry.ctime;
}

}  // namespace yomber
