#include "Platform/Format.h"
std::string rejected() { return sl::format("%d", 1, 2); }
