#include "Platform/Format.h"
std::string rejected(int* n) { return sl::format("%n", n); }
