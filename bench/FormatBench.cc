// The formatter sits under every message and error record of the system.
#include <benchmark/benchmark.h>

#include "Platform/Error.h"
#include "Platform/Format.h"
#include "Platform/URL.h"

namespace {

void BM_FormatPrintfOnly(benchmark::State& state) {
  for (auto _ : state) {
    std::string s = sl::format("%d: %s failed: %s", 281, "/private/var/mobile/Applications/X", "Permission denied");
    benchmark::DoNotOptimize(s);
  }
}
BENCHMARK(BM_FormatPrintfOnly);

void BM_FormatURLAndError(benchmark::State& state) {
  sl::URL url = sl::URL::fileURLWithPath("/private/var/mobile/Applications/0A1B2C3D/Foo Bar.app", true);
  sl::Error error = sl::Error::posix(13, "removefile of x failed: Permission denied");
  for (auto _ : state) {
    std::string s = sl::format("Failed to move %@ to %@ : %@", url, url, error);
    benchmark::DoNotOptimize(s);
  }
}
BENCHMARK(BM_FormatURLAndError);

}  // namespace
