#include "Registry/Database.h"

#include "Platform/Format.h"
#include "Registry/CountedVfs.h"
#include "Registry/EmbeddedRegistry.h"
#include "Support/Errors.h"

namespace rg {

namespace {

constexpr char kFunctionName[] = "rg::Database";

sl::Error sqliteError(sqlite3* db, int code, std::string_view what) {
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

std::optional<Statement> Database::prepare(std::string_view sql, sl::Error* error) {
  sqlite3_stmt* raw = nullptr;
  const int rc = sqlite3_prepare_v2(db_.get(), sql.data(), static_cast<int>(sql.size()), &raw, nullptr);
  UniqueStatement statement(raw);
  if (rc != SQLITE_OK) {
    sl::fail(error, sqliteError(db_.get(), rc, std::string(sql)));
    return std::nullopt;
  }
  return Statement(*this, std::move(statement));
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

Transaction::Transaction(Database& db, sl::Error* error) : db_(db) { began_ = db_.exec("BEGIN IMMEDIATE", error); }

Transaction::~Transaction() {
  if (began_ && !committed_) sqlite3_exec(db_.handle(), "ROLLBACK", nullptr, nullptr, nullptr);
}

bool Transaction::commit(sl::Error* error) {
  if (!began_) return false;
  if (!db_.exec("COMMIT", error)) return false;
  committed_ = true;
  return true;
}

}  // namespace rg
