#include "Platform/Format.h"
std::string rejected() { return sl::format("%d", "text"); }
