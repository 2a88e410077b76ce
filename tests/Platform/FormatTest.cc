#include "Platform/Format.h"

#include <climits>
#include <cstdio>

#include <gtest/gtest.h>

#include "Platform/Error.h"
#include "Platform/URL.h"

namespace sl {
namespace {

// What the C library prints for the same conversion and argument.
template <class T>
std::string cFormat(const char* format, T value) {
  char buf[256];
  std::snprintf(buf, sizeof buf, format, value);
  return buf;
}

TEST(FormatTest, PrintfConversionsPrintWhatPrintfPrints) {
  EXPECT_EQ(format("%d|%5d|%-5d|%05d|%+d", 42, 42, 42, 42, 42), "42|   42|42   |00042|+42");
  EXPECT_EQ(format("%x %X %o %#x", 255u, 255u, 8u, 255u), "ff FF 10 0xff");
  EXPECT_EQ(format("%lld %llu", INT64_MIN, UINT64_MAX), "-9223372036854775808 18446744073709551615");
  EXPECT_EQ(format("%.3f %e %g", 3.14159, 1234.5, 0.0001), cFormat("%.3f", 3.14159) + " " +
                                                              cFormat("%e", 1234.5) + " " + cFormat("%g", 0.0001));
  EXPECT_EQ(format("%c%c", 'o', 'k'), "ok");
  EXPECT_EQ(format("100%%"), "100%");
  EXPECT_EQ(format("%*d|%-*d|%.*s", 4, 7, 3, 8, 2, "abcdef"), "   7|8  |ab");
  int local = 0;
  EXPECT_EQ(format("%p", &local), cFormat("%p", static_cast<void*>(&local)));

  // The length modifier decides the width the integer is read at, as it
  // would through varargs: "%hhd" of 300 is 44, "%d" of 2^32+5 is 5, "%ld"
  // of a size_t prints it whole.
  EXPECT_EQ(format("%hhd %hd %d", 300, 70000, int64_t{4294967301}), "44 4464 5");
  EXPECT_EQ(format("%ld items", size_t{10}), "10 items");
  EXPECT_EQ(format("%u", -1), "4294967295");
  EXPECT_EQ(format("%lu", size_t{3}), "3");
}

TEST(FormatTest, StringsAndObjects) {
  std::string owned = "owned";
  std::string_view view = std::string_view("viewed!", 6);  // not terminated where it ends
  const char* none = nullptr;
  EXPECT_EQ(format("%s %s %s %s", "lit", owned, view, none), "lit owned viewed (null)");
  EXPECT_EQ(format("[%8s][%-8s][%.2s]", "ab", "ab", "abc"), "[      ab][ab      ][ab]");

  URL url = URL::fileURLWithPath("/private/var/mobile/Applications", true);
  EXPECT_EQ(format("%@|%@|%@|%@", String("s"), Number(int64_t{42}), Boolean(false), url),
            "s|42|0|file:///private/var/mobile/Applications/");
  EXPECT_EQ(format("%@ %@", Array{String("a")}, Dictionary{{"k", String("v")}}), "(\n    a\n) {\n    k = v;\n}");
  EXPECT_EQ(format("%@", Error::posix(13)), "Error Domain=POSIXErrorDomain Code=13 \"Permission denied\"");
  EXPECT_EQ(format("%@ %@ %@", Value(), String(), nullptr), "(null) (null) (null)");
  EXPECT_EQ(format("[%10@]", String("x")), "[         x]");
}

TEST(FormatTest, RuntimeFormatsNeverReadAnArgumentThatDoesNotFit) {
  EXPECT_EQ(format<int>(runtimeFormat("%s and %d"), 5), "%!s and %!d");
  EXPECT_EQ(format<>(runtimeFormat("%@ %d")), "%!@ %!d");
  EXPECT_EQ(format<const char*>(runtimeFormat("%@"), "text"), "%!@");
  EXPECT_EQ(format<int>(runtimeFormat("%n %d"), 5), "%!n 5");
  EXPECT_EQ(format<>(runtimeFormat("trailing %")), "trailing %");
  EXPECT_EQ(format<int>(runtimeFormat("%d extra"), 1), "1 extra");
}

}  // namespace
}  // namespace sl
