#include "zarn/listing.h"

#include <algorithm>

#include "platform/foundation/lock.h"
#include "platform/ostrell/constants.h"
#include "zarn/connection.h"
#include "zarn/listing_cursors.h"
#include "zarn/row_queries.h"

namespace yomber {
namespace {

constexpr std::size_t kMaximumCursors = 8192;
constexpr std::size_t kMaximumFencedListings = 64;
constexpr std::size_t kMaximumFencePoints = 200'000;

constexpr int kNameKeyColumn = kRowColumnCount;

// Each query takes up right after a point and runs along its index; the order of the parameters is
// that of `bindPoint`.
constexpr const char* kPageByName = "SELECT " YOMBER_ROW_COLUMNS
                                    ",name_key FROM item INDEXED BY item_name "
                                    "WHERE parent=?1 AND name_key>?3 ORDER BY name_key LIMIT ?5";
constexpr const char* kPageByDate =
    "SELECT " YOMBER_ROW_COLUMNS
    ",name_key FROM item INDEXED BY item_date "
    "WHERE parent=?1 AND (age,name_key)>(?2,?3) ORDER BY age,name_key LIMIT ?5";
#define YOMBER_VISIBLE_FOLDERS "kind=1 AND (flags & 2)=0 AND parent>=0"
constexpr const char* kFoldersByName =
    "SELECT " YOMBER_ROW_COLUMNS
    ",name_key FROM item INDEXED BY folder_name WHERE " YOMBER_VISIBLE_FOLDERS
    " AND (name_key,id)>(?3,?4) ORDER BY name_key,id LIMIT ?5";
constexpr const char* kFoldersByDate =
    "SELECT " YOMBER_ROW_COLUMNS
    ",name_key FROM item INDEXED BY folder_date WHERE " YOMBER_VISIBLE_FOLDERS
    " AND (age,name_key,id)>(?2,?3,?4) ORDER BY age,name_key,id LIMIT ?5";

// For fences only the keys are read, which the indexes hold; what an order does not need is 0.
constexpr const char* kKeysByName =
    "SELECT 0,name_key,0 FROM item INDEXED BY item_name WHERE parent=?1 ORDER BY name_key";
constexpr const char* kKeysByDate =
    "SELECT age,name_key,0 FROM item INDEXED BY item_date WHERE parent=?1 ORDER BY age,name_key";
constexpr const char* kFolderKeysByName =
    "SELECT 0,name_key,id FROM item INDEXED BY folder_name WHERE " YOMBER_VISIBLE_FOLDERS
    " ORDER BY name_key,id";
constexpr const char* kFolderKeysByDate =
    "SELECT age,name_key,id FROM item INDEXED BY folder_date WHERE " YOMBER_VISIBLE_FOLDERS
    " ORDER BY age,name_key,id";

const char* pageQuery(const ListingScope& scope) {
  if (scope.isAllFolders()) {
    return scope.order == ListingOrder::Name ? kFoldersByName : kFoldersByDate;
  }
  return scope.order == ListingOrder::Name ? kPageByName : kPageByDate;
}

const char* keysQuery(const ListingScope& scope) {
  if (scope.isAllFolders()) {
    return scope.order == ListingOrder::Name ? kFolderKeysByName : kFolderKeysByDate;
  }
  return scope.order == ListingOrder::Name ? kKeysByName : kKeysByDate;
}

void bindPoint(Statement& statement, const ListingScope& scope, const ListingPoint& after) {
  // Parameters that a query does not mention exist all the same, up to its highest.
  statement.bindID(1, scope.isAllFolders() ? 0 : scope.folder);
  statement.bindInteger(2, after.age);
  statement.bindBytes(3, after.nameKey);
  statement.bindID(4, after.id);
}

/// Reads up to `limit` rows right after a point, leaving out the first `skip`. Moves `point` to the
/// last one; true when there are more.
bool readPage(Connection& connection, const ListingScope& scope, ListingPoint& point,
              std::uint64_t skip, std::uint32_t limit, std::vector<ItemRow>& rows) {
  StatementUse statement(connection.prepared(pageQuery(scope)));
  bindPoint(*statement, scope, point);
  statement->bindID(5, skip + limit + 1);
  for (std::uint64_t i = 0; i < skip; ++i) {
    if (!statement->step()) return false;
  }
  rows.reserve(limit);
  std::string lastKey;
  while (statement->step()) {
    if (rows.size() == limit) {
      point = {-rows.back().mtime, std::move(lastKey), rows.back().id};
      return true;
    }
    readRow(*statement, rows.emplace_back());
    if (rows.size() == limit) lastKey = statement->bytes(kNameKeyColumn);
  }
  return false;
}

std::shared_ptr<const ListingFences> readFences(Connection& connection, const ListingScope& scope) {
  auto fences = std::make_shared<ListingFences>();
  StatementUse statement(connection.prepared(keysQuery(scope)));
  if (!scope.isAllFolders()) statement->bindID(1, scope.folder);
  for (std::uint64_t index = 1; statement->step(); ++index) {
    if (index % ListingFences::kDistance != 0) continue;
    fences->points.push_back(
        {statement->integer(0), std::string(statement->bytes(1)), statement->id(2)});
  }
  return fences;
}

}  // namespace

class Listing::State : public ChangeSink {
 public:
  explicit State(std::shared_ptr<Database> database) : database_(std::move(database)) {}

  NSErrorRef page(std::uint64_t connection, const ListingScope& scope, std::uint64_t offset,
                  std::uint32_t limit, ListingPage& out);
  void connectionEnded(std::uint64_t connection) {
    LockGuard guard(mutex_);
    cursors_.removeConnection(connection);
  }
  void committed(const std::vector<ItemChange>& changes) override;

 private:
  struct Start {
    ListingPoint point;
    std::uint64_t skip = 0;
    bool isBeyondEnd = false;
  };
  Start findStart(Connection& reader, std::uint64_t connection, const ListingScope& scope,
                  std::uint64_t offset);
  std::shared_ptr<const ListingFences> fencesOf(Connection& reader, const ListingScope& scope);
  void forgetOtherDatabase() REQUIRES(mutex_);

  const std::shared_ptr<Database> database_;
  Mutex mutex_;
  std::uint64_t identity_ GUARDED_BY(mutex_) = 0;
  ListingCursors cursors_ GUARDED_BY(mutex_){kMaximumCursors};
  ListingFenceCache fences_ GUARDED_BY(mutex_){kMaximumFencedListings, kMaximumFencePoints};
};

void Listing::State::committed(const std::vector<ItemChange>& changes) {
  LockGuard guard(mutex_);
  for (const ItemChange& change : changes) {
    fences_.invalidateFolder(change.row.parent);
    if (change.hasMoved()) fences_.invalidateFolder(change.parentBefore);
    if (change.row.isFolder()) fences_.invalidateFolder(ListingScope::kAllFolders);
  }
}

void Listing::State::forgetOtherDatabase() {
  const std::uint64_t identity = database_->identity();
  if (identity == identity_) return;
  identity_ = identity;
  cursors_.clear();
  fences_.clear();
}

std::shared_ptr<const ListingFences> Listing::State::fencesOf(Connection& reader,
                                                              const ListingScope& scope) {
  {
    LockGuard guard(mutex_);
    if (auto fences = fences_.find(scope)) return fences;
    fences_.beginBuilding(scope);
  }
  std::shared_ptr<const ListingFences> fences;
  try {
    fences = readFences(reader, scope);
  } catch (...) {
    LockGuard guard(mutex_);
    fences_.store(scope, nullptr);
    throw;
  }
  LockGuard guard(mutex_);
  fences_.store(scope, fences);
  return fences;
}

Listing::State::Start Listing::State::findStart(Connection& reader, std::uint64_t connection,
                                                const ListingScope& scope, std::uint64_t offset) {
  if (offset == 0) return {};
  {
    LockGuard guard(mutex_);
    forgetOtherDatabase();
    if (auto point = cursors_.find({connection, scope, offset}))
      return {std::move(*point), 0, false};
  }
  if (offset < ListingFences::kDistance) return {{}, offset, false};
  const auto fences = fencesOf(reader, scope);
  const std::uint64_t fence = offset / ListingFences::kDistance;
  if (fence > fences->points.size()) return {{}, 0, true};
  return {fences->points[fence - 1], offset % ListingFences::kDistance, false};
}

NSErrorRef Listing::State::page(std::uint64_t connection, const ListingScope& scope,
                                std::uint64_t offset, std::uint32_t limit, ListingPage& out) {
  out = {};
  if (limit == 0) {
    return NSError::errorWithDomain(
        QSOstrellErrorDomain, QSOstrellErrorInvalidParameter,
        {{QSOstrellErrorParameterKey, std::string("limit")},
         {QSOstrellErrorValueKey, std::int64_t{0}},
         {NSLocalizedDescriptionKey, std::string("A page's limit must be at least 1.")}});
  }
  const std::uint32_t count = std::min(limit, kMaximumLimit);
  return database_->read([&](Connection& reader) {
    Start start = findStart(reader, connection, scope, offset);
    if (start.isBeyondEnd) return;
    const bool hasMore = readPage(reader, scope, start.point, start.skip, count, out.rows);
    for (ItemRow& row : out.rows) loadExtra(reader, row);
    if (!hasMore) return;
    out.nextOffset = offset + out.rows.size();
    LockGuard guard(mutex_);
    forgetOtherDatabase();
    cursors_.store({connection, scope, out.nextOffset}, std::move(start.point));
  });
}

Listing::Listing(std::shared_ptr<Database> database) : state_(std::make_shared<State>(database)) {
  database->addSink(state_);
}

Listing::~Listing() = default;

NSErrorRef Listing::page(std::uint64_t connection, std::uint64_t folder, ListingOrder order,
                         std::uint64_t offset, std::uint32_t limit, ListingPage& out) {
  return state_->page(connection, {folder, order}, offset, limit, out);
}

NSErrorRef Listing::foldersPage(std::uint64_t connection, ListingOrder order, std::uint64_t offset,
                                std::uint32_t limit, ListingPage& out) {
  return state_->page(connection, {ListingScope::kAllFolders, order}, offset, limit, out);
}

void Listing::connectionEnded(std::uint64_t connection) { state_->connectionEnded(connection); }

}  // namespace yomber
