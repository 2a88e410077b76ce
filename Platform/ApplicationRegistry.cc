#include "Platform/ApplicationRegistry.h"

#include <cstdio>
#include <cstdlib>
#include <mutex>
#include <utility>

namespace {

std::mutex gMutex;
std::shared_ptr<RGApplicationWorkspace> gDefault;  // guarded by gMutex

}  // namespace

RGApplicationWorkspace& RGApplicationWorkspace::defaultWorkspace() {
  std::lock_guard lock(gMutex);
  if (!gDefault) {
    std::fputs("RGApplicationWorkspace: no default workspace was set\n", stderr);
    std::abort();
  }
  // The owner keeps the workspace alive for as long as it is the default.
  return *gDefault;
}

std::shared_ptr<RGApplicationWorkspace> RGApplicationWorkspace::setDefaultWorkspace(
    std::shared_ptr<RGApplicationWorkspace> workspace) {
  std::lock_guard lock(gMutex);
  return std::exchange(gDefault, std::move(workspace));
}

std::shared_ptr<RGBundleProxy> RGBundleProxy::bundleProxyForIdentifier(const sl::String& identifier) {
  return RGApplicationWorkspace::defaultWorkspace().bundleProxyForIdentifier(identifier);
}
