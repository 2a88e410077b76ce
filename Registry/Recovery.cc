// Recovery at open: every operation still recorded is either undone (not
// marked done) or finished (marked done). Each step can be repeated, so a
// crash during recovery is recovered from at the next open.

#include "FileManager/SLFileManager.h"
#include "Registry/EmbeddedRegistry.h"
#include "Registry/Moves.h"
#include "Support/Errors.h"
#include "Support/Log.h"

namespace {

constexpr char kFunctionName[] = "-[EmbeddedRegistry recover]";

struct OperationRow {
  std::string packagePath;
  std::string newBundleContainer;
  std::string oldBundleContainer;
  std::vector<rg::Move> moves;  // in the order they were made
  std::vector<std::string> madePaths;
};

std::optional<OperationRow> loadOperation(rg::Database& db, int64_t operation, sl::Error* error) {
  OperationRow row;
  std::optional<rg::Statement> head = db.prepare(
      "SELECT package_path, new_bundle_container, old_bundle_container FROM operations WHERE id = ?", error);
  if (!head) return std::nullopt;
  head->bind(1, operation);
  if (!head->step(error)) return std::nullopt;
  row.packagePath = head->text(0).value_or("");
  row.newBundleContainer = head->text(1).value_or("");
  row.oldBundleContainer = head->text(2).value_or("");
  std::optional<rg::Statement> moves =
      db.prepare("SELECT source, destination FROM operation_moves WHERE operation = ? ORDER BY seq", error);
  if (!moves) return std::nullopt;
  moves->bind(1, operation);
  while (moves->step(error)) row.moves.push_back({moves->text(0).value_or(""), moves->text(1).value_or("")});
  if (moves->failed()) return std::nullopt;
  std::optional<rg::Statement> paths = db.prepare("SELECT path FROM operation_paths WHERE operation = ?", error);
  if (!paths) return std::nullopt;
  paths->bind(1, operation);
  while (paths->step(error)) row.madePaths.push_back(paths->text(0).value_or(""));
  if (paths->failed()) return std::nullopt;
  return row;
}

bool deleteOperation(rg::Database& db, int64_t operation, sl::Error* error) {
  std::optional<rg::Statement> statement = db.prepare("DELETE FROM operations WHERE id = ?", error);
  return statement && statement->bind(1, operation).run(error);
}

// The deletion that ends a finished operation. Lost to a crash, it costs only
// a repeat of the cleanup at the next open (every step of it can be
// repeated), so its commit is not flushed: the next durable commit carries
// it to the disk.
bool deleteFinishedOperation(rg::Database& db, int64_t operation, sl::Error* error) {
  if (!db.exec("PRAGMA synchronous=NORMAL", error)) return false;
  const bool deleted = deleteOperation(db, operation, error);
  sl::Error restoreError;
  if (!db.exec("PRAGMA synchronous=FULL", &restoreError)) {
    // Every later commit would go undurable: that is this call's failure.
    return deleted ? sl::fail(error, restoreError) : false;
  }
  return deleted;
}

// Paths recorded by the registry itself are never empty and always below a
// containers root; this refuses anything else before a tree is removed.
bool removeRecorded(const std::string& path, sl::Error* error) {
  if (path.empty() || path == "/") return true;
  return rg::removeTree(path, error);
}

}  // namespace

bool EmbeddedRegistry::recover(sl::Error* error) {
  std::lock_guard lock(mutex_);
  std::vector<std::pair<int64_t, bool>> pending;
  {
    std::optional<rg::Statement> statement = db_.prepare("SELECT id, done FROM operations ORDER BY id", error);
    if (!statement) return false;
    while (statement->step(error)) pending.emplace_back(statement->integer(0), statement->integer(1) != 0);
    if (statement->failed()) return false;
  }
  bool ok = true;
  for (const auto& [operation, done] : pending) {
    sl::Error operationError;
    if (!recoverOperation(operation, done, &operationError)) {
      SLLog(sl::kLogLevelError, kFunctionName, "Failed to recover operation %lld: %@",
            static_cast<long long>(operation), operationError);
      if (ok) sl::fail(error, operationError);
      ok = false;
    }
  }
  return ok;
}

bool EmbeddedRegistry::recoverOperation(int64_t operation, bool done, sl::Error* error) {
  if (done) return finishOperation(operation, error);
  std::optional<OperationRow> row = loadOperation(db_, operation, error);
  if (!row) return false;
  // Backwards: the application, moved first, comes back last.
  for (auto move = row->moves.rbegin(); move != row->moves.rend(); ++move) {
    if (!rg::undoMove(*move, row->packagePath, error)) return false;
  }
  if (!removeRecorded(row->newBundleContainer, error)) return false;
  for (const std::string& path : row->madePaths) {
    if (!removeRecorded(path, error)) return false;
  }
  return deleteOperation(db_, operation, error);
}

bool EmbeddedRegistry::finishOperation(int64_t operation, sl::Error* error) {
  std::optional<OperationRow> row = loadOperation(db_, operation, error);
  if (!row) return false;
  if (row->oldBundleContainer != row->newBundleContainer && !removeRecorded(row->oldBundleContainer, error)) {
    return false;
  }
  if (!removeRecorded(row->packagePath, error)) return false;
  for (const rg::Move& move : row->moves) {
    if (!rg::removeTrash(move, row->packagePath, error)) return false;
  }
  return deleteFinishedOperation(db_, operation, error);
}
