#include "tools/Commands.h"

namespace stowline {

int configCommand(Arguments) { return usageError("config", "not built yet"); }

}  // namespace stowline
