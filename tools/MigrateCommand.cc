#include "tools/Commands.h"

namespace stowline {

int migrateCommand(Arguments) { return usageError("migrate", "not built yet"); }

}  // namespace stowline
