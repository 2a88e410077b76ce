// The migration host's interface: the base class of a data-class migrator
// and the entry points that a migrator plug-in exports.
//
// The host loads the plug-in (a shared object) with dlopen, finds
// kDataClassMigratorEntryPoint and calls it once: the plug-in makes its
// migrator, runs its initialisation and hands it over, or answers null when
// the initialisation yields nothing. When the host is done it hands the
// object back through kDataClassMigratorReleasePoint, so that the module
// that made it also destroys it.
//
// The host log (HostLog.h) belongs to the same interface library, which both
// the host and the plug-in link: the host sets the sink, the plug-in writes.
#pragma once

#include "Platform/Value.h"

class DataClassMigrator {
 public:
  virtual ~DataClassMigrator();

  virtual sl::String dataClassName() = 0;
  // The host's estimate of how long the migration takes; the unit is the
  // host's.
  virtual float estimatedDuration() = 0;
  // May be called from another thread while performMigration runs.
  virtual float migrationProgress() = 0;
  // Called once, on one thread.
  virtual bool performMigration() = 0;

 protected:
  DataClassMigrator() = default;
  // The base class's own initialisation; false when it fails, in which case
  // the subclass's initialisation yields nothing.
  bool initBase() { return true; }
};

extern "C" {
using DataClassMigratorCreateFunction = DataClassMigrator* (*)();
using DataClassMigratorReleaseFunction = void (*)(DataClassMigrator*);
}

inline constexpr char kDataClassMigratorEntryPoint[] = "StowlineCreateDataClassMigrator";
inline constexpr char kDataClassMigratorReleasePoint[] = "StowlineReleaseDataClassMigrator";
