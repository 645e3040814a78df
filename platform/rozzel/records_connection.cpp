#include "platform/rozzel/records_connection.h"

#include <sqlite3.h>

#include <cerrno>

#include "platform/rozzel/store_failure.h"

namespace yomber {

namespace {

RZErrorCode codeForResult(int result, int systemError) {
  switch (result & 0xff) {
    case SQLITE_BUSY:
    case SQLITE_LOCKED:
      return RZErrorStoreBusy;
    case SQLITE_FULL:
      return RZErrorStoreFull;
    case SQLITE_CORRUPT:
    case SQLITE_NOTADB:
      return RZErrorStoreDamaged;
    case SQLITE_CANTOPEN:
    case SQLITE_READONLY:
      return RZErrorNetworkUnavailable;
    case SQLITE_TOOBIG:
      return RZErrorLimitExceeded;
    case SQLITE_IOERR:
      return systemError == ENOSPC || systemError == EFBIG || systemError == EDQUOT
                 ? RZErrorStoreFull
                 : RZErrorStoreFailure;
    default:
      return RZErrorStoreFailure;
  }
}

const char* adviceFor(RZErrorCode code) {
  switch (code) {
    case RZErrorStoreBusy:
      return "the record store is busy with another program; try again";
    case RZErrorStoreFull:
      return "the disk of the record store is full; make room, then try again";
    case RZErrorStoreDamaged:
      return "the record store's database is damaged; restore its folder from a backup";
    case RZErrorNetworkUnavailable:
      return "the record store's database cannot be used now";
    default:
      return "the record store's database failed";
  }
}

/// What the system said when the database or its log was last written in vain. (SQLite's own
/// answer, sqlite3_system_errno, is of whatever call came last.)
int lastSystemError(sqlite3* database) {
  sqlite3_file* log = nullptr;
  int number = 0;
  const int found = sqlite3_file_control(database, nullptr, SQLITE_FCNTL_JOURNAL_POINTER,
                                         static_cast<void*>(&log));
  if (found == SQLITE_OK && log != nullptr && log->pMethods != nullptr) {
    log->pMethods->xFileControl(log, SQLITE_FCNTL_LAST_ERRNO, &number);
  }
  if (number == 0) sqlite3_file_control(database, nullptr, SQLITE_FCNTL_LAST_ERRNO, &number);
  return number;
}

[[noreturn]] void throwResult(sqlite3* database, int result) {
  const int systemError =
      database != nullptr && (result & 0xff) == SQLITE_IOERR ? lastSystemError(database) : 0;
  const RZErrorCode code = codeForResult(result, systemError);
  const char* const detail =
      database != nullptr ? sqlite3_errmsg(database) : sqlite3_errstr(result);
  throwFailure(code, std::string(adviceFor(code)) + " (" + detail + ")");
}

}  // namespace

RecordsStatement::RecordsStatement(sqlite3* database, const char* sql) : database_(database) {
  const int result =
      sqlite3_prepare_v3(database_, sql, -1, SQLITE_PREPARE_PERSISTENT, &statement_, nullptr);
  if (result != SQLITE_OK) throwResult(database_, result);
}

RecordsStatement::~RecordsStatement() { sqlite3_finalize(statement_); }

void RecordsStatement::bindInteger(int parameter, std::int64_t value) {
  const int result = sqlite3_bind_int64(statement_, parameter, value);
  if (result != SQLITE_OK) throwResult(database_, result);
}

void RecordsStatement::bindBytes(int parameter, std::string_view bytes) {
  // A null pointer would bind NULL rather than no bytes.
  const char* const data = bytes.data() != nullptr ? bytes.data() : "";
  const int result = sqlite3_bind_blob64(statement_, parameter, data, bytes.size(), SQLITE_STATIC);
  if (result != SQLITE_OK) throwResult(database_, result);
}

void RecordsStatement::bindNull(int parameter) {
  const int result = sqlite3_bind_null(statement_, parameter);
  if (result != SQLITE_OK) throwResult(database_, result);
}

bool RecordsStatement::step() {
  const int result = sqlite3_step(statement_);
  if (result == SQLITE_ROW) return true;
  if (result != SQLITE_DONE) throwResult(database_, result);
  return false;
}

void RecordsStatement::reset() noexcept { sqlite3_reset(statement_); }

std::int64_t RecordsStatement::integer(int column) const {
  return sqlite3_column_int64(statement_, column);
}

std::string_view RecordsStatement::bytes(int column) const {
  const void* const data = sqlite3_column_blob(statement_, column);
  const int length = sqlite3_column_bytes(statement_, column);
  if (data == nullptr || length <= 0) return {};
  return {static_cast<const char*>(data), static_cast<std::size_t>(length)};
}

bool RecordsStatement::isNull(int column) const {
  return sqlite3_column_type(statement_, column) == SQLITE_NULL;
}

RecordsConnection::RecordsConnection(const std::string& path, Missing missing,
                                     int busyMilliseconds) {
  const int create = missing == Missing::Create ? SQLITE_OPEN_CREATE : 0;
  const int result = sqlite3_open_v2(path.c_str(), &database_,
                                     SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOMUTEX | create, nullptr);
  if (result != SQLITE_OK) {
    const std::unique_ptr<sqlite3, int (*)(sqlite3*)> closing(database_, sqlite3_close);
    throwResult(database_, result);
  }
  sqlite3_extended_result_codes(database_, 1);
  sqlite3_busy_timeout(database_, busyMilliseconds);
}

RecordsConnection::~RecordsConnection() {
  statements_.clear();
  sqlite3_close(database_);
}

RecordsStatement& RecordsConnection::prepared(const char* sql) {
  auto& slot = statements_[sql];
  if (!slot) slot = std::make_unique<RecordsStatement>(database_, sql);
  return *slot;
}

void RecordsConnection::execute(const char* sql) {
  const int result = sqlite3_exec(database_, sql, nullptr, nullptr, nullptr);
  if (result != SQLITE_OK) throwResult(database_, result);
}

std::int64_t RecordsConnection::integerOf(const char* sql) {
  RecordsStatement statement(database_, sql);
  return statement.step() ? statement.integer(0) : 0;
}

std::int64_t RecordsConnection::changes() const { return sqlite3_changes64(database_); }

bool RecordsConnection::isIdle() const { return sqlite3_get_autocommit(database_) != 0; }

void RecordsConnection::setWriteBackOnClose(bool enabled) {
  sqlite3_db_config(database_, SQLITE_DBCONFIG_NO_CKPT_ON_CLOSE, enabled ? 0 : 1, nullptr);
}

RecordsTransaction::RecordsTransaction(RecordsConnection& connection, Kind kind)
    : connection_(connection) {
  connection_.execute(kind == Kind::Write ? "BEGIN IMMEDIATE" : "BEGIN");
}

RecordsTransaction::~RecordsTransaction() {
  if (!open_) return;
  try {
    connection_.execute("ROLLBACK");
  } catch (const StoreFailure&) {
    // SQLite has rolled back by itself, or will when the connection is closed.
  }
}

void RecordsTransaction::commit() {
  connection_.execute("COMMIT");
  open_ = false;
}

}  // namespace yomber
