// One old container migrated end to end: a fresh root holding one old
// container (a bundle, its data and one group container) and an empty
// registry is built with the timer paused; the timed part is making the
// migrator and running its pass.
#include <benchmark/benchmark.h>

#include <memory>
#include <string>

#include "AppMigrator/AppMigrator.h"
#include "BenchSupport.h"
#include "Configuration/SLGlobalConfiguration.h"
#include "Platform/ApplicationRegistry.h"
#include "Platform/HostLog.h"
#include "Platform/InstallerLibrary.h"
#include "Platform/InstallerLog.h"
#include "Platform/PropertyList.h"
#include "Platform/SystemRoot.h"
#include "Registry/EmbeddedRegistry.h"

namespace {

using slbench::fileURL;

const int64_t kDataFiles = slbench::scaled(100, 10'000);

struct MigrationFixture {
  slbench::ScratchDir root{slbench::shmParent()};
  std::shared_ptr<EmbeddedRegistry> registry;

  MigrationFixture() {
    sl::setHostLogSink([](const sl::LogRecord&) {});
    sl::setInstallerLogSink([](const sl::LogRecord&) {});
    sl::setSystemRoot(root.path());
  }
  ~MigrationFixture() { release(); }
  static MigrationFixture& shared() {
    static MigrationFixture fixture;
    return fixture;
  }
  std::string below(const std::string& absolute) const { return root.path() + absolute; }

  void release() {
    RGApplicationWorkspace::setDefaultWorkspace(nullptr);
    SLInstallerLibrary::setDefaultLibrary(nullptr);
    registry.reset();
  }

  // An empty root with a fresh registry and one old container in it.
  bool prepare() {
    release();
    for (const char* top : {"/private", "/Applications", "/etc", "/System"}) {
      std::error_code ignored;
      std::filesystem::remove_all(below(top), ignored);
    }
    sl::Error error;
    registry = EmbeddedRegistry::open(SLGlobalConfiguration::sharedInstance(), &error);
    if (!registry) return false;
    RGApplicationWorkspace::setDefaultWorkspace(registry);
    SLInstallerLibrary::setDefaultLibrary(registry);
    SLGlobalConfiguration::sharedInstance().reScanSystemApps();

    const std::string container = below("/private/var/mobile/Applications/C");
    const std::string app = container + "/A.app";
    const std::string group = below("/private/var/mobile/OldGroups/G");
    std::filesystem::create_directories(app);
    sl::Array groups = sl::Array::create();
    groups.append(sl::String("group.example.g"));
    const sl::Dictionary info{{"PBBundleIdentifier", sl::String("com.example.a")},
                              {"PBBundleVersion", sl::String("1.0")},
                              {"PBBundleExecutable", sl::String("Exec")},
                              {"PBBundleDisplayName", sl::String("Display com.example.a")},
                              {"PBApplicationGroups", groups}};
    if (!sl::writePropertyListToURL(info, fileURL(app + "/Info.plist"))) return false;
    slbench::writeFile(app + "/Exec", "binary of com.example.a");
    for (const char* item : {"Documents", "Library", "tmp"})
      std::filesystem::create_directories(container + "/" + item);
    slbench::makeTree(container + "/Documents", kDataFiles, 10, 512);
    slbench::writeFile(container + "/Library/file", "Library");
    std::filesystem::create_directories(group);
    slbench::writeFile(group + "/shared", "group data");

    const std::string caches = below("/private/var/mobile/Library/Caches");
    std::filesystem::create_directories(caches);
    const sl::Dictionary map{
        {"GroupContainers", sl::Dictionary{{"group.example.g", sl::Dictionary{{"Container", sl::String(group)}}}}}};
    if (!sl::writePropertyListToURL(map, fileURL(caches + "/com.vantor.stowline.plist"))) return false;
    std::filesystem::create_directories(below("/etc"));
    slbench::writeFile(below("/etc/os-release"), "NAME=Testix\nVERSION_ID=9.1\nBUILD_ID=21A42\n");
    return true;
  }
};

void BM_MigrateOneContainer(benchmark::State& state) {
  MigrationFixture& fixture = MigrationFixture::shared();
  for (auto _ : state) {
    state.PauseTiming();
    const bool prepared = fixture.prepare();
    state.ResumeTiming();
    if (!prepared) {
      state.SkipWithError("building the old container failed");
      break;
    }
    std::unique_ptr<SLAppMigrator> migrator = SLAppMigrator::create();
    if (!migrator || !migrator->performMigration()) {
      state.SkipWithError("migration failed");
      break;
    }
    state.PauseTiming();
    if (!RGBundleProxy::bundleProxyForIdentifier("com.example.a")) state.SkipWithError("not in the registry");
    state.ResumeTiming();
  }
}
BENCHMARK(BM_MigrateOneContainer)->Iterations(slbench::scaled(10, 10))->Unit(benchmark::kMillisecond);

}  // namespace
