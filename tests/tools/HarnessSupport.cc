#include "tools/HarnessSupport.h"

#include <dirent.h>
#include <sqlite3.h>
#include <sys/stat.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <sstream>

#include "tools/ProgramRunner.h"

namespace sl::harness {

namespace {

constexpr char kMarkerName[] = "com.vantor.stowline.container_migrator.plist";
constexpr char kDatabase[] = "/private/var/stowd/Library/Registry/registry.sqlite";
constexpr const char* kContainerRoots[] = {"/private/var/stowd/Containers/Bundle", "/private/var/mobile/Containers/Data",
                                           "/private/var/mobile/Containers/Shared"};
constexpr int kKilled = 128 + 9;  // runProgram's status for SIGKILL

std::string slurp(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  std::ostringstream text;
  text << in.rdbuf();
  return text.str();
}

std::vector<std::string> lines(const std::string& text) {
  std::vector<std::string> out;
  std::istringstream in(text);
  for (std::string line; std::getline(in, line);) out.push_back(line);
  return out;
}

// At most `limit` bytes of `text`, from its end.
std::string tail(const std::string& text, size_t limit) {
  return text.size() <= limit ? text : "[...]" + text.substr(text.size() - limit);
}

bool exists(const std::string& path) {
  struct stat st;
  return ::lstat(path.c_str(), &st) == 0;
}

int64_t countEntries(const std::string& directory) {
  DIR* dir = ::opendir(directory.c_str());
  if (dir == nullptr) return -1;
  int64_t count = 0;
  while (const dirent* entry = ::readdir(dir)) {
    if (std::strcmp(entry->d_name, ".") != 0 && std::strcmp(entry->d_name, "..") != 0) ++count;
  }
  ::closedir(dir);
  return count;
}

struct SqliteCloser {
  void operator()(sqlite3* db) const { sqlite3_close_v2(db); }
};

// The first column of the first row of `sql`, as text; empty on failure
// with the reason in *why.
std::string query(sqlite3* db, const char* sql, std::string* why) {
  sqlite3_stmt* statement = nullptr;
  if (sqlite3_prepare_v2(db, sql, -1, &statement, nullptr) != SQLITE_OK) {
    *why = std::string(sql) + ": " + sqlite3_errmsg(db);
    return {};
  }
  std::string value;
  const int rc = sqlite3_step(statement);
  if (rc == SQLITE_ROW) {
    const unsigned char* text = sqlite3_column_text(statement, 0);
    value = text ? reinterpret_cast<const char*>(text) : "";
  } else {
    *why = std::string(sql) + ": " + sqlite3_errmsg(db);
  }
  sqlite3_finalize(statement);
  return value;
}

// A path from a log message: "%@" of a URL prints "file://" and a trailing
// slash for a directory.
std::string plainPath(std::string text) {
  if (text.rfind("file://", 0) == 0) text.erase(0, 7);
  while (text.size() > 1 && text.back() == '/') text.pop_back();
  return text;
}

}  // namespace

std::vector<uint64_t> samplePoints(uint64_t total, uint64_t stride, uint64_t seed) {
  std::vector<uint64_t> points;
  if (total == 0) return points;
  if (stride <= 1) {
    for (uint64_t k = 1; k <= total; ++k) points.push_back(k);
    return points;
  }
  points.push_back(1);
  for (uint64_t k = 1 + seed % stride; k <= total; k += stride) points.push_back(k);
  points.push_back(total);
  std::sort(points.begin(), points.end());
  points.erase(std::unique(points.begin(), points.end()), points.end());
  return points;
}

Harness::Harness(Config config) : config_(std::move(config)) {
  pristine_ = config_.workDirectory + "/pristine";
  root_ = config_.workDirectory + "/root";
  manifest_ = config_.workDirectory + "/manifest.json";
  logFile_ = config_.workDirectory + "/migrate.log";
}

std::string Harness::operation(uint64_t k) const {
  return k >= 1 && k <= trace_.size() ? trace_[k - 1] : "(past the last operation of the clean run)";
}

std::string Harness::renameOperation(uint64_t k) const {
  return k >= 1 && k <= renameOrdinals_.size() ? operation(renameOrdinals_[k - 1])
                                               : "(past the last rename of the clean run)";
}

bool Harness::freshCopy(std::string* failure) {
  std::error_code ec;
  std::filesystem::remove_all(root_, ec);
  if (ec) {
    *failure = "cannot remove " + root_ + ": " + ec.message();
    return false;
  }
  const test::ProgramResult copy = test::runProgram({"/bin/cp", "-a", pristine_, root_});
  if (copy.status != 0) {
    *failure = "cp -a " + pristine_ + " " + root_ + " failed: " + copy.err;
    return false;
  }
  return true;
}

Harness::Step Harness::migrate(const std::string& name, const std::string& fault, const std::string& traceFile) {
  std::filesystem::remove(logFile_);
  const std::vector<std::string> env = {
      "NO_COLOR", "STOWLINE_ROOT", fault.empty() ? "STOWLINE_FAULT" : "STOWLINE_FAULT=" + fault,
      traceFile.empty() ? "STOWLINE_FAULT_TRACE" : "STOWLINE_FAULT_TRACE=" + traceFile};
  const test::ProgramResult result = test::runProgram(
      {config_.stowline, "migrate", "--root", root_, "--no-progress", "--log-file", logFile_}, env);
  Step step{name, result.status, result.out, result.err};
  step.out += "--- log ---\n" + slurp(logFile_);
  return step;
}

std::string Harness::describe(const std::string& headline, const std::vector<Step>& steps) const {
  std::string text = headline + "\n";
  for (const Step& step : steps) {
    text += "== " + step.name + ": status " + std::to_string(step.status) + "\n";
    text += tail(step.out, 6000);
    if (!step.err.empty()) text += "-- stderr --\n" + tail(step.err, 3000);
  }
  return text;
}

std::string Harness::checkMigrated() {
  std::string problems;
  const test::ProgramResult verify = test::runProgram({config_.stowline, "verify", "--root", root_, manifest_},
                                                      {"NO_COLOR", "STOWLINE_ROOT", "STOWLINE_FAULT", "STOWLINE_FAULT_TRACE"});
  if (verify.status != 0) problems += "verify: status " + std::to_string(verify.status) + "\n" + tail(verify.out, 4000) + verify.err;

  sqlite3* raw = nullptr;
  const std::string database = root_ + kDatabase;
  const int rc = sqlite3_open_v2(database.c_str(), &raw, SQLITE_OPEN_READWRITE, nullptr);
  std::unique_ptr<sqlite3, SqliteCloser> db(raw);
  if (rc != SQLITE_OK) return problems + "cannot open " + database + ": " + sqlite3_errstr(rc) + "\n";
  std::string why;
  const std::string integrity = query(db.get(), "PRAGMA integrity_check", &why);
  if (integrity != "ok") problems += "PRAGMA integrity_check: " + (integrity.empty() ? why : integrity) + "\n";
  const std::string pending = query(db.get(), "SELECT count(*) FROM operations", &why);
  if (pending != "0") problems += "installs still in flight in the registry: " + (pending.empty() ? why : pending) + "\n";

  std::vector<int64_t> counts;
  for (const char* sql : {"SELECT count(*) FROM applications", "SELECT count(*) FROM groups",
                          "SELECT count(*) FROM safe_harbors"}) {
    const std::string value = query(db.get(), sql, &why);
    counts.push_back(value.empty() ? -1 : std::stoll(value));
  }
  for (const char* directory : kContainerRoots) counts.push_back(countEntries(root_ + directory));
  if (baseline_.empty()) {
    baseline_ = counts;
  } else if (counts != baseline_) {
    static const char* const kNames[] = {"applications", "groups", "safe harbors", "bundle containers",
                                         "data containers", "group containers"};
    for (size_t i = 0; i < counts.size(); ++i) {
      if (counts[i] != baseline_[i]) {
        problems += std::string(kNames[i]) + ": " + std::to_string(counts[i]) + ", the clean run has " +
                    std::to_string(baseline_[i]) + "\n";
      }
    }
  }
  return problems;
}

std::string Harness::checkMarkers(const std::string& log) {
  std::string problems;
  bool markerFailed = false;
  for (const std::string& line : lines(log)) {
    if (line.find("SLAppMigrator: Migrating ") != std::string::npos) {
      markerFailed = false;
    } else if (line.find("SLAppMigrator: Failed to write out container marker") != std::string::npos) {
      markerFailed = true;
    } else if (const size_t at = line.find("SLAppMigrator: Migration of "); at != std::string::npos) {
      // "... of ID at BUNDLE failed": the container is the bundle's parent.
      const size_t bundleAt = line.find(" at ", at);
      const size_t end = line.rfind(" failed");
      if (bundleAt == std::string::npos || end == std::string::npos || end < bundleAt) continue;
      const std::string bundle = plainPath(line.substr(bundleAt + 4, end - bundleAt - 4));
      const std::string container = bundle.substr(0, bundle.rfind('/'));
      if (!markerFailed && exists(container) && !exists(container + "/" + kMarkerName)) {
        problems += "the failed container " + container + " has no marker\n";
      }
    }
  }
  return problems;
}

bool Harness::prepare(std::string* failure) {
  std::error_code ec;
  std::filesystem::create_directories(config_.workDirectory, ec);
  std::filesystem::remove_all(root_, ec);
  std::filesystem::remove_all(pristine_, ec);
  std::filesystem::create_directories(root_, ec);
  if (ec) {
    *failure = "cannot make " + root_ + ": " + ec.message();
    return false;
  }
  std::vector<std::string> fixture = {config_.stowline, "fixture", "--root", root_};
  fixture.insert(fixture.end(), config_.fixtureArgs.begin(), config_.fixtureArgs.end());
  const test::ProgramResult written = test::runProgram(fixture, {"STOWLINE_ROOT", "STOWLINE_FAULT"});
  if (written.status != 0) {
    *failure = "stowline fixture failed: " + written.out + written.err;
    return false;
  }
  const test::ProgramResult manifest =
      test::runProgram({config_.stowline, "manifest", "--root", root_, "--output", manifest_}, {"STOWLINE_ROOT"});
  if (manifest.status != 0) {
    *failure = "stowline manifest failed: " + manifest.err;
    return false;
  }
  const test::ProgramResult copy = test::runProgram({"/bin/cp", "-a", root_, pristine_});
  if (copy.status != 0) {
    *failure = "cp -a failed: " + copy.err;
    return false;
  }

  // The clean run, traced.
  const std::string traceFile = config_.workDirectory + "/trace.txt";
  std::filesystem::remove(traceFile, ec);
  if (!freshCopy(failure)) return false;
  const Step clean = migrate("clean traced migration", "", traceFile);
  trace_ = lines(slurp(traceFile));
  for (uint64_t i = 0; i < trace_.size(); ++i) {
    if (trace_[i].find(" rename ") != std::string::npos) renameOrdinals_.push_back(i + 1);
  }
  if (clean.status != 0) {
    *failure = describe("the clean migration of the fixture failed", {clean});
    return false;
  }
  if (trace_.empty()) {
    *failure = "the clean migration traced no operation: is this a build without STOWLINE_FAULT_INJECTION?";
    return false;
  }
  baseline_.clear();
  if (const std::string problems = checkMigrated(); !problems.empty()) {
    *failure = describe("the clean migration of the fixture does not pass the checks:\n" + problems, {clean});
    return false;
  }
  return true;
}

Outcome Harness::crashAt(uint64_t k, std::optional<uint64_t> resumeKill, Tally* tally) {
  ++tally->runs;
  const std::string headline = "crash point " + std::to_string(k) + " of " + std::to_string(operations()) +
                               (resumeKill ? ", resume killed at " + std::to_string(*resumeKill) : std::string()) +
                               ": operation " + operation(k);
  std::string failure;
  if (!freshCopy(&failure)) return {false, headline + "\n" + failure};
  std::vector<Step> steps;
  auto fail = [&](const std::string& why) {
    Outcome outcome{false, describe(headline + "\n" + why, steps)};
    tally->failures.push_back(outcome.report);
    return outcome;
  };

  steps.push_back(migrate("migrate, killed at " + std::to_string(k), "kill@" + std::to_string(k)));
  if (steps.back().status == kKilled) {
    ++tally->killed;
  } else if (steps.back().status != 0) {
    return fail("the run to be killed ended otherwise");
  }
  if (resumeKill) {
    steps.push_back(migrate("resume, killed at " + std::to_string(*resumeKill), "kill@" + std::to_string(*resumeKill)));
    if (steps.back().status == kKilled) {
      ++tally->resumeCrashes;
    } else if (steps.back().status != 0) {
      return fail("the resume to be killed returned false or failed");
    }
  }
  steps.push_back(migrate("clean resume", ""));
  if (steps.back().status != 0) return fail("the clean resume did not return true");
  if (const std::string problems = checkMigrated(); !problems.empty()) return fail(problems);
  ++tally->passed;
  return {};
}

Outcome Harness::injectAt(const std::string& errnoName, uint64_t k, bool persistent, bool renamesOnly, Tally* tally) {
  ++tally->runs;
  const std::string plan =
      errnoName + "@" + std::to_string(k) + (persistent ? "+" : "") + (renamesOnly ? ":rename" : "");
  const std::string headline =
      "STOWLINE_FAULT=" + plan + ": operation " + (renamesOnly ? renameOperation(k) : operation(k));
  std::string failure;
  if (!freshCopy(&failure)) return {false, headline + "\n" + failure};
  std::vector<Step> steps;
  auto fail = [&](const std::string& why) {
    Outcome outcome{false, describe(headline + "\n" + why, steps)};
    tally->failures.push_back(outcome.report);
    return outcome;
  };

  steps.push_back(migrate("faulty run", plan));
  const Step& faulty = steps.back();
  const bool sanitizerReport = faulty.err.find("Sanitizer") != std::string::npos ||
                               faulty.err.find("runtime error:") != std::string::npos;
  if (sanitizerReport) return fail("a sanitizer report");
  if (faulty.status == 0) {
    ++tally->faultyTrue;
    if (const std::string problems = checkMigrated(); !problems.empty()) {
      return fail("the faulty run returned true, but:\n" + problems);
    }
  } else if (faulty.status == 1) {
    ++tally->faultyFalse;
    if (const std::string problems = checkMarkers(faulty.out); !problems.empty()) return fail(problems);
  } else if (faulty.status == 2 && faulty.err.find("cannot open the registry") != std::string::npos) {
    ++tally->refused;  // refused before anything of the old layout was touched
  } else {
    return fail("the faulty run crashed or failed to start");
  }
  steps.push_back(migrate("clean rerun", ""));
  if (steps.back().status != 0) return fail("the clean rerun did not return true");
  if (const std::string problems = checkMigrated(); !problems.empty()) return fail(problems);
  ++tally->passed;
  return {};
}

}  // namespace sl::harness
