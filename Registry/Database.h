// Thin RAII layer over SQLite for the embedded registry.
//
// A Database owns one connection (closed with sqlite3_close_v2) and keeps
// the statements it prepares, one per SQL text, for reuse. A Statement
// borrows one of them: when it goes out of scope the statement is reset and
// its bindings cleared, ready for the next prepare of the same text. A
// prepare of a text whose statement is still borrowed (a nested use) gets a
// statement of its own, finalized on destruction. A Statement must not
// outlive its Database. A Transaction is one BEGIN IMMEDIATE ... COMMIT
// that rolls back unless commit() succeeded.
// Every commit first makes the flushes this thread deferred
// (sl::DeferredSyncs): what it records may depend on them. A transaction
// that records only what is to come (an intent) says so and skips that.
// Failures become records in RGErrorDomain, code kRGDatabaseError, with
// SQLite's message and result code in the text.
#pragma once

#include <sqlite3.h>

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>

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

// Gives back a statement that a Statement held: one of the Database's kept
// statements (inUse set) is reset, cleared and marked free; any other is
// finalized.
struct StatementRelease {
  bool* inUse = nullptr;
  void operator()(sqlite3_stmt* statement) const;
};
using BorrowedStatement = std::unique_ptr<sqlite3_stmt, StatementRelease>;

class Statement;

class Database {
 public:
  // Opens (creating) the database file and sets WAL journaling,
  // synchronous=FULL, foreign keys and a busy timeout of five seconds.
  static std::optional<Database> open(const std::string& path, sl::Error* error);

  // Runs one or more statements without results.
  bool exec(std::string_view sql, sl::Error* error);
  // The statement for sql, reused from an earlier prepare of the same text
  // when there is one and it is not in use.
  std::optional<Statement> prepare(std::string_view sql, sl::Error* error);
  // A record for the connection's last failure, `what` naming the step.
  sl::Error lastError(std::string_view what) const;
  sqlite3* handle() const { return db_.get(); }
  int64_t lastInsertRowid() const { return sqlite3_last_insert_rowid(db_.get()); }

 private:
  explicit Database(UniqueSqlite db) : db_(std::move(db)) {}

  struct KeptStatement {
    UniqueStatement statement;
    bool inUse = false;  // lent to a live Statement
  };
  struct SqlHash {
    using is_transparent = void;
    size_t operator()(std::string_view sql) const { return std::hash<std::string_view>{}(sql); }
  };
  // Texts beyond this many are prepared afresh on every use.
  static constexpr size_t kMaxKeptStatements = 64;

  UniqueSqlite db_;
  // After db_: the kept statements are finalized before the connection
  // closes. A Statement points into a node of the map, which stays where it
  // is when the map grows or moves with the Database.
  std::unordered_map<std::string, KeptStatement, SqlHash, std::equal_to<>> kept_;
};

class Statement {
 public:
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
  friend class Database;
  Statement(Database& db, BorrowedStatement statement) : db_(&db), statement_(std::move(statement)) {}

  Database* db_;
  BorrowedStatement statement_;
  bool failed_ = false;
};

// BEGIN IMMEDIATE on construction; ROLLBACK on destruction unless commit()
// succeeded. began() is false when BEGIN itself failed (the record is in
// the error slot given to the constructor).
class Transaction {
 public:
  enum class Depends { kOnDeferredChanges, kOnNothingBefore };
  Transaction(Database& db, sl::Error* error, Depends depends = Depends::kOnDeferredChanges);
  ~Transaction();
  Transaction(const Transaction&) = delete;
  Transaction& operator=(const Transaction&) = delete;

  bool began() const { return began_; }
  bool commit(sl::Error* error);

 private:
  Database& db_;
  Depends depends_;
  bool began_ = false;
  bool committed_ = false;
};

}  // namespace rg
