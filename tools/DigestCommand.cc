#include "tools/Commands.h"

namespace stowline {

int digestCommand(Arguments) { return usageError("digest", "not built yet"); }

}  // namespace stowline
