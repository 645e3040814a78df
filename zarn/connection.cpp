#include "zarn/connection.h"

#include <SQLiteCpp/Exception.h>
#include <sqlite3.h>

#include <cstdint>
#include <filesystem>
#include <system_error>

namespace yomber {
namespace {

constexpr int kBusyMilliseconds = 10000;

/// SQLite's own accounting of memory takes a lock for every allocation. Nobody reads it.
void configureOnce() {
  static const int result = sqlite3_config(SQLITE_CONFIG_MEMSTATUS, 0);
  (void)result;
}

int openFlags(Connection::Mode mode) {
  configureOnce();
  // No mutex: a connection is used by one thread at a time.
  const int access = mode == Connection::Mode::Read ? SQLite::OPEN_READONLY
                                                    : SQLite::OPEN_READWRITE | SQLite::OPEN_CREATE;
  return access | SQLite::OPEN_NOMUTEX;
}

/// Smaller files are not mapped for reading: each of the readers that stay open has a mapping of
/// its own, which counts as memory of this process, and a small file is read as fast without.
constexpr std::uintmax_t kSmallFile = 32 << 20;

const char* pragmasOfReader(const std::string& path) {
  std::error_code isMissing;
  const std::uintmax_t size = std::filesystem::file_size(path, isMissing);
  if (isMissing || size < kSmallFile) return "PRAGMA cache_size=-512; PRAGMA query_only=1;";
  // What is not in the log is read where it is mapped.
  return "PRAGMA mmap_size=2147418112; PRAGMA cache_size=-512; PRAGMA query_only=1;";
}

const char* pragmas(const std::string& path, Connection::Mode mode) {
  switch (mode) {
    case Connection::Mode::Read:
      return pragmasOfReader(path);
    case Connection::Mode::Write:
      return "PRAGMA journal_mode=WAL; PRAGMA synchronous=NORMAL; PRAGMA mmap_size=2147418112;"
             "PRAGMA cache_size=-8192; PRAGMA temp_store=MEMORY; PRAGMA secure_delete=0;"
             "PRAGMA wal_autocheckpoint=0; PRAGMA journal_size_limit=67108864;";
    case Connection::Mode::Bulk:
      // The file counts for nothing until it is complete, so nothing needs a journal.
      return "PRAGMA journal_mode=OFF; PRAGMA synchronous=OFF; PRAGMA locking_mode=EXCLUSIVE;"
             "PRAGMA cache_size=-65536; PRAGMA temp_store=MEMORY; PRAGMA secure_delete=0;"
             "PRAGMA threads=2;";
  }
  return "";
}

}  // namespace

Statement::Statement(SQLite::Database& database, const char* sql) : database_(database) {
  const int result = sqlite3_prepare_v3(database_.getHandle(), sql, -1, SQLITE_PREPARE_PERSISTENT,
                                        &statement_, nullptr);
  if (result != SQLITE_OK) fail();
}

Statement::~Statement() { sqlite3_finalize(statement_); }

void Statement::fail() const { throw SQLite::Exception(database_.getHandle()); }

void Statement::bindInteger(int parameter, std::int64_t value) {
  if (sqlite3_bind_int64(statement_, parameter, value) != SQLITE_OK) fail();
}

void Statement::bindBytes(int parameter, std::string_view bytes) {
  // A null pointer would bind NULL rather than no bytes.
  const char* const data = bytes.data() != nullptr ? bytes.data() : "";
  if (sqlite3_bind_blob64(statement_, parameter, data, bytes.size(), SQLITE_STATIC) != SQLITE_OK) {
    fail();
  }
}

void Statement::bindNull(int parameter) {
  if (sqlite3_bind_null(statement_, parameter) != SQLITE_OK) fail();
}

bool Statement::step() {
  const int result = sqlite3_step(statement_);
  if (result == SQLITE_ROW) return true;
  if (result != SQLITE_DONE) fail();
  return false;
}

void Statement::reset() noexcept { sqlite3_reset(statement_); }

void Statement::run() {
  const StatementUse use(*this);
  while (step()) {
  }
}

std::int64_t Statement::integer(int column) const {
  return sqlite3_column_int64(statement_, column);
}

std::string_view Statement::bytes(int column) const {
  const void* const data = sqlite3_column_blob(statement_, column);
  const int length = sqlite3_column_bytes(statement_, column);
  if (data == nullptr || length <= 0) return {};
  return {static_cast<const char*>(data), static_cast<std::size_t>(length)};
}

bool Statement::isNull(int column) const {
  return sqlite3_column_type(statement_, column) == SQLITE_NULL;
}

ReadTransaction::ReadTransaction(Connection& connection)
    : connection_(connection),
      isOutermost_(sqlite3_get_autocommit(connection.database().getHandle()) != 0) {
  if (isOutermost_) connection_.prepared("BEGIN").run();
}

ReadTransaction::~ReadTransaction() {
  if (!isOutermost_) return;
  try {
    connection_.prepared("COMMIT").run();
  } catch (const SQLite::Exception&) {
    // Nothing was written, so nothing can be lost; the next use of the connection says what is
    // wrong.
  }
}

Connection::Connection(const std::string& path, Mode mode)
    : database_(path, openFlags(mode), kBusyMilliseconds) {
  database_.exec(pragmas(path, mode));
}

Statement& Connection::prepared(const char* sql) {
  auto& slot = statements_[sql];
  if (!slot) slot = std::make_unique<Statement>(database_, sql);
  return *slot;
}

std::int64_t Connection::integerOf(const char* sql) {
  Statement statement(database_, sql);
  return statement.step() ? statement.integer(0) : 0;
}

}  // namespace yomber
