#include "Quorvel/database/RCSQLiteDatabase.h"

#include <fmt/format.h>

#include <chrono>
#include <thread>

#include "Quorvel/errors/RCErrors.h"
#include "platform/Log.h"

namespace quorvel {
namespace {

int traceStatement(unsigned type, void*, void* statement, void* sql) {
  if (type != SQLITE_TRACE_STMT) return 0;
  char* expanded = sqlite3_expanded_sql(static_cast<sqlite3_stmt*>(statement));
  QV_LOG(platform::kLogLevelDebug, "SQL: {}", expanded ? expanded : static_cast<const char*>(sql));
  sqlite3_free(expanded);
  return 0;
}

}  // namespace

platform::Error RCSQLiteError(int code, std::string_view what, std::string_view message) {
  int primary = code & 0xFF;
  RCErrorCode rcCode = (primary == SQLITE_NOTADB || primary == SQLITE_CORRUPT)
                           ? RCErrorCodeDatabaseUnreadable
                           : RCErrorCodeDatabaseFailed;
  return RCError(rcCode, fmt::format("{}: {} (SQLite error {})", what, message, code));
}

RCSQLiteStatement::~RCSQLiteStatement() {
  if (statement_ != nullptr) sqlite3_finalize(statement_);
}

RCSQLiteStatement::RCSQLiteStatement(RCSQLiteStatement&& other) noexcept
    : db_(other.db_), statement_(other.statement_) {
  other.statement_ = nullptr;
}

void RCSQLiteStatement::bind(int index, std::string_view text) {
  sqlite3_bind_text(statement_, index, text.data(), static_cast<int>(text.size()),
                    SQLITE_TRANSIENT);
}

void RCSQLiteStatement::bind(int index, double value) {
  sqlite3_bind_double(statement_, index, value);
}

platform::Result<bool> RCSQLiteStatement::step() {
  int rc = sqlite3_step(statement_);
  if (rc == SQLITE_ROW) return true;
  if (rc == SQLITE_DONE) return false;
  return platform::fail(RCSQLiteError(rc, sqlite3_sql(statement_), sqlite3_errmsg(db_)));
}

platform::Status RCSQLiteStatement::run() {
  for (;;) {
    auto row = step();
    if (!row) return platform::fail(row.error());
    if (!*row) return {};
  }
}

bool RCSQLiteStatement::isNull(int column) const {
  return sqlite3_column_type(statement_, column) == SQLITE_NULL;
}

std::string RCSQLiteStatement::text(int column) const {
  const unsigned char* text = sqlite3_column_text(statement_, column);
  if (text == nullptr) return {};
  return std::string(reinterpret_cast<const char*>(text),
                     static_cast<std::size_t>(sqlite3_column_bytes(statement_, column)));
}

double RCSQLiteStatement::real(int column) const {
  return sqlite3_column_double(statement_, column);
}

long long RCSQLiteStatement::integer(int column) const {
  return sqlite3_column_int64(statement_, column);
}

platform::Result<std::unique_ptr<RCSQLiteDatabase>> RCSQLiteDatabase::open(
    const std::string& path, int busyTimeoutMilliseconds, bool traceStatements) {
  sqlite3* db = nullptr;
  int rc =
      sqlite3_open_v2(path.c_str(), &db,
                      SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_FULLMUTEX, nullptr);
  if (rc != SQLITE_OK) {
    platform::Error error =
        RCSQLiteError(rc, "open " + path, db ? sqlite3_errmsg(db) : sqlite3_errstr(rc));
    sqlite3_close(db);
    return platform::fail(error);
  }
  sqlite3_extended_result_codes(db, 1);
  sqlite3_busy_timeout(db, busyTimeoutMilliseconds);
  if (traceStatements) sqlite3_trace_v2(db, SQLITE_TRACE_STMT, traceStatement, nullptr);
  return std::unique_ptr<RCSQLiteDatabase>(new RCSQLiteDatabase(db));
}

RCSQLiteDatabase::~RCSQLiteDatabase() { sqlite3_close_v2(db_); }

platform::Result<RCSQLiteStatement> RCSQLiteDatabase::prepare(std::string_view sql) {
  sqlite3_stmt* statement = nullptr;
  int rc = sqlite3_prepare_v2(db_, sql.data(), static_cast<int>(sql.size()), &statement, nullptr);
  if (rc != SQLITE_OK) {
    sqlite3_finalize(statement);
    return platform::fail(RCSQLiteError(rc, sql, sqlite3_errmsg(db_)));
  }
  return RCSQLiteStatement(db_, statement);
}

platform::Status RCSQLiteDatabase::execute(std::string_view sql) {
  std::string text(sql);
  char* message = nullptr;
  int rc = sqlite3_exec(db_, text.c_str(), nullptr, nullptr, &message);
  if (rc != SQLITE_OK) {
    platform::Error error = RCSQLiteError(rc, sql, message ? message : sqlite3_errmsg(db_));
    sqlite3_free(message);
    return platform::fail(error);
  }
  return {};
}

platform::Result<long long> RCSQLiteDatabase::integerForQuery(std::string_view sql) {
  auto statement = prepare(sql);
  if (!statement) return platform::fail(statement.error());
  auto row = statement->step();
  if (!row) return platform::fail(row.error());
  return *row ? statement->integer(0) : 0;
}

platform::Result<std::optional<std::string>> RCSQLiteDatabase::textForQuery(std::string_view sql) {
  auto statement = prepare(sql);
  if (!statement) return platform::fail(statement.error());
  auto row = statement->step();
  if (!row) return platform::fail(row.error());
  if (!*row) return std::optional<std::string>();
  return std::optional<std::string>(statement->text(0));
}

platform::Result<std::optional<std::string>> RCSQLiteDatabase::textForQueryRetryingWhileBusy(
    std::string_view sql, int timeoutMilliseconds) {
  auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMilliseconds);
  for (;;) {
    auto result = textForQuery(sql);
    bool busy = !result && (sqlite3_extended_errcode(db_) & 0xFF) == SQLITE_BUSY;
    if (!busy || std::chrono::steady_clock::now() >= deadline) return result;
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
}

}  // namespace quorvel
