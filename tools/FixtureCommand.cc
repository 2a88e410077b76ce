#include "tools/Commands.h"

namespace stowline {

int fixtureCommand(Arguments) { return usageError("fixture", "not built yet"); }

}  // namespace stowline
