// Bundle proxies: a snapshot of one application's record taken when the
// proxy is made. The data container of a built-in application is asked of
// the registry when first wanted, so that it is made (and recorded) then.

#include <sys/stat.h>

#include "Registry/EmbeddedRegistry.h"

namespace {

class RegistryProxy final : public RGBundleProxy {
 public:
  RegistryProxy(std::weak_ptr<EmbeddedRegistry> registry, EmbeddedRegistry::Record record, sl::Dictionary groups)
      : registry_(std::move(registry)), record_(std::move(record)), groups_(std::move(groups)) {}

  sl::String bundleIdentifier() const override { return record_.identifier; }
  sl::String bundleType() const override { return record_.type; }
  sl::URL bundleURL() const override { return directoryURL(record_.bundlePath); }
  sl::URL bundleContainerURL() const override { return directoryURL(record_.bundleContainer); }
  sl::URL dataContainerURL() const override {
    // A built-in application's container is recorded before it is made: the
    // registry makes it (again) when it is missing, so it is always asked.
    if (record_.dataContainer.empty() || record_.type == "System") {
      if (const std::shared_ptr<EmbeddedRegistry> registry = registry_.lock()) {
        record_.dataContainer = registry->dataContainerForIdentifier(record_.identifier);
      }
    }
    return directoryURL(record_.dataContainer);
  }
  sl::Dictionary groupContainerURLs() const override { return groups_; }
  bool foundBackingBundle() const override {
    struct stat st;
    return !record_.bundlePath.empty() && ::stat(record_.bundlePath.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
  }

 private:
  static sl::URL directoryURL(const std::string& path) {
    return path.empty() ? sl::URL() : sl::URL::fileURLWithPath(path, true);
  }

  std::weak_ptr<EmbeddedRegistry> registry_;
  mutable EmbeddedRegistry::Record record_;  // the data container is filled in on first request
  sl::Dictionary groups_;
};

}  // namespace

std::shared_ptr<RGBundleProxy> EmbeddedRegistry::bundleProxyForIdentifier(const sl::String& identifier) {
  std::lock_guard lock(mutex_);
  std::optional<Record> record = recordFor(identifier.str(), nullptr);
  if (!record) return nullptr;
  sl::Dictionary groups = sl::Dictionary::create();
  for (const auto& [group, path] : groupsOf(record->identifier)) {
    groups.set(group, sl::URL::fileURLWithPath(path, true));
  }
  return std::make_shared<RegistryProxy>(weak_from_this(), std::move(*record), std::move(groups));
}
