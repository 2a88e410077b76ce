// The formatter behind every message of the system: printf conversions plus
// "%@", which prints an object's text form (Value::description()).
//
//   std::string m = sl::format("mkdir of %@ failed: %s", url, strerror(e));
//
// A literal format is checked against the argument types at compile time: a
// wrong count, a conversion that does not fit its argument ("%s" given a
// number, "%@" given a C string), "%n" and unknown conversions do not
// compile. Formats made at run time are wrapped in runtimeFormat() and
// checked as they are used: a conversion without a fitting argument prints
// "%!" and its letter instead of reading anything.
//
// Arguments never pass through C varargs. Integers are converted as the
// conversion's length modifier says ("%d" an int, "%ld" a long, "%hhu" an
// unsigned char ...), exactly what printf would print for an argument of that
// type. "%s" takes const char*, std::string and std::string_view; a null
// const char* prints "(null)". "%@" takes any value handle or nullptr; a
// null handle prints "(null)". Flags, width and precision ('*' included)
// work as in printf, for "%s" and "%@" too.
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <string>
#include <string_view>
#include <type_traits>

#include "Platform/Value.h"

namespace sl {

enum class FormatArgType : uint8_t { Signed, Unsigned, Floating, CString, Object, Pointer };

// One argument, type-erased. It refers to the caller's object, so it lives
// no longer than the call it is made for.
struct FormatArg {
  FormatArgType type;
  union {
    int64_t i;
    uint64_t u;
    double d;
    struct {
      const char* data;  // null prints "(null)"
      size_t size;
    } s;
    const Value* object;  // null prints "(null)"
    const void* p;
  };
};
using FormatArgs = std::span<const FormatArg>;

namespace format_detail {

template <class T>
inline constexpr bool kAlwaysFalse = false;

template <class T>
consteval FormatArgType argType() {
  using D = std::remove_cvref_t<T>;
  if constexpr (std::is_enum_v<D>) {
    return std::is_signed_v<std::underlying_type_t<D>> ? FormatArgType::Signed : FormatArgType::Unsigned;
  } else if constexpr (std::is_same_v<D, bool>) {
    return FormatArgType::Unsigned;
  } else if constexpr (std::is_integral_v<D>) {
    return std::is_signed_v<D> ? FormatArgType::Signed : FormatArgType::Unsigned;
  } else if constexpr (std::is_floating_point_v<D>) {
    return FormatArgType::Floating;
  } else if constexpr (std::is_base_of_v<Value, D> || std::is_same_v<D, std::nullptr_t>) {
    return FormatArgType::Object;
  } else if constexpr (std::is_convertible_v<const D&, std::string_view>) {
    return FormatArgType::CString;
  } else if constexpr (std::is_pointer_v<D>) {
    return FormatArgType::Pointer;
  } else {
    static_assert(kAlwaysFalse<D>, "this type cannot be formatted");
  }
}

template <class T>
FormatArg makeArg(const T& value) {
  using D = std::remove_cvref_t<T>;
  FormatArg arg;
  arg.type = argType<T>();
  if constexpr (std::is_enum_v<D>) {
    if constexpr (std::is_signed_v<std::underlying_type_t<D>>)
      arg.i = static_cast<int64_t>(value);
    else
      arg.u = static_cast<uint64_t>(value);
  } else if constexpr (std::is_integral_v<D>) {
    if constexpr (std::is_signed_v<D>)
      arg.i = value;
    else
      arg.u = value;
  } else if constexpr (std::is_floating_point_v<D>) {
    arg.d = static_cast<double>(value);
  } else if constexpr (std::is_same_v<D, std::nullptr_t>) {
    arg.object = nullptr;
  } else if constexpr (std::is_base_of_v<Value, D>) {
    arg.object = &value;
  } else if constexpr (std::is_convertible_v<const D&, std::string_view>) {
    if constexpr (std::is_pointer_v<D>) {
      if (value == nullptr) {
        arg.s = {nullptr, 0};
        return arg;
      }
    }
    std::string_view view(value);
    arg.s = {view.data(), view.size()};
  } else {
    arg.p = static_cast<const void*>(value);
  }
  return arg;
}

// A call to one of these in a constant evaluation is what a bad literal
// format turns into; the function's name is the compiler's message.
void format_has_more_conversions_than_arguments();
void format_has_more_arguments_than_conversions();
void format_argument_does_not_fit_its_conversion();
void format_star_needs_an_integer_argument();
void format_has_an_unknown_or_forbidden_conversion();

constexpr bool fits(char conversion, FormatArgType type) {
  switch (conversion) {
    case 'd': case 'i': case 'o': case 'u': case 'x': case 'X': case 'c':
      return type == FormatArgType::Signed || type == FormatArgType::Unsigned;
    case 'e': case 'E': case 'f': case 'F': case 'g': case 'G': case 'a': case 'A':
      return type == FormatArgType::Floating;
    case 's':
      return type == FormatArgType::CString;
    case '@':
      return type == FormatArgType::Object;
    case 'p':
      return type == FormatArgType::Pointer || type == FormatArgType::CString;
    default:
      return false;
  }
}

constexpr void check(std::string_view format, std::span<const FormatArgType> types) {
  size_t next = 0;
  auto take = [&](bool isStar, char conversion) {
    if (next == types.size()) format_has_more_conversions_than_arguments();
    FormatArgType t = types[next++];
    if (isStar) {
      if (t != FormatArgType::Signed && t != FormatArgType::Unsigned) format_star_needs_an_integer_argument();
    } else if (!fits(conversion, t)) {
      format_argument_does_not_fit_its_conversion();
    }
  };
  for (size_t i = 0; i < format.size(); ++i) {
    if (format[i] != '%') continue;
    if (++i == format.size()) format_has_an_unknown_or_forbidden_conversion();
    if (format[i] == '%') continue;
    while (i < format.size() && std::string_view("-+ #0'").find(format[i]) != std::string_view::npos) ++i;
    if (i < format.size() && format[i] == '*') {
      take(true, '*');
      ++i;
    } else {
      while (i < format.size() && format[i] >= '0' && format[i] <= '9') ++i;
    }
    if (i < format.size() && format[i] == '.') {
      ++i;
      if (i < format.size() && format[i] == '*') {
        take(true, '*');
        ++i;
      } else {
        while (i < format.size() && format[i] >= '0' && format[i] <= '9') ++i;
      }
    }
    while (i < format.size() && std::string_view("hlqLjzt").find(format[i]) != std::string_view::npos) ++i;
    if (i == format.size() || std::string_view("diouxXeEfFgGaAcsp@").find(format[i]) == std::string_view::npos)
      format_has_an_unknown_or_forbidden_conversion();
    take(false, format[i]);
  }
  if (next != types.size()) format_has_more_arguments_than_conversions();
}

}  // namespace format_detail

// A format made at run time; it is checked as it is used.
struct RuntimeFormat {
  std::string_view str;
};
inline RuntimeFormat runtimeFormat(std::string_view format) { return {format}; }

// A format checked against Args: at compile time for a literal, at run time
// for a RuntimeFormat.
template <class... Args>
class FormatString {
 public:
  template <class S>
    requires std::is_convertible_v<const S&, std::string_view>
  consteval FormatString(const S& format) : str_(format) {  // NOLINT: literals convert
    constexpr FormatArgType kTypes[] = {format_detail::argType<Args>()..., FormatArgType::Object};
    format_detail::check(str_, std::span<const FormatArgType>(kTypes, sizeof...(Args)));
  }
  FormatString(RuntimeFormat format) : str_(format.str) {}  // NOLINT

  std::string_view get() const { return str_; }

 private:
  std::string_view str_;
};

// Formats with type-erased arguments. Used where a format and its arguments
// travel together as data (a v-variant of a variadic function).
std::string formatArgs(std::string_view format, FormatArgs args);
void appendFormatArgs(std::string& out, std::string_view format, FormatArgs args);

template <class... Args>
std::string format(FormatString<std::type_identity_t<Args>...> format, const Args&... args) {
  const FormatArg packed[] = {format_detail::makeArg(args)..., FormatArg{}};
  return formatArgs(format.get(), FormatArgs(packed, sizeof...(Args)));
}

}  // namespace sl
