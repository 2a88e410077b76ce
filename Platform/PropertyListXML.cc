// The XML property-list format.
//
//   <?xml version="1.0" encoding="UTF-8"?>
//   <plist version="1.0">
//   <dict>
//   	<key>Name</key>
//   	<string>value</string>
//   </dict>
//   </plist>
//
// Reading: the root element is <plist> holding exactly one value. Values are
// <dict> (<key> then a value, repeatedly; a repeated key keeps its last
// value), <array>, <string>, <data> (base64, whitespace ignored), <date>
// ("YYYY-MM-DDTHH:MM:SSZ", UTC), <integer> (decimal or 0x hex, optional sign;
// above INT64_MAX up to UINT64_MAX an unsigned number), <real> (also nan,
// inf, -inf), <true/> and <false/>. Anything else is refused: other
// elements, non-blank text outside the leaves, elements inside leaves.
//
// Hostile documents: expat never loads anything from outside (no external
// entity handler that loads, parameter entities never parsed), so a DOCTYPE
// naming an external DTD is accepted and ignored. Entity declarations are
// refused outright: property lists never need them, and with none declared
// neither an entity bomb nor an external entity can be written. expat's own
// amplification limit is set as a second line.
//
// Writing: tab indentation, keys in the dictionary's order, data in base64
// on one line, reals in the shortest form that reads back to the same double,
// dates to the whole second (rounded down).
#define XML_DTD  // declares the amplification limits; the library is built with DTD support
#include <expat.h>

#include <charconv>
#include <cmath>
#include <cstring>
#include <memory>

#include "Platform/Format.h"
#include "Platform/PropertyList.h"

namespace sl::plist_detail {

namespace {

constexpr std::string_view kWhitespace = " \t\r\n";

std::string_view trimmed(std::string_view s) {
  size_t first = s.find_first_not_of(kWhitespace);
  if (first == std::string_view::npos) return {};
  return s.substr(first, s.find_last_not_of(kWhitespace) - first + 1);
}

// ---- dates ------------------------------------------------------------------

// Days from 1970-01-01 to the given civil date (proleptic Gregorian).
int64_t daysFromCivil(int64_t y, unsigned m, unsigned d) {
  y -= m <= 2;
  int64_t era = (y >= 0 ? y : y - 399) / 400;
  unsigned yoe = static_cast<unsigned>(y - era * 400);
  unsigned doy = (153 * (m > 2 ? m - 3 : m + 9) + 2) / 5 + d - 1;
  unsigned doe = yoe * 365 + yoe / 4 - yoe / 100 + doy;
  return era * 146097 + static_cast<int64_t>(doe) - 719468;
}

void civilFromDays(int64_t z, int64_t* y, unsigned* m, unsigned* d) {
  z += 719468;
  int64_t era = (z >= 0 ? z : z - 146096) / 146097;
  unsigned doe = static_cast<unsigned>(z - era * 146097);
  unsigned yoe = (doe - doe / 1460 + doe / 36524 - doe / 146096) / 365;
  unsigned doy = doe - (365 * yoe + yoe / 4 - yoe / 100);
  unsigned mp = (5 * doy + 2) / 153;
  *d = doy - (153 * mp + 2) / 5 + 1;
  *m = mp < 10 ? mp + 3 : mp - 9;
  *y = static_cast<int64_t>(yoe) + era * 400 + (*m <= 2);
}

const int64_t kReferenceDay = daysFromCivil(2001, 1, 1);

bool parseDate(std::string_view text, double* seconds) {
  text = trimmed(text);
  // YYYY-MM-DDTHH:MM:SSZ
  static constexpr std::string_view kShape = "dddd-dd-ddTdd:dd:ddZ";
  if (text.size() != kShape.size()) return false;
  for (size_t k = 0; k < kShape.size(); ++k) {
    bool ok = kShape[k] == 'd' ? (text[k] >= '0' && text[k] <= '9') : text[k] == kShape[k];
    if (!ok) return false;
  }
  auto num = [&](size_t at, size_t n) {
    unsigned v = 0;
    for (size_t k = at; k < at + n; ++k) v = v * 10 + static_cast<unsigned>(text[k] - '0');
    return v;
  };
  unsigned year = num(0, 4), month = num(5, 2), day = num(8, 2);
  unsigned hour = num(11, 2), minute = num(14, 2), second = num(17, 2);
  static constexpr unsigned kDays[] = {31, 29, 31, 30, 31, 30, 31, 31, 30, 31, 30, 31};
  if (year < 1 || month < 1 || month > 12 || day < 1 || day > kDays[month - 1] || hour > 23 || minute > 59 || second > 59)
    return false;
  bool leap = (year % 4 == 0 && year % 100 != 0) || year % 400 == 0;
  if (month == 2 && day == 29 && !leap) return false;
  int64_t days = daysFromCivil(year, month, day) - kReferenceDay;
  *seconds = static_cast<double>(days * 86400 + hour * 3600 + minute * 60 + second);
  return true;
}

bool formatDate(double seconds, std::string* out) {
  // Years 0001 to 9999 are the ones the four-digit form can carry.
  if (!std::isfinite(seconds) || seconds < -63113904000.0 || seconds >= 252423993600.0) return false;
  int64_t whole = static_cast<int64_t>(std::floor(seconds));
  int64_t days = whole >= 0 ? whole / 86400 : -((-whole + 86399) / 86400);
  int64_t rest = whole - days * 86400;
  int64_t y;
  unsigned m, d;
  civilFromDays(days + kReferenceDay, &y, &m, &d);
  *out = format("%04lld-%02u-%02uT%02lld:%02lld:%02lldZ", static_cast<long long>(y), m, d,
                static_cast<long long>(rest / 3600), static_cast<long long>(rest / 60 % 60),
                static_cast<long long>(rest % 60));
  return true;
}

// ---- numbers and data ---------------------------------------------------------

bool parseInteger(std::string_view text, Number* out) {
  text = trimmed(text);
  bool negative = false;
  if (!text.empty() && (text[0] == '-' || text[0] == '+')) {
    negative = text[0] == '-';
    text.remove_prefix(1);
  }
  int base = 10;
  if (text.size() > 2 && text[0] == '0' && (text[1] == 'x' || text[1] == 'X')) {
    base = 16;
    text.remove_prefix(2);
  }
  uint64_t magnitude;
  auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), magnitude, base);
  if (text.empty() || ec != std::errc() || end != text.data() + text.size()) return false;
  if (!negative) {
    *out = Number(magnitude);  // signed up to INT64_MAX, unsigned above
  } else {
    if (magnitude > uint64_t{1} << 63) return false;
    *out = Number(static_cast<int64_t>(0 - magnitude));
  }
  return true;
}

bool parseReal(std::string_view text, double* out) {
  text = trimmed(text);
  if (!text.empty() && text[0] == '+') {
    text.remove_prefix(1);
    if (!text.empty() && text[0] == '-') return false;
  }
  auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), *out);
  return !text.empty() && ec == std::errc() && end == text.data() + text.size();
}

constexpr char kBase64[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";

bool decodeBase64(std::string_view text, std::vector<uint8_t>* out) {
  uint32_t group = 0;
  int bits = 0;
  bool padding = false;
  for (char c : text) {
    if (kWhitespace.find(c) != std::string_view::npos) continue;
    if (c == '=') {
      padding = true;
      continue;
    }
    const char* at = c ? std::strchr(kBase64, c) : nullptr;
    if (at == nullptr || padding) return false;
    group = (group << 6) | static_cast<uint32_t>(at - kBase64);
    bits += 6;
    if (bits >= 8) {
      bits -= 8;
      out->push_back(static_cast<uint8_t>(group >> bits));
      group &= (1u << bits) - 1;
    }
  }
  return bits < 6;  // one character alone in its last quantum carries no byte
}

void appendBase64(std::string* out, std::span<const uint8_t> bytes) {
  size_t k = 0;
  for (; k + 3 <= bytes.size(); k += 3) {
    uint32_t g = uint32_t{bytes[k]} << 16 | uint32_t{bytes[k + 1]} << 8 | bytes[k + 2];
    for (int s = 18; s >= 0; s -= 6) out->push_back(kBase64[(g >> s) & 0x3F]);
  }
  if (size_t rest = bytes.size() - k) {
    uint32_t g = uint32_t{bytes[k]} << 16 | (rest == 2 ? uint32_t{bytes[k + 1]} << 8 : 0);
    out->push_back(kBase64[(g >> 18) & 0x3F]);
    out->push_back(kBase64[(g >> 12) & 0x3F]);
    out->push_back(rest == 2 ? kBase64[(g >> 6) & 0x3F] : '=');
    out->push_back('=');
  }
}

// ---- reader ---------------------------------------------------------------

enum class Element { Plist, Dict, Array, Key, String, Data, Date, Integer, Real, True, False };

struct ElementName {
  std::string_view name;
  Element element;
};
constexpr ElementName kElements[] = {
    {"plist", Element::Plist},     {"dict", Element::Dict}, {"array", Element::Array},     {"key", Element::Key},
    {"string", Element::String},   {"data", Element::Data}, {"date", Element::Date},       {"integer", Element::Integer},
    {"real", Element::Real},       {"true", Element::True}, {"false", Element::False},
};

bool holdsText(Element e) { return e >= Element::Key && e <= Element::Real; }
bool holdsValues(Element e) { return e <= Element::Array; }

using ParserPtr = std::unique_ptr<XML_ParserStruct, decltype(&XML_ParserFree)>;

class XMLReader {
 public:
  Value read(std::span<const uint8_t> bytes, Error* error) {
    ParserPtr parser(XML_ParserCreate(nullptr), &XML_ParserFree);
    if (!parser) {
      fail(error, ENOMEM, "XML property list: cannot make a parser");
      return nullptr;
    }
    parser_ = parser.get();
    XML_SetUserData(parser_, this);
    XML_SetElementHandler(parser_, &XMLReader::onStart, &XMLReader::onEnd);
    XML_SetCharacterDataHandler(parser_, &XMLReader::onText);
    XML_SetEntityDeclHandler(parser_, &XMLReader::onEntityDecl);
    XML_SetSkippedEntityHandler(parser_, &XMLReader::onSkippedEntity);
    XML_SetExternalEntityRefHandler(parser_, &XMLReader::onExternalEntity);
    XML_SetParamEntityParsing(parser_, XML_PARAM_ENTITY_PARSING_NEVER);
#if XML_MAJOR_VERSION > 2 || (XML_MAJOR_VERSION == 2 && XML_MINOR_VERSION >= 4)
    XML_SetBillionLaughsAttackProtectionMaximumAmplification(parser_, 10.0f);
    XML_SetBillionLaughsAttackProtectionActivationThreshold(parser_, 1 << 20);
#endif

    // XML_Parse takes an int length: feed large documents in pieces.
    constexpr size_t kChunk = size_t{1} << 24;
    size_t done = 0;
    do {
      size_t n = std::min(kChunk, bytes.size() - done);
      bool last = done + n == bytes.size();
      if (XML_Parse(parser_, reinterpret_cast<const char*>(bytes.data() + done), static_cast<int>(n), last) !=
          XML_STATUS_OK) {
        if (message_.empty())
          message_ = format("line %lu, column %lu: %s", XML_GetCurrentLineNumber(parser_),
                            XML_GetCurrentColumnNumber(parser_), XML_ErrorString(XML_GetErrorCode(parser_)));
        fail(error, EINVAL, "XML property list: " + message_);
        return nullptr;
      }
      done += n;
    } while (done < bytes.size());
    return result_;  // expat demands a root element, and its end set result_
  }

 private:
  struct Frame {
    Element element;
    std::string name;
    std::vector<Value> values;  // plist, array
    Dictionary::Map entries;    // dict
    std::string key;
    bool hasKey = false;
    std::string text;  // leaves
  };

  static XMLReader* self(void* userData) { return static_cast<XMLReader*>(userData); }

  void stop(std::string message) {
    if (!message_.empty()) return;
    message_ = format("line %lu: %s", XML_GetCurrentLineNumber(parser_), message);
    XML_StopParser(parser_, XML_FALSE);
  }

  static void onStart(void* userData, const XML_Char* name, const XML_Char** /*attributes*/) {
    self(userData)->start(name);
  }
  static void onEnd(void* userData, const XML_Char* /*name*/) { self(userData)->end(); }
  static void onText(void* userData, const XML_Char* s, int length) {
    self(userData)->text(std::string_view(s, static_cast<size_t>(length)));
  }
  static void onEntityDecl(void* userData, const XML_Char* name, int /*isParameter*/, const XML_Char*, int,
                           const XML_Char*, const XML_Char*, const XML_Char*, const XML_Char*) {
    self(userData)->stop(format("entity declarations are not allowed (\"%s\")", name));
  }
  static void onSkippedEntity(void* userData, const XML_Char* name, int /*isParameter*/) {
    self(userData)->stop(format("reference to undeclared entity \"%s\"", name));
  }
  static int onExternalEntity(XML_Parser, const XML_Char*, const XML_Char*, const XML_Char*, const XML_Char*) {
    return XML_STATUS_ERROR;  // never loaded
  }

  void start(std::string_view name) {
    if (!message_.empty()) return;
    const ElementName* known = nullptr;
    for (const ElementName& e : kElements)
      if (e.name == name) known = &e;
    if (known == nullptr) return stop(format("unknown element <%s>", std::string(name)));
    Element element = known->element;
    if (stack_.empty()) {
      if (element != Element::Plist) return stop(format("the root element is <%s>, not <plist>", std::string(name)));
    } else {
      Frame& parent = stack_.back();
      if (!holdsValues(parent.element) || element == Element::Plist)
        return stop(format("<%s> inside <%s>", std::string(name), parent.name));
      if (parent.element == Element::Dict) {
        if (element == Element::Key && parent.hasKey)
          return stop(format("key \"%s\" has no value", parent.key));
        if (element != Element::Key && !parent.hasKey)
          return stop(format("<%s> in a dictionary without a key", std::string(name)));
      } else if (element == Element::Key) {
        return stop(format("<key> outside a dictionary"));
      } else if (parent.element == Element::Plist && !parent.values.empty()) {
        return stop("<plist> holds more than one value");
      }
      if (element == Element::Dict || element == Element::Array) {
        if (++containers_ > kMaxPropertyListDepth)
          return stop(format("containers nested deeper than %d levels", kMaxPropertyListDepth));
      }
    }
    stack_.push_back(Frame{element, std::string(name), {}, {}, {}, false, {}});
  }

  void text(std::string_view s) {
    if (!message_.empty() || stack_.empty()) return;
    Frame& frame = stack_.back();
    if (holdsText(frame.element))
      frame.text.append(s);
    else if (s.find_first_not_of(kWhitespace) != std::string_view::npos)
      stop(format("text inside <%s>", frame.name));
  }

  void end() {
    if (!message_.empty()) return;
    Frame frame = std::move(stack_.back());
    stack_.pop_back();
    Value value;
    switch (frame.element) {
      case Element::Key:
        stack_.back().key = std::move(frame.text);
        stack_.back().hasKey = true;
        return;
      case Element::String: value = String(std::move(frame.text)); break;
      case Element::Data: {
        std::vector<uint8_t> bytes;
        if (!decodeBase64(frame.text, &bytes)) return stop("<data> is not valid base64");
        value = Data(std::move(bytes));
        break;
      }
      case Element::Date: {
        double seconds;
        if (!parseDate(frame.text, &seconds)) return stop(format("date \"%s\" is not YYYY-MM-DDTHH:MM:SSZ", frame.text));
        value = Date(seconds);
        break;
      }
      case Element::Integer: {
        Number n;
        if (!parseInteger(frame.text, &n)) return stop(format("integer \"%s\" is not a 64-bit integer", frame.text));
        value = n;
        break;
      }
      case Element::Real: {
        double d;
        if (!parseReal(frame.text, &d)) return stop(format("real \"%s\" is not a number", frame.text));
        value = Number(d);
        break;
      }
      case Element::True: value = Boolean(true); break;
      case Element::False: value = Boolean(false); break;
      case Element::Array:
        --containers_;
        value = Array(std::move(frame.values));
        break;
      case Element::Dict:
        --containers_;
        if (frame.hasKey) return stop(format("key \"%s\" has no value", frame.key));
        value = Dictionary(std::move(frame.entries));
        break;
      case Element::Plist:
        if (frame.values.empty()) return stop("<plist> holds no value");
        result_ = std::move(frame.values.front());
        return;
    }
    Frame& parent = stack_.back();
    if (parent.element == Element::Dict) {
      parent.entries.insert_or_assign(std::move(parent.key), std::move(value));
      parent.key.clear();
      parent.hasKey = false;
    } else {
      parent.values.push_back(std::move(value));
    }
  }

  XML_Parser parser_ = nullptr;
  std::vector<Frame> stack_;
  int containers_ = 0;
  Value result_;
  std::string message_;
};

// ---- writer ---------------------------------------------------------------

class XMLWriter {
 public:
  bool write(const Value& value, std::vector<uint8_t>* out, Error* error) {
    text_ = "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\">\n";
    if (!writeValue(value, 0)) return fail(error, code_, "XML property list: " + message_);
    text_ += "</plist>\n";
    out->assign(text_.begin(), text_.end());
    return true;
  }

 private:
  bool bad(int code, std::string message) {
    code_ = code;
    message_ = std::move(message);
    return false;
  }

  void indent(int level) { text_.append(static_cast<size_t>(level), '\t'); }

  // Appends s with & < > escaped; refuses what XML 1.0 cannot carry.
  bool appendEscaped(std::string_view s) {
    for (size_t i = 0; i < s.size();) {
      size_t at = i;
      int32_t cp = decodeUTF8(s, &i);
      if (cp < 0)
        return bad(EILSEQ, format("a string is not valid UTF-8 (byte 0x%02X at offset %zu)",
                                  unsigned{static_cast<uint8_t>(s[at])}, at));
      if ((cp < 0x20 && cp != '\t' && cp != '\n' && cp != '\r') || cp == 0xFFFE || cp == 0xFFFF)
        return bad(EILSEQ, format("a string holds the character U+%04X, which XML 1.0 cannot carry", unsigned(cp)));
      switch (cp) {
        case '&': text_ += "&amp;"; break;
        case '<': text_ += "&lt;"; break;
        case '>': text_ += "&gt;"; break;
        case '\r': text_ += "&#13;"; break;  // a raw CR would come back as LF
        default: text_.append(s.substr(at, i - at));
      }
    }
    return true;
  }

  bool leaf(int level, std::string_view element, std::string_view content) {
    indent(level);
    text_ += '<';
    text_ += element;
    text_ += '>';
    text_ += content;
    text_ += "</";
    text_ += element;
    text_ += ">\n";
    return true;
  }

  bool writeValue(const Value& v, int level) {
    char buf[64];
    switch (v.kind()) {
      case ValueKind::Null: return bad(EINVAL, "a null value has no property-list form");
      case ValueKind::URL: return bad(EINVAL, "a URL has no property-list form");
      case ValueKind::Error: return bad(EINVAL, "an error record has no property-list form");
      case ValueKind::String:
        indent(level);
        text_ += "<string>";
        if (!appendEscaped(v.asString().view())) return false;
        text_ += "</string>\n";
        return true;
      case ValueKind::Data: {
        std::string encoded;
        appendBase64(&encoded, v.asData().bytes());
        return leaf(level, "data", encoded);
      }
      case ValueKind::Date: {
        std::string date;
        if (!formatDate(v.asDate().timeIntervalSinceReferenceDate(), &date))
          return bad(EINVAL, "a date lies outside the years 0001 to 9999");
        return leaf(level, "date", date);
      }
      case ValueKind::Number: {
        Number n = v.asNumber();
        if (n.type() == Number::Type::Real) {
          double d = n.doubleValue();
          if (std::isnan(d)) return leaf(level, "real", "nan");
          if (std::isinf(d)) return leaf(level, "real", d < 0 ? "-inf" : "inf");
          auto r = std::to_chars(buf, buf + sizeof buf, d);
          return leaf(level, "real", std::string_view(buf, static_cast<size_t>(r.ptr - buf)));
        }
        auto r = n.type() == Number::Type::Unsigned ? std::to_chars(buf, buf + sizeof buf, n.uint64Value())
                                                    : std::to_chars(buf, buf + sizeof buf, n.int64Value());
        return leaf(level, "integer", std::string_view(buf, static_cast<size_t>(r.ptr - buf)));
      }
      case ValueKind::Boolean:
        indent(level);
        text_ += v.asBoolean().boolValue() ? "<true/>\n" : "<false/>\n";
        return true;
      case ValueKind::Array:
      case ValueKind::Dictionary: {
        bool isDict = v.kind() == ValueKind::Dictionary;
        if (level + 1 > kMaxPropertyListDepth)
          return bad(EINVAL, format("containers nested deeper than %d levels", kMaxPropertyListDepth));
        const char* name = isDict ? "dict" : "array";
        indent(level);
        if (isDict ? v.asDictionary().isEmpty() : v.asArray().isEmpty()) {
          text_ += format("<%s/>\n", name);
          return true;
        }
        text_ += format("<%s>\n", name);
        if (isDict) {
          for (const auto& [key, element] : v.asDictionary()) {
            indent(level + 1);
            text_ += "<key>";
            if (!appendEscaped(key)) return false;
            text_ += "</key>\n";
            if (!writeValue(element, level + 1)) return false;
          }
        } else {
          for (const Value& element : v.asArray())
            if (!writeValue(element, level + 1)) return false;
        }
        indent(level);
        text_ += format("</%s>\n", name);
        return true;
      }
    }
    return bad(EINVAL, "unknown value kind");
  }

  std::string text_;
  int code_ = EINVAL;
  std::string message_;
};

}  // namespace

Value parseXML(std::span<const uint8_t> bytes, Error* error) { return XMLReader().read(bytes, error); }

bool writeXML(const Value& value, std::vector<uint8_t>* out, Error* error) {
  return XMLWriter().write(value, out, error);
}

}  // namespace sl::plist_detail
