#pragma once

#include <SQLiteCpp/Database.h>

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>
#include <unordered_map>

struct sqlite3_stmt;

namespace yomber {

/// A prepared statement whose hot paths cost no more than SQLite's own.
///
/// Failures are SQLite::Exception, which stays inside the engine. Parameters count from 1, columns
/// from 0. Thread-safety: that of its connection.
class Statement {
 public:
  Statement(SQLite::Database& database, const char* sql);
  ~Statement();
  Statement(const Statement&) = delete;
  Statement& operator=(const Statement&) = delete;

  /// Texts are bytes and must stay until the statement is reset or stepped to its end.
  void bindInteger(int parameter, std::int64_t value);
  void bindID(int parameter, std::uint64_t value) {
    bindInteger(parameter, static_cast<std::int64_t>(value));
  }
  void bindBytes(int parameter, std::string_view bytes);
  void bindNull(int parameter);

  /// True: there is a row. False: done.
  bool step();
  void reset() noexcept;
  /// Steps to the end and resets.
  void run();

  [[nodiscard]] std::int64_t integer(int column) const;
  [[nodiscard]] std::uint64_t id(int column) const {
    return static_cast<std::uint64_t>(integer(column));
  }
  /// Valid until the next step or reset. Empty for null.
  [[nodiscard]] std::string_view bytes(int column) const;
  [[nodiscard]] bool isNull(int column) const;

 private:
  [[noreturn]] void fail() const;
  SQLite::Database& database_;
  sqlite3_stmt* statement_ = nullptr;
};

/// Holds a cached statement for a scope and resets it at the end, so that it pins no snapshot.
class StatementUse {
 public:
  explicit StatementUse(Statement& statement) : statement_(statement) {}
  ~StatementUse() { statement_.reset(); }
  StatementUse(const StatementUse&) = delete;
  StatementUse& operator=(const StatementUse&) = delete;
  Statement* operator->() { return &statement_; }
  Statement& operator*() { return statement_; }

 private:
  Statement& statement_;
};

class Connection;

/// Lets all that is read in a scope see one state of the database, at the price of one lock on the
/// file instead of one for each statement. Nothing when the connection is within a transaction.
class ReadTransaction {
 public:
  explicit ReadTransaction(Connection& connection);
  ~ReadTransaction();
  ReadTransaction(const ReadTransaction&) = delete;
  ReadTransaction& operator=(const ReadTransaction&) = delete;

 private:
  Connection& connection_;
  const bool isOutermost_;
};

/// One connection to the database with its prepared statements. For one thread at a time.
class Connection {
 public:
  enum class Mode { Read, Write, Bulk };
  Connection(const std::string& path, Mode mode);

  /// The statement for `sql`, prepared once. `sql` must be a string that lives as long as the
  /// program: its address is the key.
  [[nodiscard]] Statement& prepared(const char* sql);
  void execute(const char* sql) { database_.exec(sql); }
  [[nodiscard]] std::int64_t integerOf(const char* sql);
  [[nodiscard]] SQLite::Database& database() { return database_; }

 private:
  SQLite::Database database_;
  std::unordered_map<const char*, std::unique_ptr<Statement>> statements_;
};

}  // namespace yomber
