// RCSQLiteDatabase: one SQLite connection with the settings the recordings
// database needs (busy timeout, optional statement tracing) and small RAII
// statements. Owned by the recordings model; used from one thread at a time.
#pragma once

#include <sqlite3.h>

#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Error.h"

namespace quorvel {

class RCSQLiteStatement {
 public:
  RCSQLiteStatement(sqlite3* db, sqlite3_stmt* statement) : db_(db), statement_(statement) {}
  ~RCSQLiteStatement();
  RCSQLiteStatement(RCSQLiteStatement&& other) noexcept;
  RCSQLiteStatement& operator=(RCSQLiteStatement&&) = delete;
  RCSQLiteStatement(const RCSQLiteStatement&) = delete;
  RCSQLiteStatement& operator=(const RCSQLiteStatement&) = delete;

  // Parameters are numbered from 1.
  void bind(int index, std::string_view text);
  void bind(int index, double value);

  // Steps once: true when a row is ready, false when done.
  platform::Result<bool> step();
  // Steps until done.
  platform::Status run();

  // Columns are numbered from 0.
  bool isNull(int column) const;
  std::string text(int column) const;
  double real(int column) const;
  long long integer(int column) const;

 private:
  sqlite3* db_;
  sqlite3_stmt* statement_;
};

class RCSQLiteDatabase {
 public:
  // Opens (creating when missing) the database file at `path` with a busy
  // timeout of `busyTimeoutMilliseconds`. With `traceStatements`, every
  // statement is logged at level 7 as it starts.
  static platform::Result<std::unique_ptr<RCSQLiteDatabase>> open(const std::string& path,
                                                                  int busyTimeoutMilliseconds,
                                                                  bool traceStatements);
  ~RCSQLiteDatabase();
  RCSQLiteDatabase(const RCSQLiteDatabase&) = delete;
  RCSQLiteDatabase& operator=(const RCSQLiteDatabase&) = delete;

  platform::Result<RCSQLiteStatement> prepare(std::string_view sql);
  // Runs one or more statements that return nothing of interest.
  platform::Status execute(std::string_view sql);
  // The first column of the first row of `sql`, as an integer.
  platform::Result<long long> integerForQuery(std::string_view sql);
  // The first column of the first row of `sql`, as text (nullopt without a row).
  platform::Result<std::optional<std::string>> textForQuery(std::string_view sql);

  // textForQuery for statements SQLite answers SQLITE_BUSY at once instead of
  // waiting through the busy timeout (changing the journal mode): retried
  // every few milliseconds for up to `timeoutMilliseconds`.
  platform::Result<std::optional<std::string>> textForQueryRetryingWhileBusy(
      std::string_view sql, int timeoutMilliseconds);

 private:
  explicit RCSQLiteDatabase(sqlite3* db) : db_(db) {}
  sqlite3* db_;
};

// An Error for SQLite result `code`: the framework's unreadable-database code
// for SQLITE_NOTADB and SQLITE_CORRUPT, its database-failure code otherwise.
platform::Error RCSQLiteError(int code, std::string_view what, std::string_view message);

}  // namespace quorvel
