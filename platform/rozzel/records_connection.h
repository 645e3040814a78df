#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>
#include <unordered_map>

struct sqlite3;
struct sqlite3_stmt;

namespace yomber {

/// A prepared statement of the record store. Parameters count from 1, columns from 0. Failures are
/// StoreFailure. For one thread at a time.
class RecordsStatement {
 public:
  RecordsStatement(sqlite3* database, const char* sql);
  ~RecordsStatement();
  RecordsStatement(const RecordsStatement&) = delete;
  RecordsStatement& operator=(const RecordsStatement&) = delete;

  void bindInteger(int parameter, std::int64_t value);
  /// The bytes must stay until the statement is reset.
  void bindBytes(int parameter, std::string_view bytes);
  void bindNull(int parameter);

  /// True: there is a row. False: done.
  bool step();
  void reset() noexcept;

  [[nodiscard]] std::int64_t integer(int column) const;
  /// Valid until the next step or reset. Empty for null.
  [[nodiscard]] std::string_view bytes(int column) const;
  [[nodiscard]] bool isNull(int column) const;

 private:
  sqlite3* const database_;
  sqlite3_stmt* statement_ = nullptr;
};

/// A use of a prepared statement, which is reset at its end: a statement left at a row would keep
/// its snapshot. The arguments are bound in order.
class RecordsQuery {
 public:
  template <typename... Arguments>
  explicit RecordsQuery(RecordsStatement& statement, const Arguments&... arguments)
      : statement_(statement) {
    int parameter = 0;
    (bind(++parameter, arguments), ...);
  }
  ~RecordsQuery() { statement_.reset(); }
  RecordsQuery(const RecordsQuery&) = delete;
  RecordsQuery& operator=(const RecordsQuery&) = delete;

  RecordsStatement* operator->() { return &statement_; }
  bool step() { return statement_.step(); }
  void run() {
    while (statement_.step()) {
    }
  }

 private:
  void bind(int parameter, std::int64_t value) { statement_.bindInteger(parameter, value); }
  void bind(int parameter, std::string_view bytes) { statement_.bindBytes(parameter, bytes); }
  RecordsStatement& statement_;
};

/// A connection to `records.db`. Failures are StoreFailure. For one thread at a time.
class RecordsConnection {
 public:
  enum class Missing { Fail, Create };
  RecordsConnection(const std::string& path, Missing missing, int busyMilliseconds);
  ~RecordsConnection();
  RecordsConnection(const RecordsConnection&) = delete;
  RecordsConnection& operator=(const RecordsConnection&) = delete;

  /// The statement for `sql`, prepared once. `sql` must be a literal: its address is the key.
  [[nodiscard]] RecordsStatement& prepared(const char* sql);
  void execute(const char* sql);
  [[nodiscard]] std::int64_t integerOf(const char* sql);
  /// Rows changed by the last statement.
  [[nodiscard]] std::int64_t changes() const;
  /// True outside of transactions.
  [[nodiscard]] bool isIdle() const;
  /// Whether closing the last connection writes the log back into the database file.
  void setWriteBackOnClose(bool enabled);

 private:
  sqlite3* database_ = nullptr;
  std::unordered_map<const char*, std::unique_ptr<RecordsStatement>> statements_;
};

/// Rolls back unless it was committed. `Write` takes the store's write lock at once.
class RecordsTransaction {
 public:
  enum class Kind { Read, Write };
  RecordsTransaction(RecordsConnection& connection, Kind kind);
  ~RecordsTransaction();
  RecordsTransaction(const RecordsTransaction&) = delete;
  RecordsTransaction& operator=(const RecordsTransaction&) = delete;
  void commit();

 private:
  RecordsConnection& connection_;
  bool open_ = true;
};

}  // namespace yomber
