#include "zarn/change_feed.h"

#include <SQLiteCpp/Transaction.h>

#include <algorithm>
#include <chrono>

#include "platform/fileprovider/constants.h"
#include "platform/ostrell/constants.h"
#include "zarn/connection.h"
#include "zarn/row_queries.h"
#include "zarn/write_transaction.h"

namespace yomber {
namespace {

/// What a token says: a version byte, then these, each as 8 bytes, the highest first.
struct Token {
  static constexpr char kVersion = 1;
  static constexpr std::size_t kLength = 1 + 3 * 8;

  std::uint64_t identity = 0;  ///< of the database
  std::uint64_t rank = 0;      ///< everything up to here was told
  std::uint64_t start = 0;     ///< departures up to here were before the first listing began

  /// The rank up to which the holder knows of departures.
  [[nodiscard]] std::uint64_t known() const { return std::max(rank, start); }
};

void appendNumber(std::string& out, std::uint64_t number) {
  for (unsigned shift = 64; shift != 0; shift -= 8) {
    out += static_cast<char>((number >> (shift - 8)) & 0xffU);
  }
}

std::uint64_t numberAt(std::string_view text, std::size_t at) {
  std::uint64_t number = 0;
  for (std::size_t i = 0; i < 8; ++i) {
    number = (number << 8U) | static_cast<unsigned char>(text[at + i]);
  }
  return number;
}

std::string encode(const Token& token) {
  std::string text{Token::kVersion};
  appendNumber(text, token.identity);
  appendNumber(text, token.rank);
  appendNumber(text, token.start);
  return text;
}

std::optional<Token> decode(std::string_view text) {
  if (text.size() != Token::kLength || text.front() != Token::kVersion) return std::nullopt;
  return Token{numberAt(text, 1), numberAt(text, 9), numberAt(text, 17)};
}

NSErrorRef expired(const char* reason) {
  return NSError::errorWithDomain(
      NSFileProviderErrorDomain, NSFileProviderErrorSyncAnchorExpired,
      {{NSLocalizedDescriptionKey,
        std::string("The change token cannot be answered: ") + reason + ". List again."}});
}

/// A departure counts only for who may have been told of the item before.
constexpr const char* kChanges =
    "SELECT id,rank,kind,member FROM working INDEXED BY working_rank "
    "WHERE rank>?1 AND (member=1 OR rank>?2) ORDER BY rank LIMIT ?3";

void readChanges(Connection& reader, Token& token, std::uint32_t limit, WorkingSetChanges& out) {
  StatementUse statement(reader.prepared(kChanges));
  statement->bindID(1, token.rank);
  statement->bindID(2, token.start);
  statement->bindInteger(3, limit);
  while (statement->step()) {
    const std::uint64_t id = statement->id(0);
    token.rank = statement->id(1);
    std::optional<ItemRow> row;
    if (statement->integer(3) == 1) row = findByID(reader, id);
    if (row) {
      out.updated.push_back(std::move(*row));
    } else {
      out.departed.push_back({id, static_cast<ItemKind>(statement->integer(2))});
    }
  }
}

constexpr std::uint64_t kLargestRank = ~std::uint64_t{0} >> 1U;

}  // namespace

bool isWorkingSetMember(const ItemRow& row, std::int64_t now) {
  if (row.isTrashed() || row.isDead() || row.id < kFirstIssuedID) return false;
  if ((row.flags & row_flag::kShared) != 0) return true;
  if (!row.extra) return false;
  const ItemExtra& extra = *row.extra;
  return extra.favoriteRank.has_value() || !extra.tags.empty() ||
         (extra.lastUsed && *extra.lastUsed > now - ChangeFeed::kRecentlyUsed);
}

ChangeFeed::ChangeFeed(std::shared_ptr<Database> database) : database_(std::move(database)) {}

NSErrorRef ChangeFeed::workingSetChanges(std::optional<std::string_view> token, std::uint32_t limit,
                                         WorkingSetChanges& out) {
  out = {};
  const std::uint32_t count = std::clamp<std::uint32_t>(limit, 1, kMaximumLimit);
  std::optional<Token> from;
  if (token) {
    from = decode(*token);
    if (!from) return expired("it is malformed");
    if (from->identity != database_->identity()) return expired("the database was built anew");
    if (from->known() > kLargestRank) return expired("it is malformed");
    if (from->known() < database_->oldestAnswerableRank()) return expired("it is too old");
    if (from->known() > database_->currentRank()) return expired("it is from the future");
  } else {
    from = Token{database_->identity(), 0, database_->currentRank()};
  }
  NSErrorRef error = database_->read([&](Connection& reader) {
    // One snapshot for the changes and their rows.
    SQLite::Transaction snapshot(reader.database());
    readChanges(reader, *from, count, out);
  });
  if (error) return error;
  // What was pruned while the changes were read may be missing from them.
  if (from->known() < database_->oldestAnswerableRank()) return expired("it is too old");
  out.token = encode(*from);
  return nullptr;
}

bool ChangeFeed::expireRecentlyUsed(std::int64_t now) {
  bool hasExpired = false;
  const NSErrorRef error = database_->write([&](WriteTransaction& transaction) -> NSErrorRef {
    Connection& connection = transaction.connection();
    std::vector<std::uint64_t> expiredIDs;
    {
      StatementUse statement(
          connection.prepared("SELECT w.id FROM working w JOIN extra e ON e.id=w.id "
                              "WHERE w.member=1 AND e.last_used IS NOT NULL AND e.last_used<=?1"));
      statement->bindInteger(1, now - kRecentlyUsed);
      while (statement->step()) expiredIDs.push_back(statement->id(0));
    }
    for (const std::uint64_t id : expiredIDs) {
      const auto row = findByID(connection, id);
      if (row && isWorkingSetMember(*row, now)) continue;
      transaction.departFromWorkingSet(id);
      hasExpired = true;
    }
    return nullptr;
  });
  return !error && hasExpired;
}

std::uint64_t ChangeFeed::currentNotifRank() const { return database_->currentRank(); }

}  // namespace yomber
