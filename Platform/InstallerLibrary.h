// The installer library's calls that the migrator makes, and the interface
// behind them.
//
// The functions forward to the process's installer library, which the
// embedded registry provides and whoever owns the process sets (like the
// default workspace of ApplicationRegistry.h).
#pragma once

#include <memory>

#include "Platform/Error.h"
#include "Platform/Value.h"

// The one option of the data-protection update.
inline constexpr char kSLUpdateSystemAppDataContainerDataProtection[] = "SLUpdateSystemAppDataContainerDataProtection";

class SLInstallerLibrary {
 public:
  virtual ~SLInstallerLibrary() = default;
  static SLInstallerLibrary& defaultLibrary();  // aborts with a message when none was set
  static std::shared_ptr<SLInstallerLibrary> setDefaultLibrary(std::shared_ptr<SLInstallerLibrary> library);

  // Records the directory at `path` as a safe harbor of `identifier`. The
  // path must be an existing directory.
  virtual bool registerSafeHarbor(const sl::String& path, const sl::String& identifier, int containerType,
                                  sl::Error* error) = 0;
  virtual bool updateContainerDataProtection(const sl::Dictionary& options) = 0;
};

// Non-zero when the harbor was registered, zero when registration failed;
// the failure's record is then available from
// StowlineCopyLastSafeHarborRegistrationError on the same thread. `reserved`
// is always null.
int StowlineRegisterSafeHarborForContainerType(const sl::String& path, const sl::String& identifier,
                                               int containerType, const void* reserved);

// The record of this thread's last failed registration (null when none).
sl::Error StowlineCopyLastSafeHarborRegistrationError();

// Updates the data-protection classes of the data containers the registry
// knows; true on success.
bool StowlineUpdateContainerDataProtectionForMigratorOnly(const sl::Dictionary& options);
