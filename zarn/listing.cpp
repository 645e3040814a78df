#include "zarn/listing.h"

#include <algorithm>

#include "platform/foundation/lock.h"
#include "platform/ostrell/constants.h"
#include "zarn/connection.h"
#include "zarn/listing_cursors.h"
#include "zarn/pages_ahead.h"
#include "zarn/row_queries.h"

namespace yomber {
namespace {

constexpr std::size_t kMaximumCursors = 8192;
constexpr std::size_t kMaximumFencedListings = 64;
constexpr std::size_t kMaximumFencePoints = 200'000;
constexpr std::size_t kMaximumPagesAhead = 32;

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

/// Where a page begins: right after a point, leaving out the first `skip` rows.
struct Start {
  ListingPoint point;
  std::uint64_t skip = 0;
  bool isBeyondEnd = false;
};

/// Reads up to `limit` rows; answers where the last one is when there are more.
std::optional<ListingPoint> readRows(Connection& connection, const ListingScope& scope,
                                     const Start& start, std::uint32_t limit,
                                     std::vector<ItemRow>& rows) {
  StatementUse statement(connection.prepared(pageQuery(scope)));
  bindPoint(*statement, scope, start.point);
  statement->bindID(5, start.skip + limit + 1);
  for (std::uint64_t i = 0; i < start.skip; ++i) {
    if (!statement->step()) return std::nullopt;
  }
  rows.reserve(limit);
  std::string lastKey;
  while (statement->step()) {
    if (rows.size() == limit) {
      return ListingPoint{-rows.back().mtime, std::move(lastKey), rows.back().id};
    }
    readRow(*statement, rows.emplace_back());
    if (rows.size() == limit) lastKey = statement->bytes(kNameKeyColumn);
  }
  return std::nullopt;
}

PagesAhead::Page readPage(Connection& connection, const ListingScope& scope, const Start& start,
                          std::uint64_t offset, std::uint32_t limit) {
  PagesAhead::Page result;
  if (start.isBeyondEnd) return result;
  std::vector<ItemRow>& rows = result.page.rows;
  auto end = readRows(connection, scope, start, limit, rows);
  result.page.contentTypes.reserve(rows.size());
  for (ItemRow& row : rows) {
    loadExtra(connection, row);
    result.page.contentTypes.push_back(&itemContentType(row));
  }
  if (!end) return result;
  result.page.nextOffset = offset + rows.size();
  result.end = *std::move(end);
  return result;
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

  NSErrorRef page(const ListingCursors::Key& key, std::uint32_t limit, ListingPage& out,
                  ReadAhead& readAhead);
  void connectionEnded(std::uint64_t connection) {
    pagesAhead_.removeConnection(connection);
    LockGuard guard(mutex_);
    cursors_.removeConnection(connection);
  }
  void committed(const std::vector<ItemChange>& changes) override;

 private:
  using Key = ListingCursors::Key;

  std::optional<ListingPoint> endOfPrevious(const Key& key);
  NSErrorRef readNow(const Key& key, const std::optional<ListingPoint>& after, std::uint32_t limit,
                     PagesAhead::Page& out);
  ReadAhead planReadAhead(const Key& key, std::uint32_t limit, const ListingPoint& after);
  Start startAt(Connection& reader, const ListingScope& scope, std::uint64_t offset);
  std::shared_ptr<const ListingFences> fencesOf(Connection& reader, const ListingScope& scope);
  void forgetOtherDatabase() REQUIRES(mutex_);

  const std::shared_ptr<Database> database_;
  PagesAhead pagesAhead_{kMaximumPagesAhead};
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
  std::uint64_t building = 0;
  {
    LockGuard guard(mutex_);
    if (auto fences = fences_.find(scope)) return fences;
    building = fences_.beginBuilding(scope);
  }
  std::shared_ptr<const ListingFences> fences;
  try {
    fences = readFences(reader, scope);
  } catch (...) {
    LockGuard guard(mutex_);
    fences_.store(building, nullptr);
    throw;
  }
  LockGuard guard(mutex_);
  fences_.store(building, fences);
  return fences;
}

std::optional<ListingPoint> Listing::State::endOfPrevious(const Key& key) {
  if (key.offset == 0) return ListingPoint{};
  LockGuard guard(mutex_);
  forgetOtherDatabase();
  return cursors_.take(key);
}

Start Listing::State::startAt(Connection& reader, const ListingScope& scope, std::uint64_t offset) {
  if (offset < ListingFences::kDistance) return {{}, offset, false};
  const auto fences = fencesOf(reader, scope);
  const std::uint64_t fence = offset / ListingFences::kDistance;
  if (fence > fences->points.size()) return {{}, 0, true};
  return {fences->points[fence - 1], offset % ListingFences::kDistance, false};
}

NSErrorRef Listing::State::page(const Key& key, std::uint32_t limit, ListingPage& out,
                                ReadAhead& readAhead) {
  out = {};
  readAhead = nullptr;
  if (limit == 0) {
    return NSError::errorWithDomain(
        QSOstrellErrorDomain, QSOstrellErrorInvalidParameter,
        {{QSOstrellErrorParameterKey, std::string("limit")},
         {QSOstrellErrorValueKey, std::int64_t{0}},
         {NSLocalizedDescriptionKey, std::string("A page's limit must be at least 1.")}});
  }
  const std::uint32_t count = std::min(limit, kMaximumLimit);
  const auto after = endOfPrevious(key);
  std::optional<PagesAhead::Page> ahead;
  if (after) ahead = pagesAhead_.take(key, *after, count, database_->currentRank());
  PagesAhead::Page result;
  if (ahead) {
    result = *std::move(ahead);
  } else if (NSErrorRef error = readNow(key, after, count, result)) {
    return error;
  }
  out = std::move(result.page);
  if (out.nextOffset == 0) return nullptr;
  const Key next{key.connection, key.scope, out.nextOffset};
  // Many ask for one page and no more.
  if (key.offset != 0) readAhead = planReadAhead(next, count, result.end);
  LockGuard guard(mutex_);
  forgetOtherDatabase();
  cursors_.store(next, std::move(result.end), std::chrono::steady_clock::now());
  return nullptr;
}

NSErrorRef Listing::State::readNow(const Key& key, const std::optional<ListingPoint>& after,
                                   std::uint32_t limit, PagesAhead::Page& out) {
  return database_->read([&](Connection& reader) {
    const Start start = after ? Start{*after, 0, false} : startAt(reader, key.scope, key.offset);
    out = readPage(reader, key.scope, start, key.offset, limit);
  });
}

Listing::ReadAhead Listing::State::planReadAhead(const Key& key, std::uint32_t limit,
                                                 const ListingPoint& after) {
  const auto read = [key, limit, after, database = database_]() -> std::optional<PagesAhead::Page> {
    PagesAhead::Page result;
    const NSErrorRef error = database->read([&](Connection& reader) {
      result = readPage(reader, key.scope, {after, 0, false}, key.offset, limit);
    });
    // Whoever asks for the page is told.
    if (error) return std::nullopt;
    return result;
  };
  return pagesAhead_.plan(key, after, limit, database_->currentRank(), read);
}

Listing::Listing(std::shared_ptr<Database> database) : state_(std::make_shared<State>(database)) {
  database->addSink(state_);
}

Listing::~Listing() = default;

NSErrorRef Listing::page(std::uint64_t connection, std::uint64_t folder, ListingOrder order,
                         std::uint64_t offset, std::uint32_t limit, ListingPage& out,
                         ReadAhead& readAhead) {
  return state_->page({connection, {folder, order}, offset}, limit, out, readAhead);
}

NSErrorRef Listing::foldersPage(std::uint64_t connection, ListingOrder order, std::uint64_t offset,
                                std::uint32_t limit, ListingPage& out, ReadAhead& readAhead) {
  return state_->page({connection, {ListingScope::kAllFolders, order}, offset}, limit, out,
                      readAhead);
}

void Listing::connectionEnded(std::uint64_t connection) { state_->connectionEnded(connection); }

}  // namespace yomber
