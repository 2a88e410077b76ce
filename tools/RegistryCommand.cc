#include "tools/Commands.h"

namespace stowline {

int registryCommand(Arguments) { return usageError("registry", "not built yet"); }

}  // namespace stowline
