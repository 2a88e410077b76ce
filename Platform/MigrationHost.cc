#include "Platform/MigrationHost.h"

// Out of line, so that the class's type information lives in the interface
// library that both the host and the plug-in link.
DataClassMigrator::~DataClassMigrator() = default;
