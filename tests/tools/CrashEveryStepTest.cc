// Kills the migration of a small seeded fixture at each of its mutating
// file operations in turn, resumes it with a clean run and checks that the
// result is the clean run's: verify passes against the manifest of the old
// layout, the registry's integrity check is ok and it holds as many
// applications, groups, safe harbors and containers as after a clean run.
//
// The default build visits every point (765 on the small fixture, 30 to
// 40 s). Under AddressSanitizer every fourth one (plus the first and the
// last) is visited, from an offset that changes with the count, since each
// run there is several times slower (192 points, 30 s on two lightly loaded
// cores, up to three minutes on busy ones).
// One point in ten also kills the resume at a random operation (seeded by
// the count, so a failure repeats) before the clean run.

#include <gtest/gtest.h>

#include <cstdio>
#include <optional>
#include <random>

#include "TestSupport/TestSupport.h"
#include "tools/HarnessSupport.h"

namespace {

#if defined(__SANITIZE_ADDRESS__)
constexpr uint64_t kStride = 4;
#else
constexpr uint64_t kStride = 1;
#endif

TEST(CrashEveryStepTest, EveryCrashPointResumesToTheCleanResult) {
  sl::test::TempDir work(sl::test::TempDir::kShm);
  sl::harness::Harness harness({SL_STOWLINE_PATH, work.path(), sl::harness::kSmallFixture});
  std::string failure;
  ASSERT_TRUE(harness.prepare(&failure)) << failure;
  const uint64_t total = harness.operations();
  ASSERT_GT(total, 0u);

  std::mt19937_64 random(total);
  sl::harness::Tally tally;
  uint64_t expectedKills = 0;
  // total + 1 is past the last operation: that run completes by itself.
  for (const uint64_t k : sl::harness::samplePoints(total + 1, kStride, total)) {
    if (k <= total) ++expectedKills;
    std::optional<uint64_t> resumeKill;
    if (k % 10 == 5) resumeKill = 1 + random() % (total - std::min(k, total) + 2);
    const sl::harness::Outcome outcome = harness.crashAt(k, resumeKill, &tally);
    EXPECT_TRUE(outcome.ok) << outcome.report;
    if (tally.failures.size() >= 5) break;  // enough to go on; the rest would repeat them
  }
  EXPECT_EQ(tally.killed, expectedKills) << "a run killed at a point within the clean run's count was not killed";
  std::printf("%llu operations; %llu crash points run, %llu killed, %llu resumes killed again, %llu passed\n",
              static_cast<unsigned long long>(total), static_cast<unsigned long long>(tally.runs),
              static_cast<unsigned long long>(tally.killed), static_cast<unsigned long long>(tally.resumeCrashes),
              static_cast<unsigned long long>(tally.passed));
}

}  // namespace
