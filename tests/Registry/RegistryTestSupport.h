// Builders shared by the registry tests: a temporary system root with its
// own configuration and registry, bundles and packages.
#pragma once

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <memory>
#include <string>
#include <vector>

#include "Configuration/SLGlobalConfiguration.h"
#include "Platform/PropertyList.h"
#include "Platform/SystemRoot.h"
#include "Registry/EmbeddedRegistry.h"
#include "TestSupport/TestSupport.h"

namespace rgtest {

using sl::test::fileURL;

// A bundle directory with an Info.plist of identifier, version and groups.
inline void makeBundle(const std::string& path, const std::string& identifier, const std::string& version = "1.0",
                       const std::vector<std::string>& groups = {}) {
  sl::test::makeDirs(path);
  sl::Dictionary info{{"PBBundleIdentifier", sl::String(identifier)}, {"PBBundleVersion", sl::String(version)}};
  if (!groups.empty()) {
    sl::Array array = sl::Array::create();
    for (const std::string& group : groups) array.append(sl::String(group));
    info.set("PBApplicationGroups", array);
  }
  ASSERT_TRUE(sl::writePropertyListToURL(info, fileURL(path + "/Info.plist")));
  sl::test::writeFile(path + "/Executable", "binary of " + identifier);
}

// A customer package at `package`: Payload/NAME.app.
inline std::string makeCustomerPackage(const std::string& package, const std::string& identifier,
                                       const std::string& version = "1.0",
                                       const std::vector<std::string>& groups = {}) {
  const std::string app = package + "/Payload/App.app";
  makeBundle(app, identifier, version, groups);
  return app;
}

inline sl::Dictionary options(const std::string& identifier, const char* packageType) {
  return sl::Dictionary{{RGInstallTypeKey, sl::Number(6u)},
                        {RGPackageTypeKey, sl::String(packageType)},
                        {RGSkipBlacklistOptionKey, sl::Boolean(true)},
                        {RGBundleIdentifierOptionKey, sl::String(identifier)}};
}

// Installs `package` with options(identifier, packageType).
inline bool install(EmbeddedRegistry& registry, const std::string& package, const std::string& identifier,
                    const char* packageType, sl::Error* error = nullptr, RGProgressHandler handler = nullptr) {
  return registry.installApplication(fileURL(package, true), options(identifier, packageType), error, handler);
}

// Whether both paths are on one volume.
inline bool sameVolume(const std::string& a, const std::string& b) {
  struct stat sa {};
  struct stat sb {};
  EXPECT_EQ(::stat(a.c_str(), &sa), 0) << a;
  EXPECT_EQ(::stat(b.c_str(), &sb), 0) << b;
  return sa.st_dev == sb.st_dev;
}

inline ino_t inodeOf(const std::string& path) {
  struct stat st {};
  return ::lstat(path.c_str(), &st) == 0 ? st.st_ino : 0;
}

// A system root below /dev/shm with its configuration; open() makes a
// registry on it (again after a close, for recovery).
class RegistryRoot {
 public:
  RegistryRoot() : dir_(sl::test::TempDir::kShm) {
    sl::setSystemRoot(dir_.path());
    configuration_ = std::make_unique<SLGlobalConfiguration>();
  }
  ~RegistryRoot() { sl::setSystemRoot(""); }

  std::shared_ptr<EmbeddedRegistry> open() {
    sl::Error error;
    std::shared_ptr<EmbeddedRegistry> registry = EmbeddedRegistry::open(*configuration_, &error);
    EXPECT_TRUE(registry) << error.description();
    return registry;
  }
  const std::string& path() const { return dir_.path(); }
  std::string operator/(const std::string& relative) const { return dir_ / relative; }
  SLGlobalConfiguration& configuration() { return *configuration_; }

 private:
  sl::test::TempDir dir_;
  std::unique_ptr<SLGlobalConfiguration> configuration_;
};

}  // namespace rgtest
