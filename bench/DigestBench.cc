// The SHA-256 digest of a large file (the file is read once before timing,
// so the page cache holds it and the digest itself is measured).
#include <benchmark/benchmark.h>

#include "BenchSupport.h"
#include "Support/Digest.h"

namespace {

const int64_t kSize = slbench::scaled(int64_t{64} << 20, int64_t{1} << 30);

void BM_DigestSHA256(benchmark::State& state) {
  slbench::ScratchDir scratch(slbench::diskParent());
  const std::string path = scratch.path() + "/large";
  slbench::makeLargeFile(path, kSize);
  const sl::URL url = slbench::fileURL(path);
  if (SLCreateSHA256Digest(url).str().size() != 64) state.SkipWithError("digest failed");
  for (auto _ : state) {
    sl::String digest = SLCreateSHA256Digest(url);
    benchmark::DoNotOptimize(digest);
  }
  state.SetBytesProcessed(state.iterations() * kSize);
}
BENCHMARK(BM_DigestSHA256)->Unit(benchmark::kMillisecond);

}  // namespace
