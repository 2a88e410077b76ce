#include "Support/Log.h"

extern "C" {
sl::InstallerLogHandle* gLogHandle = nullptr;
}
