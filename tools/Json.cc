#include "tools/Json.h"

#include <charconv>
#include <cmath>
#include <ctime>
#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <string>
#include <vector>

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

namespace {

constexpr int kMaxJsonDepth = 256;

class JsonParser {
 public:
  explicit JsonParser(std::string_view text) : s_(text) {}

  sl::Value document(sl::Error* error) {
    sl::Value v = value(0);
    if (failed_.empty()) {
      skipSpace();
      if (i_ != s_.size()) fail("text after the value");
    }
    if (!failed_.empty()) {
      if (error) {
        *error = sl::Error(sl::kPOSIXErrorDomain, EINVAL,
                           sl::Dictionary(sl::Dictionary::Map{
                               {sl::kLocalizedDescriptionKey,
                                sl::String("malformed JSON at offset " + std::to_string(at_) + ": " + failed_)}}));
      }
      return nullptr;
    }
    return v;
  }

 private:
  void fail(const char* what) {
    if (failed_.empty()) {
      failed_ = what;
      at_ = i_;
    }
  }
  void skipSpace() {
    while (i_ < s_.size() && (s_[i_] == ' ' || s_[i_] == '\t' || s_[i_] == '\n' || s_[i_] == '\r')) ++i_;
  }
  bool literal(std::string_view word) {
    if (s_.substr(i_, word.size()) != word) return false;
    i_ += word.size();
    return true;
  }

  sl::Value value(int depth) {
    if (depth > kMaxJsonDepth) {
      fail("nested too deeply");
      return nullptr;
    }
    skipSpace();
    if (i_ >= s_.size()) {
      fail("unexpected end");
      return nullptr;
    }
    const char c = s_[i_];
    if (c == '{') return object(depth);
    if (c == '[') return array(depth);
    if (c == '"') {
      std::string out;
      if (!string(&out)) return nullptr;
      return sl::String(std::move(out));
    }
    if (c == '-' || (c >= '0' && c <= '9')) return number();
    if (literal("true")) return sl::Boolean(true);
    if (literal("false")) return sl::Boolean(false);
    if (literal("null")) return nullptr;
    fail("unexpected character");
    return nullptr;
  }

  sl::Value object(int depth) {
    ++i_;
    sl::Dictionary::Map map;
    skipSpace();
    if (i_ < s_.size() && s_[i_] == '}') {
      ++i_;
      return sl::Dictionary(std::move(map));
    }
    for (;;) {
      skipSpace();
      std::string key;
      if (i_ >= s_.size() || s_[i_] != '"') {
        fail("expected a member name");
        return nullptr;
      }
      if (!string(&key)) return nullptr;
      skipSpace();
      if (i_ >= s_.size() || s_[i_] != ':') {
        fail("expected ':'");
        return nullptr;
      }
      ++i_;
      sl::Value member = value(depth + 1);
      if (!failed_.empty()) return nullptr;
      map.insert_or_assign(std::move(key), std::move(member));
      skipSpace();
      if (i_ < s_.size() && s_[i_] == ',') {
        ++i_;
        continue;
      }
      if (i_ < s_.size() && s_[i_] == '}') {
        ++i_;
        return sl::Dictionary(std::move(map));
      }
      fail("expected ',' or '}'");
      return nullptr;
    }
  }

  sl::Value array(int depth) {
    ++i_;
    std::vector<sl::Value> values;
    skipSpace();
    if (i_ < s_.size() && s_[i_] == ']') {
      ++i_;
      return sl::Array(std::move(values));
    }
    for (;;) {
      sl::Value element = value(depth + 1);
      if (!failed_.empty()) return nullptr;
      values.push_back(std::move(element));
      skipSpace();
      if (i_ < s_.size() && s_[i_] == ',') {
        ++i_;
        continue;
      }
      if (i_ < s_.size() && s_[i_] == ']') {
        ++i_;
        return sl::Array(std::move(values));
      }
      fail("expected ',' or ']'");
      return nullptr;
    }
  }

  static int hexDigit(char c) {
    if (c >= '0' && c <= '9') return c - '0';
    if (c >= 'a' && c <= 'f') return c - 'a' + 10;
    if (c >= 'A' && c <= 'F') return c - 'A' + 10;
    return -1;
  }

  bool hex4(uint32_t* out) {
    if (i_ + 4 > s_.size()) return false;
    uint32_t v = 0;
    for (int k = 0; k < 4; ++k) {
      const int d = hexDigit(s_[i_ + static_cast<size_t>(k)]);
      if (d < 0) return false;
      v = (v << 4) | static_cast<uint32_t>(d);
    }
    i_ += 4;
    *out = v;
    return true;
  }

  static void appendUtf8(std::string* out, uint32_t cp) {
    if (cp < 0x80) {
      *out += static_cast<char>(cp);
    } else if (cp < 0x800) {
      *out += static_cast<char>(0xC0 | (cp >> 6));
      *out += static_cast<char>(0x80 | (cp & 0x3F));
    } else if (cp < 0x10000) {
      *out += static_cast<char>(0xE0 | (cp >> 12));
      *out += static_cast<char>(0x80 | ((cp >> 6) & 0x3F));
      *out += static_cast<char>(0x80 | (cp & 0x3F));
    } else {
      *out += static_cast<char>(0xF0 | (cp >> 18));
      *out += static_cast<char>(0x80 | ((cp >> 12) & 0x3F));
      *out += static_cast<char>(0x80 | ((cp >> 6) & 0x3F));
      *out += static_cast<char>(0x80 | (cp & 0x3F));
    }
  }

  // A string token at s_[i_] == '"'. A decoded backslash followed by 'x'
  // and two hex digits naming a byte of 0x80 or above is that byte: the
  // writer's form for bytes that are not UTF-8.
  bool string(std::string* out) {
    ++i_;
    for (;;) {
      if (i_ >= s_.size()) {
        fail("unterminated string");
        return false;
      }
      const char c = s_[i_++];
      if (c == '"') return true;
      if (static_cast<unsigned char>(c) < 0x20) {
        fail("control character in a string");
        return false;
      }
      if (c != '\\') {
        *out += c;
        continue;
      }
      if (i_ >= s_.size()) {
        fail("unterminated escape");
        return false;
      }
      const char e = s_[i_++];
      switch (e) {
        case '"': *out += '"'; break;
        case '/': *out += '/'; break;
        case 'b': *out += '\b'; break;
        case 'f': *out += '\f'; break;
        case 'n': *out += '\n'; break;
        case 'r': *out += '\r'; break;
        case 't': *out += '\t'; break;
        case '\\':
          if (i_ + 2 < s_.size() && s_[i_] == 'x' && hexDigit(s_[i_ + 1]) >= 8 && hexDigit(s_[i_ + 2]) >= 0) {
            *out += static_cast<char>(hexDigit(s_[i_ + 1]) * 16 + hexDigit(s_[i_ + 2]));
            i_ += 3;
          } else {
            *out += '\\';
          }
          break;
        case 'u': {
          uint32_t cp = 0;
          if (!hex4(&cp)) {
            fail("bad \\u escape");
            return false;
          }
          if (cp >= 0xD800 && cp <= 0xDBFF) {
            uint32_t low = 0;
            if (!literal("\\u") || !hex4(&low) || low < 0xDC00 || low > 0xDFFF) {
              fail("unpaired surrogate");
              return false;
            }
            cp = 0x10000 + ((cp - 0xD800) << 10) + (low - 0xDC00);
          } else if (cp >= 0xDC00 && cp <= 0xDFFF) {
            fail("unpaired surrogate");
            return false;
          }
          appendUtf8(out, cp);
          break;
        }
        default:
          fail("unknown escape");
          return false;
      }
    }
  }

  sl::Value number() {
    const size_t begin = i_;
    bool integral = true;
    if (s_[i_] == '-') ++i_;
    auto digits = [&] {
      const size_t from = i_;
      while (i_ < s_.size() && s_[i_] >= '0' && s_[i_] <= '9') ++i_;
      return i_ - from;
    };
    const size_t intStart = i_;
    const size_t intDigits = digits();
    if (intDigits == 0 || (intDigits > 1 && s_[intStart] == '0')) {
      fail("bad number");
      return nullptr;
    }
    if (i_ < s_.size() && s_[i_] == '.') {
      integral = false;
      ++i_;
      if (digits() == 0) {
        fail("bad number");
        return nullptr;
      }
    }
    if (i_ < s_.size() && (s_[i_] == 'e' || s_[i_] == 'E')) {
      integral = false;
      ++i_;
      if (i_ < s_.size() && (s_[i_] == '+' || s_[i_] == '-')) ++i_;
      if (digits() == 0) {
        fail("bad number");
        return nullptr;
      }
    }
    const std::string_view token = s_.substr(begin, i_ - begin);
    if (integral) {
      if (token[0] == '-') {
        int64_t v = 0;
        if (std::from_chars(token.data(), token.data() + token.size(), v).ec == std::errc()) return sl::Number(v);
      } else {
        uint64_t v = 0;
        if (std::from_chars(token.data(), token.data() + token.size(), v).ec == std::errc()) {
          return v <= static_cast<uint64_t>(INT64_MAX) ? sl::Number(static_cast<int64_t>(v)) : sl::Number(v);
        }
      }
    }
    // Reals, and integers too large for 64 bits.
    const std::string copy(token);
    char* end = nullptr;
    const double d = std::strtod(copy.c_str(), &end);
    return sl::Number(d);
  }

  std::string_view s_;
  size_t i_ = 0;
  std::string failed_;
  size_t at_ = 0;
};

}  // namespace

sl::Value parseJson(std::string_view text, sl::Error* error) { return JsonParser(text).document(error); }

}  // namespace stowline
