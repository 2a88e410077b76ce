#include "MigratorTestSupport.h"

namespace {
using namespace mgtest;
TEST_F(MigratorTest, FixtureGivesAnEmptyRootAndARegistry) {
  EXPECT_FALSE(sl::test::exists(below(kOldRoot)));
  EXPECT_FALSE(RGApplicationWorkspace::defaultWorkspace().applicationIsInstalled(sl::String("com.example.none")));
}
}  // namespace
