#include "tools/Commands.h"

namespace stowline {

int planCommand(Arguments) { return usageError("plan", "not built yet"); }

}  // namespace stowline
