#include "Registry/Database.h"

#include "Platform/AtomicFile.h"
#include "Platform/Format.h"
#include "Registry/CountedVfs.h"
#include "Registry/EmbeddedRegistry.h"
#include "Support/Errors.h"

namespace rg {

namespace {

constexpr char kFunctionName[] = "rg::Database";

// Why this thread's last commit was turned down by flushBeforeCommit.
thread_local sl::Error tCommitFlushError;
// Set while a transaction that depends on nothing before it commits.
thread_local bool tCommitIndependent = false;

// Nothing is committed while a flush that this thread deferred is pending:
// what a transaction records (a container made, an item moved) may be among
// it. A failed flush turns the commit into a rollback.
int flushBeforeCommit(void*) {
  if (tCommitIndependent) return 0;
  sl::Error flushError;
  if (sl::flushDeferredSyncs(&flushError)) return 0;
  tCommitFlushError = flushError;
  return 1;
}

sl::Error sqliteError(sqlite3* db, int code, std::string_view what) {
  if (code == SQLITE_CONSTRAINT_COMMITHOOK && !tCommitFlushError.isNull()) {
    return _CreateError(kFunctionName, __LINE__, RGErrorDomain, kRGDatabaseError,
                        "%s failed: what it records is not on disk: %@", std::string(what),
                        tCommitFlushError.localizedDescription());
  }
  const char* message = db != nullptr ? sqlite3_errmsg(db) : sqlite3_errstr(code);
  return _CreateError(kFunctionName, __LINE__, RGErrorDomain, kRGDatabaseError, "%s failed: %s (%d)",
                      std::string(what), message, code);
}

}  // namespace

std::optional<Database> Database::open(const std::string& path, sl::Error* error) {
  sqlite3* raw = nullptr;
  const int rc = sqlite3_open_v2(path.c_str(), &raw, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_NOMUTEX,
                                 countedVfsName());
  UniqueSqlite db(raw);  // a handle is returned even when the open fails
  if (rc != SQLITE_OK) {
    sl::fail(error, sqliteError(db.get(), rc, "open of " + path));
    return std::nullopt;
  }
  sqlite3_extended_result_codes(db.get(), 1);
  sqlite3_commit_hook(db.get(), flushBeforeCommit, nullptr);
  Database database(std::move(db));
  if (!database.exec("PRAGMA journal_mode=WAL; PRAGMA synchronous=FULL; PRAGMA foreign_keys=ON;"
                     "PRAGMA busy_timeout=5000;",
                     error)) {
    return std::nullopt;
  }
  return database;
}

bool Database::exec(std::string_view sql, sl::Error* error) {
  const std::string text(sql);
  const int rc = sqlite3_exec(db_.get(), text.c_str(), nullptr, nullptr, nullptr);
  if (rc != SQLITE_OK) return sl::fail(error, sqliteError(db_.get(), rc, text));
  return true;
}

void StatementRelease::operator()(sqlite3_stmt* statement) const {
  if (inUse == nullptr) {
    sqlite3_finalize(statement);
    return;
  }
  // The reset answers the last step's error again; that step reported it.
  sqlite3_reset(statement);
  sqlite3_clear_bindings(statement);
  *inUse = false;
}

std::optional<Statement> Database::prepare(std::string_view sql, sl::Error* error) {
  const auto found = kept_.find(sql);
  if (found != kept_.end() && !found->second.inUse) {
    found->second.inUse = true;
    return Statement(*this, BorrowedStatement(found->second.statement.get(), StatementRelease{&found->second.inUse}));
  }

  // A text seen for the first time is kept; a nested use of a text whose
  // statement is lent gets its own.
  const bool keep = found == kept_.end() && kept_.size() < kMaxKeptStatements;
  sqlite3_stmt* raw = nullptr;
  const int rc = sqlite3_prepare_v3(db_.get(), sql.data(), static_cast<int>(sql.size()),
                                    keep ? SQLITE_PREPARE_PERSISTENT : 0, &raw, nullptr);
  UniqueStatement statement(raw);
  if (rc != SQLITE_OK) {
    sl::fail(error, sqliteError(db_.get(), rc, std::string(sql)));
    return std::nullopt;
  }
  if (!keep || statement == nullptr) return Statement(*this, BorrowedStatement(statement.release()));
  KeptStatement& kept = kept_.emplace(std::string(sql), KeptStatement{std::move(statement), true}).first->second;
  return Statement(*this, BorrowedStatement(kept.statement.get(), StatementRelease{&kept.inUse}));
}

sl::Error Database::lastError(std::string_view what) const {
  return sqliteError(db_.get(), sqlite3_extended_errcode(db_.get()), what);
}

Statement& Statement::bind(int index, std::string_view text) {
  sqlite3_bind_text(statement_.get(), index, text.data(), static_cast<int>(text.size()), SQLITE_TRANSIENT);
  return *this;
}

Statement& Statement::bind(int index, const std::optional<std::string>& text) {
  if (text) return bind(index, std::string_view(*text));
  sqlite3_bind_null(statement_.get(), index);
  return *this;
}

Statement& Statement::bind(int index, int64_t value) {
  sqlite3_bind_int64(statement_.get(), index, value);
  return *this;
}

bool Statement::step(sl::Error* error) {
  const int rc = sqlite3_step(statement_.get());
  if (rc == SQLITE_ROW) return true;
  if (rc != SQLITE_DONE) {
    failed_ = true;
    sl::fail(error, db_->lastError(sqlite3_sql(statement_.get())));
  }
  return false;
}

bool Statement::run(sl::Error* error) {
  while (step(error)) {
  }
  return !failed_;
}

std::optional<std::string> Statement::text(int column) const {
  const unsigned char* value = sqlite3_column_text(statement_.get(), column);
  if (value == nullptr) return std::nullopt;
  return std::string(reinterpret_cast<const char*>(value),
                     static_cast<size_t>(sqlite3_column_bytes(statement_.get(), column)));
}

Transaction::Transaction(Database& db, sl::Error* error, Depends depends) : db_(db), depends_(depends) {
  began_ = db_.exec("BEGIN IMMEDIATE", error);
}

Transaction::~Transaction() {
  if (began_ && !committed_) sqlite3_exec(db_.handle(), "ROLLBACK", nullptr, nullptr, nullptr);
}

bool Transaction::commit(sl::Error* error) {
  if (!began_) return false;
  tCommitIndependent = depends_ == Depends::kOnNothingBefore;
  const bool done = db_.exec("COMMIT", error);
  tCommitIndependent = false;
  if (!done) return false;
  committed_ = true;
  return true;
}

}  // namespace rg
