// A small JSON writer for the program's machine-readable output.
//
// Output is always valid UTF-8: a byte of a string that is not part of valid
// UTF-8 is written as the four characters \xHH (a backslash, 'x' and two hex
// digits; inside a JSON string the backslash itself is escaped, so the text
// reads "\\xHH"). Paths are written as plain absolute paths.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "Platform/Value.h"

namespace stowline {

// A JSON string literal (with the quotes) for bytes.
std::string jsonString(std::string_view bytes);

// A value as JSON: strings, numbers, booleans, arrays and dictionaries as
// themselves, URLs as their plain path, data as base64 strings, dates as
// ISO 8601 strings, errors as their description, null as null.
std::string jsonValue(const sl::Value& value);

// Builds one JSON object or array by appending members in order.
class JsonWriter {
 public:
  JsonWriter& beginObject();
  JsonWriter& endObject();
  JsonWriter& beginArray();
  JsonWriter& endArray();
  // A member name inside an object; the next value call gives its value.
  JsonWriter& key(std::string_view name);
  JsonWriter& string(std::string_view bytes);
  JsonWriter& number(int64_t n);
  JsonWriter& number(uint64_t n);
  JsonWriter& number(double d);
  JsonWriter& boolean(bool b);
  JsonWriter& null();
  JsonWriter& raw(std::string_view json);  // an already encoded value
  JsonWriter& value(const sl::Value& v) { return raw(jsonValue(v)); }

  const std::string& str() const { return out_; }

 private:
  void separate();
  std::string out_;
  bool needComma_ = false;
};

// Reads one JSON document strictly (no trailing commas, comments or text
// after the value). Objects become dictionaries, arrays arrays, strings
// strings (\uXXXX decoded to UTF-8, and the writer's \xHH for a byte of
// 0x80 or above turned back into that byte), numbers numbers (integers as
// integers when they fit), true and false booleans, null a null value.
// Null with *error set on malformed input.
sl::Value parseJson(std::string_view text, sl::Error* error);

}  // namespace stowline
