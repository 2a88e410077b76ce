// Reading and writing property lists: the old install map with many groups,
// in both formats.
#include <benchmark/benchmark.h>

#include <string>
#include <vector>

#include "BenchSupport.h"
#include "Platform/PropertyList.h"

namespace {

const int64_t kGroups = slbench::scaled(10'000, 10'000);

// {"GroupContainers": {"group.com.example.N": {"Container": path}}}
sl::Dictionary installMap() {
  sl::Dictionary groups = sl::Dictionary::create();
  for (int64_t i = 0; i < kGroups; ++i) {
    const std::string n = std::to_string(i);
    groups.set("group.com.example.app" + n,
               sl::Dictionary{{"Container", sl::String("/private/var/mobile/Containers/Shared/AppGroup/" + n)}});
  }
  return sl::Dictionary{{"GroupContainers", groups}};
}

sl::PropertyListFormat formatOf(const benchmark::State& state) {
  return state.range(0) == 0 ? sl::PropertyListFormat::XML : sl::PropertyListFormat::Binary;
}

void BM_PropertyListWrite(benchmark::State& state) {
  const sl::Dictionary map = installMap();
  const sl::PropertyListFormat format = formatOf(state);
  size_t size = 0;
  for (auto _ : state) {
    std::vector<uint8_t> bytes;
    if (!sl::dataFromPropertyList(map, format, &bytes)) {
      state.SkipWithError("serialisation failed");
      break;
    }
    size = bytes.size();
    benchmark::DoNotOptimize(bytes.data());
  }
  state.SetBytesProcessed(state.iterations() * static_cast<int64_t>(size));
  state.SetLabel(format == sl::PropertyListFormat::XML ? "XML" : "binary");
}
BENCHMARK(BM_PropertyListWrite)->Arg(0)->Arg(1)->Unit(benchmark::kMillisecond);

void BM_PropertyListRead(benchmark::State& state) {
  const sl::PropertyListFormat format = formatOf(state);
  std::vector<uint8_t> bytes;
  if (!sl::dataFromPropertyList(installMap(), format, &bytes)) state.SkipWithError("serialisation failed");
  for (auto _ : state) {
    sl::Value value = sl::propertyListFromData(bytes);
    if (!value) {
      state.SkipWithError("parse failed");
      break;
    }
    benchmark::DoNotOptimize(value);
  }
  state.SetBytesProcessed(state.iterations() * static_cast<int64_t>(bytes.size()));
  state.SetLabel(format == sl::PropertyListFormat::XML ? "XML" : "binary");
}
BENCHMARK(BM_PropertyListRead)->Arg(0)->Arg(1)->Unit(benchmark::kMillisecond);

}  // namespace
