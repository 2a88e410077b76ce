// Thin RAII layer over SQLite for the embedded registry.
//
// A Database owns one connection (closed with sqlite3_close_v2), a Statement
// one prepared statement (finalized on destruction), a Transaction one
// BEGIN IMMEDIATE ... COMMIT that rolls back unless commit() succeeded.
// Failures become records in RGErrorDomain, code kRGDatabaseError, with
// SQLite's message and result code in the text.
#pragma once

#include <sqlite3.h>

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "Platform/Error.h"

namespace rg {

struct SqliteClose {
  void operator()(sqlite3* db) const { sqlite3_close_v2(db); }
};
struct SqliteFinalize {
  void operator()(sqlite3_stmt* statement) const { sqlite3_finalize(statement); }
};
using UniqueSqlite = std::unique_ptr<sqlite3, SqliteClose>;
using UniqueStatement = std::unique_ptr<sqlite3_stmt, SqliteFinalize>;

class Statement;

class Database {
 public:
  // Opens (creating) the database file and sets WAL journaling,
  // synchronous=FULL, foreign keys and a busy timeout of five seconds.
  static std::optional<Database> open(const std::string& path, sl::Error* error);

  // Runs one or more statements without results.
  bool exec(std::string_view sql, sl::Error* error);
  std::optional<Statement> prepare(std::string_view sql, sl::Error* error);
  // A record for the connection's last failure, `what` naming the step.
  sl::Error lastError(std::string_view what) const;
  sqlite3* handle() const { return db_.get(); }
  int64_t lastInsertRowid() const { return sqlite3_last_insert_rowid(db_.get()); }

 private:
  explicit Database(UniqueSqlite db) : db_(std::move(db)) {}
  UniqueSqlite db_;
};

class Statement {
 public:
  Statement(Database& db, UniqueStatement statement) : db_(&db), statement_(std::move(statement)) {}

  // Binds are 1-based, as in SQLite; an empty optional binds NULL.
  Statement& bind(int index, std::string_view text);
  Statement& bind(int index, const std::string& text) { return bind(index, std::string_view(text)); }
  Statement& bind(int index, const char* text) { return bind(index, std::string_view(text)); }
  Statement& bind(int index, const std::optional<std::string>& text);
  Statement& bind(int index, int64_t value);

  // One step: true with a row, false when done (then *error untouched) or
  // on failure (then *error written, and failed() answers true).
  bool step(sl::Error* error);
  // Steps to the end, for statements without rows.
  bool run(sl::Error* error);
  bool failed() const { return failed_; }

  std::optional<std::string> text(int column) const;
  int64_t integer(int column) const { return sqlite3_column_int64(statement_.get(), column); }

 private:
  Database* db_;
  UniqueStatement statement_;
  bool failed_ = false;
};

// BEGIN IMMEDIATE on construction; ROLLBACK on destruction unless commit()
// succeeded. began() is false when BEGIN itself failed (the record is in
// the error slot given to the constructor).
class Transaction {
 public:
  Transaction(Database& db, sl::Error* error);
  ~Transaction();
  Transaction(const Transaction&) = delete;
  Transaction& operator=(const Transaction&) = delete;

  bool began() const { return began_; }
  bool commit(sl::Error* error);

 private:
  Database& db_;
  bool began_ = false;
  bool committed_ = false;
};

}  // namespace rg
