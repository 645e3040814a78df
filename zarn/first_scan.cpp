#include "zarn/first_scan.h"

#include <algorithm>
#include <numeric>

#include "platform/foundation/bounced_name.h"
#include "zarn/name_collation.h"
#include "zarn/random_id.h"

namespace yomber {
namespace {

ItemKind kindOf(const FolderSnapshot& snapshot, const FolderEntry& entry,
                const LinkResolver& links) {
  if (entry.type == EntryType::Folder) return ItemKind::Folder;
  if (entry.type == EntryType::File) return ItemKind::Document;
  const bool isBookmark =
      links.isBookmark(snapshot.folder->get(), std::string(snapshot.nameOf(entry)));
  return isBookmark ? ItemKind::Bookmark : ItemKind::Symlink;
}

}  // namespace

SortedSnapshot::SortedSnapshot(std::unique_ptr<FolderSnapshot> folder)
    : snapshot(std::move(folder)) {
  const auto& entries = snapshot->entries;
  keys.reserve(snapshot->names.size() * 3 + entries.size() * 8);
  order.reserve(entries.size());
  for (std::size_t i = 0; i < entries.size(); ++i) {
    const std::size_t begin = keys.size();
    appendNameSortKey(keys, snapshot->nameOf(entries[i]));
    order.push_back(
        {static_cast<std::uint32_t>(i), static_cast<std::uint32_t>(keys.size() - begin), begin});
  }
  std::sort(order.begin(), order.end(),
            [this](const Place& left, const Place& right) { return keyOf(left) < keyOf(right); });
}

std::uint64_t FirstScan::idFor(const FolderEntry& entry, const ItemAttributes& attributes) {
  const bool hasOwn = attributes.id && entry.carriesID();
  if (hasOwn && knownIDs_.insert(*attributes.id).second) return *attributes.id;
  // Should it ever be another item's, the index over the ids refuses, and the scan is done again.
  return randomID();
}

void FirstScan::fillRow(const FolderSnapshot& snapshot, const FolderEntry& entry,
                        const ItemAttributes& attributes, ItemRow& row) const {
  row.kind = kindOf(snapshot, entry, links_);
  row.mode = entry.mode;
  row.size = entry.size;
  row.mtime = entry.mtime;
  row.btime = entry.btime;
  row.ctime = entry.changeTimeToRemember();
  row.inode = entry.inode;
  row.extra =
      attributes.extra.isEmpty() ? nullptr : std::make_shared<const ItemExtra>(attributes.extra);
  row.flags = attributes.isFault ? 0 : row_flag::kDownloaded;
  if (attributes.isShared) row.flags |= row_flag::kShared;
  if (attributes.isOnlyReadable) row.flags |= row_flag::kOnlyReadable;
}

void FirstScan::addPlace(ItemRow row, std::uint64_t visit) {
  if (row.id >= kFirstIssuedID) knownIDs_.insert(row.id);
  if (row.parent == kRootID) reserved_.push_back(row.name);
  visits_[visit] = {row.id, row.isTrashed()};
  load_.add(row, nameSortKey(row.name));
}

bool FirstScan::isTaken(const SortedSnapshot& sorted, std::size_t end,
                        const std::string& name) const {
  const auto isTwin = [&](const std::string& other) { return areNormalizationTwins(other, name); };
  if (std::any_of(given_.begin(), given_.end(), isTwin)) return true;
  const std::string key = nameSortKey(name);
  const std::string_view part = sortKeyCollationPart(key);
  const auto last = sorted.order.begin() + static_cast<std::ptrdiff_t>(end);
  auto place = std::lower_bound(
      sorted.order.begin(), last, part,
      [&](const SortedSnapshot::Place& p, std::string_view k) { return sorted.keyOf(p) < k; });
  for (; place != last && sorted.keyOf(*place).starts_with(part); ++place) {
    const auto& entry = sorted.snapshot->entries[place->entry];
    if (areNormalizationTwins(sorted.snapshot->nameOf(entry), name)) return true;
  }
  return false;
}

bool FirstScan::chooseOtherName(const SortedSnapshot& sorted, std::size_t index, ItemRow& row) {
  // Nearly always the name sorts apart from the one before it, and nothing else is given.
  const bool isAlone = index == 0 || sortKeyCollationPart(sorted.keyOf(sorted.order[index - 1])) !=
                                         sortKeyCollationPart(sorted.keyOf(sorted.order[index]));
  if ((isAlone && given_.empty()) || !isTaken(sorted, index, row.name)) return false;
  row.diskName = row.name;
  const std::string own = row.name;
  row.name = bouncedName(own, [&](const std::string& name) {
    return name == own || isTaken(sorted, sorted.order.size(), name);
  });
  given_.push_back(row.name);
  return true;
}

void FirstScan::addFolder(const SortedSnapshot& sorted) {
  const FolderSnapshot& snapshot = *sorted.snapshot;
  const auto visit = visits_.find(snapshot.visit);
  if (visit == visits_.end()) return;
  const Parent parent = visit->second;
  visits_.erase(visit);
  const auto visitor = visitor_.lock();
  if (!snapshot.isReadable) {
    if (visitor) visitor->didNotReadFolder(parent.id);
    return;
  }
  if (visitor) visitor->didIdentifyFolder(snapshot.visit, parent.id);
  given_ = parent.id == kRootID ? reserved_ : std::vector<std::string>();

  ItemRow row;
  row.parent = parent.id;
  for (std::size_t i = 0; i < sorted.order.size(); ++i) {
    const std::size_t index = sorted.order[i].entry;
    const FolderEntry& entry = snapshot.entries[index];
    const ItemAttributes& attributes = snapshot.attributesOf(index);
    row.id = idFor(entry, attributes);
    row.name = snapshot.nameOf(entry);
    row.diskName.clear();
    fillRow(snapshot, entry, attributes, row);
    if (parent.isTrashed) row.flags |= row_flag::kTrashed;
    if (attributes.id == row.id) row.flags |= row_flag::kStamped;
    if (entry.type == EntryType::Folder) visits_[entry.visit] = {row.id, parent.isTrashed};
    if (chooseOtherName(sorted, i, row)) {
      load_.add(row, nameSortKey(row.name));
    } else {
      load_.add(row, sorted.keyOf(sorted.order[i]));
    }
  }
}

}  // namespace yomber
