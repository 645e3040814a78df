#include "zarn/item_store.h"

#include <SQLiteCpp/Exception.h>

#include "platform/ostrell/constants.h"
#include "zarn/chain_path.h"
#include "zarn/connection.h"
#include "zarn/row_queries.h"

namespace yomber {
namespace {

/// Runs a query on a reading connection; what it answers, or nothing when the database fails.
template <typename Query>
auto query(const Database& database, NSErrorRef* error, const Query& job)
    -> decltype(job(std::declval<Connection&>())) {
  decltype(job(std::declval<Connection&>())) result{};
  const NSErrorRef failure = database.read([&](Connection& connection) {
    const ReadTransaction transaction(connection);
    result = job(connection);
  });
  if (failure) {
    storeError(error, failure);
    return {};
  }
  return result;
}

ItemStore::Counts countItems(Connection& connection) {
  // The root and the trash are no items.
  StatementUse all(connection.prepared("SELECT COUNT(*) FROM item"));
  all->step();
  StatementUse places(connection.prepared("SELECT COUNT(*) FROM item WHERE id IN (0,1)"));
  places->step();
  StatementUse folders(connection.prepared(
      "SELECT COUNT(*) FROM item WHERE kind=1 AND (flags & 2)=0 AND parent>=0"));
  folders->step();
  return {.items = all->id(0) - places->id(0), .folders = folders->id(0)};
}

std::uint64_t placeID(Connection& connection, const TreeLayout::Place& place, bool& isKnown) {
  isKnown = true;
  if (place.kind == TreeLayout::Place::Kind::Trash) return kTrashID;
  if (place.containerID == QSUbiquitousDefaultContainerID) return kRootID;
  const auto row = findByContainer(connection, place.containerID);
  isKnown = row.has_value();
  return row ? row->id : kRootID;
}

std::optional<ItemRow> findBelow(Connection& connection, std::uint64_t place,
                                 std::string_view relative) {
  if (relative.empty()) return findByID(connection, place);
  std::optional<ItemRow> row;
  for (std::uint64_t parent = place; !relative.empty(); parent = row->id) {
    const std::size_t slash = relative.find('/');
    const std::string_view name = relative.substr(0, slash);
    row = findByName(connection, parent, name);
    // A container's folder has its place elsewhere: through the root's location it is not there.
    if (row && row->isContainerFolder()) row.reset();
    if (!row) row = findByDiskName(connection, parent, name);
    if (!row) break;
    relative.remove_prefix(slash == std::string_view::npos ? relative.size() : slash + 1);
  }
  return row;
}

}  // namespace

ItemStore::ItemStore(std::shared_ptr<Database> database, TreeLayout layout)
    : database_(std::move(database)), layout_(std::move(layout)) {}

std::optional<ItemRow> ItemStore::itemByID(std::uint64_t id, NSErrorRef* error) const {
  return query(*database_, error, [&](Connection& c) { return findByID(c, id); });
}

std::optional<ItemRow> ItemStore::itemByName(std::uint64_t parent, std::string_view name,
                                             NSErrorRef* error) const {
  return query(*database_, error, [&](Connection& c) { return findByName(c, parent, name); });
}

std::optional<ItemRow> ItemStore::itemAtPath(std::string_view path, NSErrorRef* error) const {
  const auto place = layout_.placeOf(path);
  if (!place) return std::nullopt;
  return query(*database_, error, [&](Connection& c) -> std::optional<ItemRow> {
    bool isKnown = false;
    const std::uint64_t id = placeID(c, *place, isKnown);
    if (!isKnown) return std::nullopt;
    return findBelow(c, id, place->relative);
  });
}

std::optional<ItemRow> ItemStore::itemForContainer(std::string_view containerID,
                                                   NSErrorRef* error) const {
  return query(*database_, error, [&](Connection& c) {
    if (containerID == QSUbiquitousDefaultContainerID) return findByID(c, kRootID);
    return findByContainer(c, containerID);
  });
}

std::vector<ItemRow> ItemStore::children(std::uint64_t folder, NSErrorRef* error) const {
  return query(*database_, error, [&](Connection& c) { return findChildren(c, folder); });
}

std::vector<std::uint64_t> ItemStore::ancestors(std::uint64_t id, NSErrorRef* error) const {
  return query(*database_, error, [&](Connection& c) {
    std::vector<std::uint64_t> result;
    const auto chain = findChain(c, id);
    if (!chain) return result;
    for (const ItemRow& row : chain->rows) result.push_back(row.parent);
    return result;
  });
}

std::optional<std::string> ItemStore::logicalPath(std::uint64_t id, NSErrorRef* error) const {
  return query(*database_, error, [&](Connection& c) -> std::optional<std::string> {
    const auto chain = findChain(c, id);
    if (!chain) return std::nullopt;
    return pathOfChain(layout_, *chain, Names::Shown);
  });
}

std::optional<ItemStore::Located> ItemStore::located(std::uint64_t id, NSErrorRef* error) const {
  return query(*database_, error, [&](Connection& c) -> std::optional<Located> {
    auto chain = findChain(c, id);
    if (!chain || chain->rows.empty()) return std::nullopt;
    std::string path = pathOfChain(layout_, *chain, Names::Shown);
    return Located{std::move(chain->rows.front()), std::move(path)};
  });
}

std::optional<std::string> ItemStore::physicalPath(std::uint64_t id, NSErrorRef* error) const {
  return query(*database_, error, [&](Connection& c) -> std::optional<std::string> {
    const auto chain = findChain(c, id);
    if (!chain) return std::nullopt;
    return pathOfChain(layout_, *chain, Names::OnDisk);
  });
}

std::string ItemStore::physicalPath(const ItemChain& chain) const {
  return pathOfChain(layout_, chain, Names::OnDisk);
}

ItemStore::Counts ItemStore::counts(NSErrorRef* error) const {
  // Looked at before counting: what is committed meanwhile makes the next call count again.
  Counted counted{
      .identity = database_->identity(), .rank = database_->currentRank(), .counts = {}};
  const auto kept = counted_.load();
  if (kept && kept->identity == counted.identity && kept->rank == counted.rank) {
    return kept->counts;
  }
  NSErrorRef failure;
  counted.counts = query(*database_, &failure, countItems);
  if (failure) {
    storeError(error, failure);
  } else {
    counted_.store(counted);
  }
  return counted.counts;
}

}  // namespace yomber
