#include "tools/Json.h"

#include <charconv>
#include <cmath>
#include <ctime>

#include "Platform/Error.h"
#include "Platform/URL.h"

namespace stowline {

namespace {

// Length of the valid UTF-8 sequence at s[i], or 0 when it is not one.
size_t validSequence(std::string_view s, size_t i) {
  const auto byte = [&](size_t k) { return static_cast<unsigned char>(s[k]); };
  unsigned char c = byte(i);
  size_t n;
  uint32_t cp;
  if (c < 0x80) return 1;
  if ((c & 0xE0) == 0xC0) {
    n = 2;
    cp = c & 0x1F;
  } else if ((c & 0xF0) == 0xE0) {
    n = 3;
    cp = c & 0x0F;
  } else if ((c & 0xF8) == 0xF0) {
    n = 4;
    cp = c & 0x07;
  } else {
    return 0;
  }
  if (i + n > s.size()) return 0;
  for (size_t k = 1; k < n; ++k) {
    if ((byte(i + k) & 0xC0) != 0x80) return 0;
    cp = (cp << 6) | (byte(i + k) & 0x3F);
  }
  // Overlong forms, surrogates and values past U+10FFFF are not valid.
  static const uint32_t kMin[] = {0, 0, 0x80, 0x800, 0x10000};
  if (cp < kMin[n] || cp > 0x10FFFF || (cp >= 0xD800 && cp <= 0xDFFF)) return 0;
  return n;
}

std::string base64(std::span<const uint8_t> bytes) {
  static const char kAlphabet[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
  std::string out;
  size_t i = 0;
  for (; i + 2 < bytes.size(); i += 3) {
    uint32_t v = (uint32_t{bytes[i]} << 16) | (uint32_t{bytes[i + 1]} << 8) | bytes[i + 2];
    for (int shift : {18, 12, 6, 0}) out += kAlphabet[(v >> shift) & 63];
  }
  if (i < bytes.size()) {
    uint32_t v = uint32_t{bytes[i]} << 16;
    if (i + 1 < bytes.size()) v |= uint32_t{bytes[i + 1]} << 8;
    out += kAlphabet[(v >> 18) & 63];
    out += kAlphabet[(v >> 12) & 63];
    out += i + 1 < bytes.size() ? kAlphabet[(v >> 6) & 63] : '=';
    out += '=';
  }
  return out;
}

}  // namespace

std::string jsonString(std::string_view s) {
  static const char kHex[] = "0123456789abcdef";
  std::string out = "\"";
  for (size_t i = 0; i < s.size();) {
    size_t n = validSequence(s, i);
    if (n == 0) {
      unsigned char c = static_cast<unsigned char>(s[i]);
      out += "\\\\x";
      out += kHex[c >> 4];
      out += kHex[c & 15];
      ++i;
      continue;
    }
    if (n > 1) {
      out.append(s.substr(i, n));
      i += n;
      continue;
    }
    char c = s[i++];
    switch (c) {
      case '"': out += "\\\""; break;
      case '\\': out += "\\\\"; break;
      case '\n': out += "\\n"; break;
      case '\r': out += "\\r"; break;
      case '\t': out += "\\t"; break;
      default:
        if (static_cast<unsigned char>(c) < 0x20) {
          out += "\\u00";
          out += kHex[(c >> 4) & 15];
          out += kHex[c & 15];
        } else {
          out += c;
        }
    }
  }
  out += '"';
  return out;
}

std::string jsonValue(const sl::Value& value) {
  switch (value.kind()) {
    case sl::ValueKind::Null: return "null";
    case sl::ValueKind::String: return jsonString(value.asString().view());
    case sl::ValueKind::URL: return jsonString(value.asURL().path());
    case sl::ValueKind::Error: return jsonString(value.description());
    case sl::ValueKind::Boolean: return value.asBoolean().boolValue() ? "true" : "false";
    case sl::ValueKind::Data: return jsonString(base64(value.asData().bytes()));
    case sl::ValueKind::Number: {
      sl::Number n = value.asNumber();
      if (n.isReal() && !std::isfinite(n.doubleValue())) return "null";
      return value.description();
    }
    case sl::ValueKind::Date: {
      time_t t = static_cast<time_t>(std::floor(value.asDate().timeIntervalSinceReferenceDate() +
                                                sl::Date::kUnixEpochOffset));
      struct tm tm {};
      char buf[32] = "";
      if (gmtime_r(&t, &tm) != nullptr) strftime(buf, sizeof buf, "%Y-%m-%dT%H:%M:%SZ", &tm);
      return jsonString(buf);
    }
    case sl::ValueKind::Array: {
      JsonWriter w;
      w.beginArray();
      for (const sl::Value& v : value.asArray()) w.value(v);
      return w.endArray().str();
    }
    case sl::ValueKind::Dictionary: {
      JsonWriter w;
      w.beginObject();
      for (const auto& [k, v] : value.asDictionary()) w.key(k).value(v);
      return w.endObject().str();
    }
  }
  return "null";
}

void JsonWriter::separate() {
  if (needComma_) out_ += ',';
  needComma_ = true;
}

JsonWriter& JsonWriter::beginObject() {
  separate();
  out_ += '{';
  needComma_ = false;
  return *this;
}
JsonWriter& JsonWriter::endObject() {
  out_ += '}';
  needComma_ = true;
  return *this;
}
JsonWriter& JsonWriter::beginArray() {
  separate();
  out_ += '[';
  needComma_ = false;
  return *this;
}
JsonWriter& JsonWriter::endArray() {
  out_ += ']';
  needComma_ = true;
  return *this;
}
JsonWriter& JsonWriter::key(std::string_view name) {
  separate();
  out_ += jsonString(name);
  out_ += ':';
  needComma_ = false;
  return *this;
}
JsonWriter& JsonWriter::string(std::string_view bytes) { return raw(jsonString(bytes)); }
JsonWriter& JsonWriter::number(int64_t n) { return raw(std::to_string(n)); }
JsonWriter& JsonWriter::number(uint64_t n) { return raw(std::to_string(n)); }
JsonWriter& JsonWriter::number(double d) {
  if (!std::isfinite(d)) return null();
  char buf[64];
  auto r = std::to_chars(buf, buf + sizeof buf, d);
  return raw(std::string_view(buf, static_cast<size_t>(r.ptr - buf)));
}
JsonWriter& JsonWriter::boolean(bool b) { return raw(b ? "true" : "false"); }
JsonWriter& JsonWriter::null() { return raw("null"); }
JsonWriter& JsonWriter::raw(std::string_view json) {
  separate();
  out_ += json;
  return *this;
}

}  // namespace stowline
