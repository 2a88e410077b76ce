#include "Platform/Format.h"

#include <climits>
#include <cstdio>
#include <sys/types.h>

namespace sl {

namespace {

struct Spec {
  std::string flags;
  int width = -1;      // -1: none
  int precision = -1;  // -1: none
  std::string length;  // "", "hh", "h", "l", "ll", "q", "L", "j", "z", "t"
  char conversion = 0;
};

// Integers arrive as 64-bit values; printf would have read them as the type
// the length modifier names, so they are narrowed (or widened) to exactly
// that type first.
long long asSigned(const FormatArg& a, const std::string& length) {
  int64_t v = a.type == FormatArgType::Signed ? a.i : static_cast<int64_t>(a.u);
  if (length == "hh") return static_cast<signed char>(v);
  if (length == "h") return static_cast<short>(v);
  if (length == "l") return static_cast<long>(v);
  if (length == "ll" || length == "q" || length == "j") return static_cast<long long>(v);
  if (length == "z") return static_cast<ssize_t>(v);
  if (length == "t") return static_cast<ptrdiff_t>(v);
  return static_cast<int>(v);
}

unsigned long long asUnsigned(const FormatArg& a, const std::string& length) {
  uint64_t v = a.type == FormatArgType::Signed ? static_cast<uint64_t>(a.i) : a.u;
  if (length == "hh") return static_cast<unsigned char>(v);
  if (length == "h") return static_cast<unsigned short>(v);
  if (length == "l") return static_cast<unsigned long>(v);
  if (length == "ll" || length == "q" || length == "j") return static_cast<unsigned long long>(v);
  if (length == "z") return static_cast<size_t>(v);
  if (length == "t") return static_cast<size_t>(v);
  return static_cast<unsigned>(v);
}

template <class T>
void appendPrintf(std::string& out, const Spec& spec, const char* length, T value) {
  std::string f;
  f.reserve(32);
  f += '%';
  f += spec.flags;
  if (spec.width >= 0) f += std::to_string(spec.width);
  if (spec.precision >= 0) {
    f += '.';
    f += std::to_string(spec.precision);
  }
  f += length;
  f += spec.conversion;
  int n = std::snprintf(nullptr, 0, f.c_str(), value);
  if (n <= 0) return;
  size_t start = out.size();
  out.resize(start + static_cast<size_t>(n) + 1);
  std::snprintf(out.data() + start, static_cast<size_t>(n) + 1, f.c_str(), value);
  out.resize(start + static_cast<size_t>(n));
}

// "%s" and "%@": precision cuts, width pads (on the left unless '-').
void appendText(std::string& out, const Spec& spec, std::string_view text) {
  if (spec.precision >= 0 && text.size() > static_cast<size_t>(spec.precision))
    text = text.substr(0, static_cast<size_t>(spec.precision));
  size_t pad = spec.width > 0 && static_cast<size_t>(spec.width) > text.size()
                   ? static_cast<size_t>(spec.width) - text.size()
                   : 0;
  bool left = spec.flags.find('-') != std::string::npos;
  if (!left) out.append(pad, ' ');
  out.append(text);
  if (left) out.append(pad, ' ');
}

bool isInteger(const FormatArg& a) { return a.type == FormatArgType::Signed || a.type == FormatArgType::Unsigned; }

}  // namespace

void appendFormatArgs(std::string& out, std::string_view format, FormatArgs args) {
  size_t next = 0;
  auto nextArg = [&]() -> const FormatArg* { return next < args.size() ? &args[next++] : nullptr; };
  auto bad = [&](char conversion) {
    out += "%!";
    out += conversion;
  };

  size_t i = 0;
  while (i < format.size()) {
    size_t percent = format.find('%', i);
    if (percent == std::string_view::npos) {
      out.append(format.substr(i));
      break;
    }
    out.append(format.substr(i, percent - i));
    i = percent + 1;
    if (i == format.size()) {
      out += '%';
      break;
    }
    if (format[i] == '%') {
      out += '%';
      ++i;
      continue;
    }

    Spec spec;
    bool ok = true;
    while (i < format.size() && std::string_view("-+ #0'").find(format[i]) != std::string_view::npos)
      spec.flags += format[i++];
    if (i < format.size() && format[i] == '*') {
      ++i;
      const FormatArg* a = nextArg();
      if (a && isInteger(*a)) {
        long long w = asSigned(*a, "");
        if (w < 0) {
          spec.flags += '-';
          w = -w;
        }
        spec.width = static_cast<int>(std::min<long long>(w, 4096));
      } else {
        ok = false;
      }
    } else {
      long long w = -1;
      while (i < format.size() && format[i] >= '0' && format[i] <= '9')
        w = std::min<long long>((w < 0 ? 0 : w) * 10 + (format[i++] - '0'), 4096);
      spec.width = static_cast<int>(w);
    }
    if (i < format.size() && format[i] == '.') {
      ++i;
      if (i < format.size() && format[i] == '*') {
        ++i;
        const FormatArg* a = nextArg();
        if (a && isInteger(*a)) {
          long long p = asSigned(*a, "");
          spec.precision = p < 0 ? -1 : static_cast<int>(std::min<long long>(p, INT_MAX));
        } else {
          ok = false;
        }
      } else {
        long long p = 0;
        while (i < format.size() && format[i] >= '0' && format[i] <= '9')
          p = std::min<long long>(p * 10 + (format[i++] - '0'), INT_MAX);
        spec.precision = static_cast<int>(p);
      }
    }
    while (i < format.size() && std::string_view("hlqLjzt").find(format[i]) != std::string_view::npos)
      spec.length += format[i++];
    if (i == format.size()) {
      bad('?');
      break;
    }
    spec.conversion = format[i++];

    const FormatArg* a = ok ? nextArg() : nullptr;
    switch (spec.conversion) {
      case 'd':
      case 'i':
        if (a && isInteger(*a))
          appendPrintf(out, spec, "ll", asSigned(*a, spec.length));
        else
          bad(spec.conversion);
        break;
      case 'o':
      case 'u':
      case 'x':
      case 'X':
        if (a && isInteger(*a))
          appendPrintf(out, spec, "ll", asUnsigned(*a, spec.length));
        else
          bad(spec.conversion);
        break;
      case 'c':
        if (a && isInteger(*a))
          appendPrintf(out, spec, "", static_cast<int>(static_cast<unsigned char>(asUnsigned(*a, ""))));
        else
          bad(spec.conversion);
        break;
      case 'e': case 'E': case 'f': case 'F': case 'g': case 'G': case 'a': case 'A':
        if (a && a->type == FormatArgType::Floating)
          appendPrintf(out, spec, "", a->d);
        else
          bad(spec.conversion);
        break;
      case 's':
        if (a && a->type == FormatArgType::CString)
          appendText(out, spec, a->s.data ? std::string_view(a->s.data, a->s.size) : std::string_view("(null)"));
        else
          bad(spec.conversion);
        break;
      case '@':
        if (a && a->type == FormatArgType::Object)
          appendText(out, spec, a->object ? a->object->description() : std::string("(null)"));
        else
          bad(spec.conversion);
        break;
      case 'p':
        if (a && a->type == FormatArgType::Pointer)
          appendPrintf(out, spec, "", a->p);
        else if (a && a->type == FormatArgType::CString)
          appendPrintf(out, spec, "", static_cast<const void*>(a->s.data));
        else
          bad(spec.conversion);
        break;
      default:
        // Unknown conversions (and "%n") consume nothing and print nothing
        // but the marker.
        if (a) --next;
        bad(spec.conversion);
    }
  }
}

std::string formatArgs(std::string_view format, FormatArgs args) {
  std::string out;
  out.reserve(format.size() + 32);
  appendFormatArgs(out, format, args);
  return out;
}

}  // namespace sl
