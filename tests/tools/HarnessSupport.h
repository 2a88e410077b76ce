// The core of the crash and fault harnesses: a seeded fixture migrated by
// the real stowline program while the fault plans of the mutation layer kill
// it or fail its file-system changes, then resumed and checked.
//
// One Harness owns a scratch directory with three things in it: "pristine"
// (the fixture as written), "root" (the working copy, made anew from
// pristine for every run) and the manifest of the pristine layout. Paths
// inside the old layout's files are absolute, so every run works at the same
// path, "root"; the pristine copy is only ever copied from.
//
// Used by CrashEveryStepTest and InjectedErrorsTest (a sample of the points)
// and by the crash-harness program behind scripts/crash-harness (all of them).
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <vector>

namespace sl::harness {

struct Config {
  std::string stowline;                  // the program under test
  std::string workDirectory;             // scratch space, made if missing; tmpfs preferred
  std::vector<std::string> fixtureArgs;  // after "fixture --root ROOT"
};

// What the checks after a run found; `ok` with an empty report when all is
// well, otherwise the report names the point, the operation and the outputs.
struct Outcome {
  bool ok = true;
  std::string report;
};

// Counters of one sweep, for the summary lines.
struct Tally {
  uint64_t runs = 0;
  uint64_t passed = 0;
  uint64_t killed = 0;          // crash runs that died at their point
  uint64_t resumeCrashes = 0;   // resumes that were killed again
  uint64_t faultyTrue = 0;      // fault runs whose migration still returned true
  uint64_t faultyFalse = 0;     // fault runs that returned false
  uint64_t refused = 0;         // fault runs refused before migrating (exit 2)
  // Fault runs whose failed bundle install left that application's groups
  // unmigrated: the design deletes the old container of a failed install
  // and migrates its groups only after a successful one, so a group that no
  // other application names stays, whole, at its old path.
  uint64_t strandedByDesign = 0;
  // Fault runs that failed part way through removing a migrated container,
  // after its bundle but not its marker was gone: the design's next run
  // finds the marker, tries to install the missing bundle and returns false
  // (and deletes the container); the run after that returns true.
  uint64_t secondRerun = 0;
  // Fault runs after which a group's item stays at its old path because its
  // move failed: the design logs it and goes on, the result unchanged.
  uint64_t groupItemsLeft = 0;
  std::vector<std::string> failures;
};

class Harness {
 public:
  explicit Harness(Config config);

  // Writes the fixture, copies it to pristine, takes the manifest, and runs
  // one clean traced migration of a copy, which must succeed and pass every
  // check: its trace gives the number of operations and the reference
  // description of each. False with `failure` written otherwise.
  bool prepare(std::string* failure);

  // Mutating operations of a clean migration, of every kind / of renames.
  uint64_t operations() const { return trace_.size(); }
  uint64_t renames() const { return renameOrdinals_.size(); }
  // The reference trace line of operation k (1-based), or of the kth rename.
  std::string operation(uint64_t k) const;
  std::string renameOperation(uint64_t k) const;

  // Kills the migration at operation k, optionally kills the resume at its
  // operation `resumeKill`, then resumes cleanly and checks everything.
  Outcome crashAt(uint64_t k, std::optional<uint64_t> resumeKill, Tally* tally);

  // Fails operation k (the kth rename when `renamesOnly`) with `errnoName`,
  // once or from then on, then reruns cleanly and checks everything.
  Outcome injectAt(const std::string& errnoName, uint64_t k, bool persistent, bool renamesOnly, Tally* tally);

 private:
  struct Step {
    std::string name;
    int status = -1;
    std::string out;
    std::string err;
  };

  bool freshCopy(std::string* failure);
  Step migrate(const std::string& name, const std::string& fault, const std::string& traceFile = {});
  // What a faulty run left at its old path by design: group -> the names of
  // its top-level items that stayed, or no names for the whole group.
  using LeftBehind = std::map<std::string, std::set<std::string>>;

  // verify, PRAGMA integrity_check, the registry's counts against the clean
  // run's, no install left in flight; empty when all hold. The items in
  // `left` may be missing from the new layout and still in the old one
  // (verify's "missing" and "duplicated" lines), and each whole group in it
  // makes one group and one group container fewer; nothing else may differ.
  std::string checkMigrated(const LeftBehind& left = {});
  // Adds to *left the groups that a faulty run's failed bundle installs
  // (named in its `log`) left at their old paths, each checked to hold every
  // item of the pristine layout unchanged; a group that stands there
  // otherwise is a problem written to *problems.
  void addStrandedGroups(const std::string& log, LeftBehind* left, std::string* problems);
  // Adds to *left the group items whose move the `log` reports failed and
  // that still stand, unchanged, at their old path; one that stands there
  // changed is a problem.
  void addItemsLeftInGroups(const std::string& log, LeftBehind* left, std::string* problems);
  // Every item below `relative` ("" for all) of the old group container
  // `old` as in the pristine copy; what differs, one line each.
  std::string compareWithPristine(const std::string& old, const std::string& relative);
  // Containers that a faulty run reported failed must keep their marker.
  std::string checkMarkers(const std::string& log);
  std::string describe(const std::string& headline, const std::vector<Step>& steps) const;

  Config config_;
  std::string pristine_;
  std::string root_;
  std::string manifest_;
  std::string logFile_;
  std::vector<std::string> trace_;
  std::vector<uint64_t> renameOrdinals_;
  // Row counts of the registry after the clean run: applications, groups,
  // safe harbors; and the entries of the three container roots.
  std::vector<int64_t> baseline_;
  // Each group's old container, from the manifest.
  std::map<std::string, std::string> oldGroupContainers_;
};

// The fixture of the harness tests: three applications (the first with a VPN
// plug-in beside it), two groups of which one is shared, a placeholder, a
// built-in application with an older copy in the old layout, and the
// fixture's safe harbors. With seed 3 every group has an application to go
// with: the first group is named by all three applications, the second by
// the third alone, so a failed install of that one strands it.
inline const std::vector<std::string> kSmallFixture = {
    "--apps", "3", "--groups", "2", "--app-vpn", "1", "--placeholders", "1", "--builtin", "1",
    "--files-per-app", "2", "--bytes-per-file", "32", "--seed", "3"};

// The points a sweep visits: every one when `stride` is 1, otherwise every
// stride-th one from a start that `seed` varies, plus the first and last.
std::vector<uint64_t> samplePoints(uint64_t total, uint64_t stride, uint64_t seed);

}  // namespace sl::harness
