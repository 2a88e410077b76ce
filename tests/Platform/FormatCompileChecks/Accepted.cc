// Must compile: the control for the rejected cases beside it.
#include "Platform/Format.h"
#include "Platform/URL.h"
std::string accepted(const sl::URL& url, size_t count, const char* text) {
  return sl::format("%@ %ld %s %d %*d %.*s %p %f", url, count, text, 1, 2, 3, 4, text, text, 1.5);
}
