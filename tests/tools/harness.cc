// crash-harness: the sweeps of CrashEveryStepTest and InjectedErrorsTest on
// a fixture of any size, every point by default. scripts/crash-harness runs
// it; its summary lines are what docs/reliability.md quotes.

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <optional>
#include <random>
#include <string>
#include <vector>

#include "tools/HarnessSupport.h"

namespace {

constexpr char kUsage[] =
    "usage: crash-harness [--stowline PATH] [--work DIR] [--apps N] [--groups G]\n"
    "                     [--app-vpn V] [--placeholders P] [--builtin B]\n"
    "                     [--files-per-app F] [--bytes-per-file B] [--seed S]\n"
    "                     [--stride K] [--resume-every R] [--errors] [--no-crashes]\n"
    "\n"
    "Writes a fixture, counts the mutating operations of its clean migration,\n"
    "then kills the migration at every operation (every Kth with --stride),\n"
    "resumes it and checks the result; every Rth point (default 10, 0 for none)\n"
    "also kills the resume at a random operation. With --errors it then fails\n"
    "every operation with EIO, ENOSPC, EACCES, EROFS and ENOTEMPTY, and every\n"
    "rename with EXDEV, once and persistently. Prints a summary; exit status 1\n"
    "when any point failed (the first reports go to standard error).\n";

struct Options {
  std::string stowline = SL_STOWLINE_PATH;
  std::string work = "/dev/shm/stowline-crash-harness";
  uint64_t stride = 1;
  uint64_t resumeEvery = 10;
  bool errors = false;
  bool crashes = true;
};

// The first three reports whole, then the first two lines (the point and
// what went wrong) of every one.
void printFailures(const sl::harness::Tally& tally) {
  for (size_t i = 0; i < tally.failures.size() && i < 3; ++i) std::fprintf(stderr, "%s\n", tally.failures[i].c_str());
  for (const std::string& report : tally.failures) {
    const size_t first = report.find('\n');
    const size_t second = first == std::string::npos ? first : report.find('\n', first + 1);
    std::fprintf(stderr, "FAILED %s\n", report.substr(0, second).c_str());
  }
}

}  // namespace

int main(int argc, char** argv) {
  Options options;
  std::vector<std::string> fixture = {"--apps", "20", "--groups", "4", "--app-vpn", "2", "--placeholders", "2",
                                      "--builtin", "1", "--files-per-app", "3", "--seed", "2"};
  auto setFixture = [&](const std::string& name, const std::string& value) {
    for (size_t i = 0; i + 1 < fixture.size(); i += 2) {
      if (fixture[i] == name) {
        fixture[i + 1] = value;
        return;
      }
    }
    fixture.push_back(name);
    fixture.push_back(value);
  };
  for (int i = 1; i < argc; ++i) {
    const std::string arg = argv[i];
    auto value = [&]() -> std::string {
      if (i + 1 >= argc) {
        std::fprintf(stderr, "crash-harness: %s needs a value\n%s", arg.c_str(), kUsage);
        std::exit(2);
      }
      return argv[++i];
    };
    if (arg == "--help" || arg == "-h") {
      std::fputs(kUsage, stdout);
      return 0;
    } else if (arg == "--stowline") {
      options.stowline = value();
    } else if (arg == "--work") {
      options.work = value();
    } else if (arg == "--apps" || arg == "--groups" || arg == "--app-vpn" || arg == "--placeholders" ||
               arg == "--builtin" || arg == "--files-per-app" || arg == "--bytes-per-file" || arg == "--seed") {
      setFixture(arg, value());
    } else if (arg == "--stride") {
      options.stride = std::strtoull(value().c_str(), nullptr, 10);
    } else if (arg == "--resume-every") {
      options.resumeEvery = std::strtoull(value().c_str(), nullptr, 10);
    } else if (arg == "--errors") {
      options.errors = true;
    } else if (arg == "--no-crashes") {
      options.crashes = false;
    } else {
      std::fprintf(stderr, "crash-harness: unknown option '%s'\n%s", arg.c_str(), kUsage);
      return 2;
    }
  }

  sl::harness::Harness harness({options.stowline, options.work, fixture});
  std::string failure;
  std::string shown;
  for (const std::string& part : fixture) shown += " " + part;
  std::printf("fixture:%s\n", shown.c_str());
  if (!harness.prepare(&failure)) {
    std::fprintf(stderr, "crash-harness: %s\n", failure.c_str());
    return 1;
  }
  const uint64_t total = harness.operations();
  std::printf("clean migration: %llu mutating operations, %llu of them renames\n",
              static_cast<unsigned long long>(total), static_cast<unsigned long long>(harness.renames()));
  std::fflush(stdout);
  bool ok = true;

  if (options.crashes) {
    sl::harness::Tally tally;
    std::mt19937_64 random(total);
    uint64_t sampled = 0;
    for (const uint64_t k : sl::harness::samplePoints(total, options.stride, total)) {
      std::optional<uint64_t> resumeKill;
      if (options.resumeEvery > 0 && k % options.resumeEvery == options.resumeEvery / 2) {
        resumeKill = 1 + random() % (total - k + 2);
        ++sampled;
      }
      harness.crashAt(k, resumeKill, &tally);
    }
    std::printf("crash points: %llu run, %llu killed at their point, %llu survived; resume crashes: %llu sampled, "
                "%llu killed\n",
                static_cast<unsigned long long>(tally.runs), static_cast<unsigned long long>(tally.killed),
                static_cast<unsigned long long>(tally.passed), static_cast<unsigned long long>(sampled),
                static_cast<unsigned long long>(tally.resumeCrashes));
    std::fflush(stdout);
    printFailures(tally);
    ok = ok && tally.failures.empty();
  }

  if (options.errors) {
    struct Case {
      const char* name;
      bool renamesOnly;
    };
    const Case cases[] = {{"EIO", false},   {"ENOSPC", false},    {"EACCES", false},
                          {"EROFS", false}, {"ENOTEMPTY", false}, {"EXDEV", true}};
    for (const Case& c : cases) {
      for (const bool persistent : {false, true}) {
        sl::harness::Tally tally;
        const uint64_t points = c.renamesOnly ? harness.renames() : harness.operations();
        for (const uint64_t k : sl::harness::samplePoints(points, options.stride, 0)) {
          harness.injectAt(c.name, k, persistent, c.renamesOnly, &tally);
        }
        std::printf("%s%s%s: %llu run, %llu passed (%llu returned true, %llu false, %llu refused at start; "
                    "%llu left groups at their old paths after a failed install, %llu left group items after a failed "
                    "move, %llu needed a second rerun)\n",
                    c.name, persistent ? " from then on" : " once", c.renamesOnly ? " (renames)" : "",
                    static_cast<unsigned long long>(tally.runs), static_cast<unsigned long long>(tally.passed),
                    static_cast<unsigned long long>(tally.faultyTrue), static_cast<unsigned long long>(tally.faultyFalse),
                    static_cast<unsigned long long>(tally.refused),
                    static_cast<unsigned long long>(tally.strandedByDesign),
                    static_cast<unsigned long long>(tally.groupItemsLeft),
                    static_cast<unsigned long long>(tally.secondRerun));
        std::fflush(stdout);
        printFailures(tally);
        ok = ok && tally.failures.empty();
      }
    }
  }
  return ok ? 0 : 1;
}
