// The application registry as the migrator sees it: a workspace that
// installs packages and answers what is installed, and bundle proxies that
// describe one installed application and its containers.
//
// This header is the interface only. The embedded registry (Registry/)
// implements it and is made the process's default workspace by whoever owns
// the process (the host program, a test); the migrator reaches it only
// through defaultWorkspace().
//
// Install calls are synchronous: every progress report has reached the
// handler before the call returns.
#pragma once

#include <functional>
#include <memory>

#include "Platform/Error.h"
#include "Platform/URL.h"
#include "Platform/Value.h"

// The keys and values of an install options dictionary and of progress
// reports, as the registry defines them.
inline constexpr char RGInstallTypeKey[] = "InstallType";
inline constexpr char RGPackageTypeKey[] = "PackageType";
inline constexpr char RGPackageTypeCustomer[] = "Customer";
inline constexpr char RGPackageTypePlaceholder[] = "Placeholder";
inline constexpr char RGJukoraMetadataKey[] = "JukoraMetadata";
inline constexpr char RGBundleIdentifierOptionKey[] = "PBBundleIdentifier";
inline constexpr char RGSkipBlacklistOptionKey[] = "SkipBlacklist";
inline constexpr char RGVerifyForMigratorOptionKey[] = "VerifyForMigrator";
inline constexpr char RGProgressPercentCompleteKey[] = "PercentComplete";
inline constexpr char RGProgressStatusKey[] = "Status";
inline constexpr char RGProgressErrorKey[] = "Error";
inline constexpr char RGProgressErrorDescriptionKey[] = "ErrorDescription";
inline constexpr char RGProgressErrorDetailKey[] = "ErrorDetail";
inline constexpr char RGErrorApplicationAlreadyInstalled[] = "ApplicationAlreadyInstalled";

// The registry's error domain for refusals of its own.
inline constexpr char RGErrorDomain[] = "RGErrorDomain";

class RGBundleProxy {
 public:
  virtual ~RGBundleProxy() = default;

  // The proxy of an installed application (built-in ones included), or null
  // when the default workspace does not know the identifier.
  static std::shared_ptr<RGBundleProxy> bundleProxyForIdentifier(const sl::String& identifier);

  virtual sl::String bundleIdentifier() const = 0;
  // "User", "System" or "Placeholder".
  virtual sl::String bundleType() const = 0;
  virtual sl::URL bundleURL() const = 0;
  virtual sl::URL bundleContainerURL() const = 0;
  virtual sl::URL dataContainerURL() const = 0;
  // Group identifier -> the group's container (a directory URL); null when
  // the registry cannot answer.
  virtual sl::Dictionary groupContainerURLs() const = 0;
  virtual bool foundBackingBundle() const = 0;
};

using RGProgressHandler = std::function<void(const sl::Dictionary& progress)>;

class RGApplicationWorkspace {
 public:
  virtual ~RGApplicationWorkspace() = default;

  // The process's workspace. Calling it before one was set is a programming
  // error and aborts with a message.
  static RGApplicationWorkspace& defaultWorkspace();
  // Makes `workspace` the default (null clears it); returns the previous one.
  static std::shared_ptr<RGApplicationWorkspace> setDefaultWorkspace(std::shared_ptr<RGApplicationWorkspace> workspace);

  virtual bool applicationIsInstalled(const sl::String& identifier) = 0;

  // Installs the package at `path` with the options; the package directory
  // is gone when the call returns, whatever the outcome. Returns false and
  // fills *error on failure; reports progress to `usingBlock` when given.
  virtual bool installApplication(const sl::URL& path, const sl::Dictionary& withOptions, sl::Error* error,
                                  const RGProgressHandler& usingBlock) = 0;
  bool installApplication(const sl::URL& path, const sl::Dictionary& withOptions, sl::Error* error) {
    return installApplication(path, withOptions, error, RGProgressHandler());
  }

  virtual std::shared_ptr<RGBundleProxy> bundleProxyForIdentifier(const sl::String& identifier) = 0;
};
