#include "tools/HarnessSupport.h"

#include <dirent.h>
#include <sqlite3.h>
#include <sys/stat.h>

#include <algorithm>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <map>
#include <sstream>

#include "Platform/PropertyList.h"
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

// The identifiers whose bundle install failed in a migration's log, with
// their bundle paths: within the section that a "Migrating ID at BUNDLE"
// line opens, one of the messages with which staging and installing the
// bundle gives up (the migrator treats a failed staging as a failed
// install: the data has moved, the container goes).
std::map<std::string, std::string> failedBundleInstalls(const std::string& log) {
  static constexpr char kMigrating[] = "SLAppMigrator: Migrating ";
  static constexpr const char* kGaveUp[] = {
      "SLAppMigrator: Failed to install ", "SLAppMigrator: Failed to create ",
      "SLAppMigrator: Failed to move bundle from ", "SLAppMigrator: Failed to move vpn bundle from ",
      "SLAppMigrator: Failed to move app metadata from "};
  std::map<std::string, std::string> failed;
  std::string identifier, bundle;
  for (const std::string& line : lines(log)) {
    if (const size_t at = line.find(kMigrating); at != std::string::npos) {
      const std::string rest = line.substr(at + std::strlen(kMigrating));
      const size_t separator = rest.find(" at ");
      // "Migrating group container ..." and "Migrating safe harbor ..." do
      // not open an application's section.
      if (separator == std::string::npos || rest.find(' ') != separator) {
        identifier.clear();
        continue;
      }
      identifier = rest.substr(0, separator);
      bundle = plainPath(rest.substr(separator + 4));
    } else if (!identifier.empty() && line.find("-[SLAppMigrator _stageAndInstallBundleAtURL:") != std::string::npos &&
               std::any_of(std::begin(kGaveUp), std::end(kGaveUp),
                           [&](const char* message) { return line.find(message) != std::string::npos; })) {
      failed[identifier] = bundle;
    }
  }
  return failed;
}

// The flat object of strings under `key` in the manifest's JSON (the
// program writes "/" unescaped and no other escapes into paths and group
// names); empty when it is not there.
std::map<std::string, std::string> stringObject(const std::string& json, const std::string& key) {
  std::map<std::string, std::string> out;
  size_t at = json.find("\"" + key + "\":{");
  if (at == std::string::npos) return out;
  at += key.size() + 4;
  auto readString = [&](std::string* value) {
    if (at >= json.size() || json[at] != '"') return false;
    value->clear();
    for (++at; at < json.size() && json[at] != '"'; ++at) {
      if (json[at] == '\\' && at + 1 < json.size()) ++at;
      value->push_back(json[at]);
    }
    return at++ < json.size();
  };
  std::string name, value;
  while (readString(&name) && at < json.size() && json[at++] == ':' && readString(&value)) {
    out[name] = value;
    if (at >= json.size() || json[at] != ',') break;
    ++at;
  }
  return out;
}

// What differs between the item at `relative` below `want` (pristine) and
// below `have`: type, permission bits, size, bytes or link target. Empty
// when they agree.
std::string itemDifference(const std::string& want, const std::string& have, const std::string& relative) {
  struct stat a, b;
  const std::string wanted = want + "/" + relative, found = have + "/" + relative;
  if (::lstat(wanted.c_str(), &a) != 0) return "unreadable in the pristine copy";
  if (::lstat(found.c_str(), &b) != 0) {
    const int lstatErrno = errno;
    return std::string("not at its old path: ") + std::strerror(lstatErrno);
  }
  if ((a.st_mode & S_IFMT) != (b.st_mode & S_IFMT)) return "its type changed";
  if ((a.st_mode & 07777) != (b.st_mode & 07777)) return "its mode changed";
  if (S_ISREG(a.st_mode) && (a.st_size != b.st_size || slurp(wanted) != slurp(found))) return "its content changed";
  if (S_ISLNK(a.st_mode)) {
    std::error_code ec1, ec2;
    if (std::filesystem::read_symlink(wanted, ec1) != std::filesystem::read_symlink(found, ec2)) {
      return "its target changed";
    }
  }
  return {};
}

// True when every migration that `rerun` reports failed is of a container
// whose removal the `faulty` run logged as failed, and failed at the
// install of its bundle (which that removal had already taken).
bool rerunFailedOnlyOnPartlyRemovedContainers(const std::string& faulty, const std::string& rerun) {
  static constexpr char kFailed[] = "SLAppMigrator: Migration of ";
  const std::map<std::string, std::string> installs = failedBundleInstalls(rerun);
  bool any = false;
  for (const std::string& line : lines(rerun)) {
    const size_t at = line.find(kFailed);
    if (at == std::string::npos) continue;
    const size_t start = at + std::strlen(kFailed);
    const size_t bundleAt = line.find(" at ", start);
    const size_t end = line.rfind(" failed");
    if (bundleAt == std::string::npos || end == std::string::npos || end < bundleAt) return false;
    const std::string identifier = line.substr(start, bundleAt - start);
    const std::string bundle = line.substr(bundleAt + 4, end - bundleAt - 4);
    const std::string container = bundle.substr(0, bundle.rfind('/'));
    const std::string removalFailed = "SLAppMigrator: Failed to remove container file://" + container + "/ : ";
    const std::string nothingStaged = "Package " + container + "/Staging holds no application in Payload";
    if (installs.count(identifier) == 0 || faulty.find(removalFailed) == std::string::npos ||
        rerun.find(nothingStaged) == std::string::npos) {
      return false;
    }
    any = true;
  }
  return any;
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

std::string Harness::checkMigrated(const LeftBehind& left) {
  std::string problems;
  const test::ProgramResult verify = test::runProgram({config_.stowline, "verify", "--root", root_, manifest_},
                                                      {"NO_COLOR", "STOWLINE_ROOT", "STOWLINE_FAULT", "STOWLINE_FAULT_TRACE"});
  if (verify.status != 0) {
    // Lines "KIND: group OWNER: PATH: DETAIL", then the summary. An item
    // left behind may be missing from the new layout and, for the same
    // reason, still in the old one ("duplicated"); nothing else.
    std::string unexpected;
    const std::vector<std::string> reported = lines(verify.out);
    for (size_t i = 0; i + 1 < reported.size(); ++i) {
      const std::string& line = reported[i];
      const size_t kindEnd = line.find(": group ");
      const std::string kind = kindEnd == std::string::npos ? std::string() : line.substr(0, kindEnd);
      const size_t ownerEnd = kind.empty() ? std::string::npos : line.find(": ", kindEnd + 8);
      bool accepted = false;
      if (verify.status == 1 && (kind == "missing" || kind == "duplicated") && ownerEnd != std::string::npos) {
        const auto group = left.find(line.substr(kindEnd + 8, ownerEnd - kindEnd - 8));
        const std::string path = line.substr(ownerEnd + 2);
        accepted = group != left.end() &&
                   (group->second.empty() || group->second.count(path.substr(0, path.find_first_of("/:"))) != 0);
      }
      if (!accepted) unexpected += line + "\n";
    }
    if (!unexpected.empty() || verify.status != 1 || reported.empty()) {
      problems += "verify: status " + std::to_string(verify.status) + "\n" +
                  tail(unexpected.empty() ? verify.out : unexpected, 4000) + verify.err;
    }
  }

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
  } else {
    const auto whole = std::count_if(left.begin(), left.end(), [](const auto& group) { return group.second.empty(); });
    std::vector<int64_t> expected = baseline_;
    expected[1] -= whole;  // groups
    expected[5] -= whole;  // group containers
    static const char* const kNames[] = {"applications", "groups", "safe harbors", "bundle containers",
                                         "data containers", "group containers"};
    for (size_t i = 0; i < counts.size(); ++i) {
      if (counts[i] != expected[i]) {
        problems += std::string(kNames[i]) + ": " + std::to_string(counts[i]) + ", expected " +
                    std::to_string(expected[i]) + " as after the clean run" +
                    (whole == 0 ? "" : " less the groups left behind") + "\n";
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

std::string Harness::compareWithPristine(const std::string& old, const std::string& relative) {
  const std::string pristine = pristine_ + old.substr(root_.size());
  std::string wrong;
  auto compare = [&](const std::string& item) {
    if (const std::string why = itemDifference(pristine, old, item); !why.empty()) {
      wrong += "  " + item + ": " + why + "\n";
    }
  };
  if (!relative.empty()) compare(relative);
  const std::string top = relative.empty() ? pristine : pristine + "/" + relative;
  std::error_code ec;
  if (!relative.empty() && !std::filesystem::is_directory(std::filesystem::symlink_status(top, ec))) return wrong;
  for (std::filesystem::recursive_directory_iterator it(top, ec), end; !ec && it != end; it.increment(ec)) {
    compare(it->path().string().substr(pristine.size() + 1));
  }
  if (ec) wrong += "  cannot list " + top + ": " + ec.message() + "\n";
  return wrong;
}

void Harness::addStrandedGroups(const std::string& log, LeftBehind* left, std::string* problems) {
  for (const auto& [identifier, bundle] : failedBundleInstalls(log)) {
    if (bundle.rfind(root_ + "/", 0) != 0) continue;
    const std::string info = pristine_ + bundle.substr(root_.size()) + "/Info.plist";
    const sl::Array groups =
        sl::dictionaryWithContentsOfURL(sl::URL::fileURLWithPath(info, false)).get("PBApplicationGroups").asArray();
    if (groups.isNull()) continue;
    for (const sl::Value& value : groups) {
      const std::string group = value.asString().isNull() ? std::string() : value.asString().str();
      const auto old = oldGroupContainers_.find(group);
      // Gone from the old layout: another application took it along.
      if (old == oldGroupContainers_.end() || !exists(old->second)) continue;
      if (const std::string wrong = compareWithPristine(old->second, ""); !wrong.empty()) {
        *problems += "group " + group + " of " + identifier + ", whose install failed, stands in part at " +
                     old->second + ":\n" + wrong;
      } else {
        (*left)[group].clear();
      }
    }
  }
}

void Harness::addItemsLeftInGroups(const std::string& log, LeftBehind* left, std::string* problems) {
  static constexpr char kFailed[] = "SLAppMigrator: Failed to move item ";
  for (const std::string& line : lines(log)) {
    const size_t at = line.find(kFailed);
    const size_t to = at == std::string::npos ? at : line.find(" to ", at + std::strlen(kFailed));
    if (to == std::string::npos) continue;
    const std::string item = plainPath(line.substr(at + std::strlen(kFailed), to - at - std::strlen(kFailed)));
    for (const auto& [group, old] : oldGroupContainers_) {
      if (item.rfind(old + "/", 0) != 0 || !exists(item)) continue;
      const std::string name = item.substr(old.size() + 1);
      const auto known = left->find(group);
      if (known != left->end() && known->second.empty()) continue;  // the whole group stays
      if (const std::string wrong = compareWithPristine(old, name); !wrong.empty()) {
        *problems += "item " + name + " of group " + group + ", whose move failed, stands changed at " + old +
                     ":\n" + wrong;
      } else {
        (*left)[group].insert(name);
      }
    }
  }
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
  oldGroupContainers_ = stringObject(slurp(manifest_), "groupContainers");
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
    std::string leftProblems;
    LeftBehind left;
    addItemsLeftInGroups(faulty.out, &left, &leftProblems);
    if (const std::string problems = checkMigrated(left); !problems.empty() || !leftProblems.empty()) {
      return fail("the faulty run returned true, but:\n" + leftProblems + problems);
    }
  } else if (faulty.status == 1) {
    ++tally->faultyFalse;
    if (const std::string problems = checkMarkers(faulty.out); !problems.empty()) return fail(problems);
  } else if (faulty.status == 2 && faulty.err.find("cannot open the registry") != std::string::npos) {
    ++tally->refused;  // refused before anything of the old layout was touched
  } else {
    return fail("the faulty run crashed or failed to start");
  }
  const bool returnedFalse = faulty.status == 1;
  const std::string faultyLog = faulty.out;
  steps.push_back(migrate("clean rerun", ""));
  if (steps.back().status == 1 && returnedFalse &&
      rerunFailedOnlyOnPartlyRemovedContainers(faultyLog, steps.back().out)) {
    ++tally->secondRerun;
    steps.push_back(migrate("second clean rerun", ""));
  }
  if (steps.back().status != 0) return fail("the clean rerun did not return true");
  // Groups that a failed bundle install left behind stay where they were,
  // accepted only after a run that returned false, whole and unchanged; so
  // do group items whose move failed, unchanged.
  std::string leftProblems;
  LeftBehind left;
  if (returnedFalse) addStrandedGroups(faultyLog, &left, &leftProblems);
  addItemsLeftInGroups(faultyLog, &left, &leftProblems);
  if (const std::string problems = checkMigrated(left); !problems.empty() || !leftProblems.empty()) {
    return fail(leftProblems + problems);
  }
  const auto whole = std::count_if(left.begin(), left.end(), [](const auto& group) { return group.second.empty(); });
  if (whole > 0) ++tally->strandedByDesign;
  if (static_cast<size_t>(whole) < left.size()) ++tally->groupItemsLeft;
  ++tally->passed;
  return {};
}

}  // namespace sl::harness
