// The embedded registry: installing one customer package, and asking for an
// application's proxy. Everything lives below a temporary system root under
// /dev/shm, set before the configuration is first used.
#include <benchmark/benchmark.h>

#include <memory>
#include <string>

#include "BenchSupport.h"
#include "Configuration/SLGlobalConfiguration.h"
#include "Platform/ApplicationRegistry.h"
#include "Platform/HostLog.h"
#include "Platform/InstallerLog.h"
#include "Platform/PropertyList.h"
#include "Platform/SystemRoot.h"
#include "Registry/EmbeddedRegistry.h"

namespace {

using slbench::fileURL;

// The root and the registry of this program, made on first use.
struct RegistryFixture {
  slbench::ScratchDir root{slbench::shmParent()};
  std::shared_ptr<EmbeddedRegistry> registry;
  int64_t packages = 0;

  RegistryFixture() {
    sl::setHostLogSink([](const sl::LogRecord&) {});
    sl::setInstallerLogSink([](const sl::LogRecord&) {});
    sl::setSystemRoot(root.path());
    sl::Error error;
    registry = EmbeddedRegistry::open(SLGlobalConfiguration::sharedInstance(), &error);
  }
  static RegistryFixture& shared() {
    static RegistryFixture fixture;
    return fixture;
  }

  // A customer package (Payload/App.app) of `identifier`; returns its path.
  std::string makePackage(const std::string& identifier) {
    const std::string package = root.path() + "/private/var/packages/" + std::to_string(packages++);
    const std::string app = package + "/Payload/App.app";
    std::filesystem::create_directories(app);
    sl::Dictionary info{{"PBBundleIdentifier", sl::String(identifier)}, {"PBBundleVersion", sl::String("1.0")}};
    (void)sl::writePropertyListToURL(info, fileURL(app + "/Info.plist"));
    slbench::writeFile(app + "/Executable", "binary of " + identifier);
    return package;
  }
  static sl::Dictionary options(const std::string& identifier) {
    return sl::Dictionary{{RGInstallTypeKey, sl::Number(6u)},
                          {RGPackageTypeKey, sl::String(RGPackageTypeCustomer)},
                          {RGSkipBlacklistOptionKey, sl::Boolean(true)},
                          {RGBundleIdentifierOptionKey, sl::String(identifier)}};
  }
  bool install(const std::string& identifier) {
    return registry->installApplication(fileURL(makePackage(identifier), true), options(identifier), nullptr);
  }
};

// Each iteration installs a new application; the package is made with the
// timer paused.
void BM_RegistryInstall(benchmark::State& state) {
  RegistryFixture& fixture = RegistryFixture::shared();
  if (!fixture.registry) {
    state.SkipWithError("the registry did not open");
    return;
  }
  int64_t n = 0;
  for (auto _ : state) {
    state.PauseTiming();
    const std::string identifier = "com.example.install" + std::to_string(n++);
    const std::string package = fixture.makePackage(identifier);
    state.ResumeTiming();
    const sl::Dictionary options = RegistryFixture::options(identifier);
    if (!fixture.registry->installApplication(fileURL(package, true), options, nullptr)) {
      state.SkipWithError("install failed");
      break;
    }
  }
}
BENCHMARK(BM_RegistryInstall)->Iterations(slbench::scaled(50, 500))->Unit(benchmark::kMillisecond);

// The proxy of an installed application and the paths a client reads off it.
void BM_RegistryProxyQuery(benchmark::State& state) {
  RegistryFixture& fixture = RegistryFixture::shared();
  if (!fixture.registry || !fixture.install("com.example.query")) {
    state.SkipWithError("the registry did not open or the install failed");
    return;
  }
  for (auto _ : state) {
    std::shared_ptr<RGBundleProxy> proxy = fixture.registry->bundleProxyForIdentifier("com.example.query");
    if (!proxy) {
      state.SkipWithError("no proxy");
      break;
    }
    sl::URL data = proxy->dataContainerURL();
    benchmark::DoNotOptimize(data);
  }
}
BENCHMARK(BM_RegistryProxyQuery)->Unit(benchmark::kMicrosecond);

}  // namespace
