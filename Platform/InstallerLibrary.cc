#include "Platform/InstallerLibrary.h"

#include <cstdio>
#include <cstdlib>
#include <mutex>
#include <utility>

namespace {

std::mutex gMutex;
std::shared_ptr<SLInstallerLibrary> gDefault;  // guarded by gMutex
thread_local sl::Error tLastHarborError;

}  // namespace

SLInstallerLibrary& SLInstallerLibrary::defaultLibrary() {
  std::lock_guard lock(gMutex);
  if (!gDefault) {
    std::fputs("SLInstallerLibrary: no installer library was set\n", stderr);
    std::abort();
  }
  return *gDefault;
}

std::shared_ptr<SLInstallerLibrary> SLInstallerLibrary::setDefaultLibrary(std::shared_ptr<SLInstallerLibrary> library) {
  std::lock_guard lock(gMutex);
  return std::exchange(gDefault, std::move(library));
}

int StowlineRegisterSafeHarborForContainerType(const sl::String& path, const sl::String& identifier,
                                               int containerType, const void* /*reserved*/) {
  sl::Error error;
  if (SLInstallerLibrary::defaultLibrary().registerSafeHarbor(path, identifier, containerType, &error)) return 1;
  tLastHarborError = error;
  return 0;
}

sl::Error StowlineCopyLastSafeHarborRegistrationError() { return tLastHarborError; }

bool StowlineUpdateContainerDataProtectionForMigratorOnly(const sl::Dictionary& options) {
  return SLInstallerLibrary::defaultLibrary().updateContainerDataProtection(options);
}
