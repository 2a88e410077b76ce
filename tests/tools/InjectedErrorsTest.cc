// Fails one mutating file operation of the migration of the small fixture
// (or that one and every later one) with an injected errno, then checks:
// the run ends with status 0 or 1 (never a signal, never a sanitizer
// report); when it still returned true, verify already passes; containers
// that it reported failed keep their migration marker; and a clean rerun
// returns true with nothing lost or duplicated.
//
// EIO, ENOSPC, EACCES, EROFS and ENOTEMPTY hit operations of any kind, EXDEV
// only renames. CI runs a sample: for each errno and mode, every 25th point
// (every 75th under AddressSanitizer) from an offset that differs per
// errno, plus the first and the last. scripts/crash-harness --errors runs
// every point.

#include <gtest/gtest.h>

#include <cstdio>

#include "TestSupport/TestSupport.h"
#include "tools/HarnessSupport.h"

namespace {

#if defined(__SANITIZE_ADDRESS__)
constexpr uint64_t kStride = 75;
#else
constexpr uint64_t kStride = 25;
#endif

TEST(InjectedErrorsTest, NoErrnoAtAnyPointCrashesOrLosesData) {
  sl::test::TempDir work(sl::test::TempDir::kShm);
  sl::harness::Harness harness({SL_STOWLINE_PATH, work.path(), sl::harness::kSmallFixture});
  std::string failure;
  ASSERT_TRUE(harness.prepare(&failure)) << failure;
  ASSERT_GT(harness.renames(), 0u);

  struct Case {
    const char* name;
    bool renamesOnly;
  };
  const Case cases[] = {{"EIO", false},   {"ENOSPC", false},    {"EACCES", false},
                        {"EROFS", false}, {"ENOTEMPTY", false}, {"EXDEV", true}};
  sl::harness::Tally tally;
  uint64_t seed = 0;
  for (const Case& c : cases) {
    for (const bool persistent : {false, true}) {
      const uint64_t total = c.renamesOnly ? harness.renames() : harness.operations();
      for (const uint64_t k : sl::harness::samplePoints(total, kStride, seed++ * 7)) {
        const sl::harness::Outcome outcome = harness.injectAt(c.name, k, persistent, c.renamesOnly, &tally);
        EXPECT_TRUE(outcome.ok) << outcome.report;
        if (tally.failures.size() >= 5) return;
      }
    }
  }
  std::printf("%llu injected-error runs: %llu passed (%llu returned true, %llu false, %llu refused at start)\n",
              static_cast<unsigned long long>(tally.runs), static_cast<unsigned long long>(tally.passed),
              static_cast<unsigned long long>(tally.faultyTrue), static_cast<unsigned long long>(tally.faultyFalse),
              static_cast<unsigned long long>(tally.refused));
}

}  // namespace
