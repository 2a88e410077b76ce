// The plug-in's entry points: the host finds them by name with dlsym, makes
// the migrator through the first and hands it back through the second, so
// that the module that made the object also destroys it.

#include <exception>
#include <string_view>
#include <type_traits>

#include "AppMigrator/AppMigrator.h"
#include "Platform/MigrationHost.h"

extern "C" {

__attribute__((visibility("default"))) DataClassMigrator* StowlineCreateDataClassMigrator() {
  // No exception may cross into the host: whatever init could throw (an
  // allocation failure) is answered like an init that yields nothing.
  try {
    return SLAppMigrator::create().release();  // the host owns it from here
  } catch (const std::exception&) {
    return nullptr;
  }
}

__attribute__((visibility("default"))) void StowlineReleaseDataClassMigrator(DataClassMigrator* migrator) {
  delete migrator;
}

}  // extern "C"

// The host looks these up by the names in MigrationHost.h.
static_assert(std::string_view(kDataClassMigratorEntryPoint) == "StowlineCreateDataClassMigrator");
static_assert(std::string_view(kDataClassMigratorReleasePoint) == "StowlineReleaseDataClassMigrator");
static_assert(std::is_same_v<decltype(&StowlineCreateDataClassMigrator), DataClassMigratorCreateFunction>);
static_assert(std::is_same_v<decltype(&StowlineReleaseDataClassMigrator), DataClassMigratorReleaseFunction>);
