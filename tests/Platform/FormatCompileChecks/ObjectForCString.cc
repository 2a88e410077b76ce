#include "Platform/Format.h"
std::string rejected() { return sl::format("%s", sl::String("text")); }
