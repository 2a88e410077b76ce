#include "Platform/Value.h"

#include <charconv>
#include <cstring>
#include <cmath>
#include <ctime>

#include "Platform/Error.h"
#include "Platform/URL.h"
#include "Platform/ValueNodes.h"

namespace sl {

using namespace detail;

// ---- handles of each kind ------------------------------------------------

template <class Handle, ValueKind K>
Handle Value::handleIf() const {
  if (node_ && node_->kind == K) return Handle(node_);
  return Handle();
}

String Value::asString() const { return handleIf<String, ValueKind::String>(); }
Data Value::asData() const { return handleIf<Data, ValueKind::Data>(); }
Date Value::asDate() const { return handleIf<Date, ValueKind::Date>(); }
Number Value::asNumber() const { return handleIf<Number, ValueKind::Number>(); }
Boolean Value::asBoolean() const { return handleIf<Boolean, ValueKind::Boolean>(); }
Array Value::asArray() const { return handleIf<Array, ValueKind::Array>(); }
Dictionary Value::asDictionary() const { return handleIf<Dictionary, ValueKind::Dictionary>(); }
URL Value::asURL() const { return handleIf<URL, ValueKind::URL>(); }
Error Value::asError() const { return handleIf<Error, ValueKind::Error>(); }

template <class NodeT>
NodeT* Value::uniqueNode() {
  if (!node_) {
    node_ = std::make_shared<NodeT>();
  } else if (node_.use_count() > 1) {
    node_ = std::make_shared<NodeT>(static_cast<const NodeT&>(*node_));
  }
  // The node is ours alone now; it was made non-const for this handle.
  return const_cast<NodeT*>(static_cast<const NodeT*>(node_.get()));
}

std::string_view Value::typeName() const {
  switch (kind()) {
    case ValueKind::Null: return "Null";
    case ValueKind::String: return "String";
    case ValueKind::Data: return "Data";
    case ValueKind::Date: return "Date";
    case ValueKind::Number: return "Number";
    case ValueKind::Boolean: return "Boolean";
    case ValueKind::Array: return "Array";
    case ValueKind::Dictionary: return "Dictionary";
    case ValueKind::URL: return "URL";
    case ValueKind::Error: return "Error";
  }
  return "Unknown";
}

namespace {
const std::string& emptyString() {
  static const std::string empty;
  return empty;
}
}  // namespace

String::String(std::string_view bytes) : Value(std::make_shared<StringNode>(std::string(bytes))) {}
String::String(const char* cString) {
  if (cString != nullptr) node_ = std::make_shared<StringNode>(std::string(cString));
}
String::String(std::string&& bytes) : Value(std::make_shared<StringNode>(std::move(bytes))) {}
const std::string& String::str() const {
  return node() ? static_cast<const StringNode*>(node())->bytes : emptyString();
}

Data::Data(std::span<const uint8_t> bytes)
    : Value(std::make_shared<DataNode>(std::vector<uint8_t>(bytes.begin(), bytes.end()))) {}
Data::Data(std::vector<uint8_t>&& bytes) : Value(std::make_shared<DataNode>(std::move(bytes))) {}
Data::Data(std::string_view bytes)
    : Value(std::make_shared<DataNode>(std::vector<uint8_t>(bytes.begin(), bytes.end()))) {}
std::span<const uint8_t> Data::bytes() const {
  if (!node()) return {};
  return static_cast<const DataNode*>(node())->bytes;
}

Date::Date(double seconds) : Value(std::make_shared<DateNode>(seconds)) {}
double Date::timeIntervalSinceReferenceDate() const {
  return node() ? static_cast<const DateNode*>(node())->seconds : 0.0;
}

Number::Number(int64_t value) : Value(std::make_shared<NumberNode>(Type::Signed)) {
  const_cast<NumberNode*>(static_cast<const NumberNode*>(node()))->i = value;
}
Number::Number(uint64_t value)
    : Value(std::make_shared<NumberNode>(value > static_cast<uint64_t>(INT64_MAX) ? Type::Unsigned : Type::Signed)) {
  auto* n = const_cast<NumberNode*>(static_cast<const NumberNode*>(node()));
  if (n->type == Type::Unsigned)
    n->u = value;
  else
    n->i = static_cast<int64_t>(value);
}
Number::Number(double value) : Value(std::make_shared<NumberNode>(Type::Real)) {
  const_cast<NumberNode*>(static_cast<const NumberNode*>(node()))->d = value;
}
Number::Type Number::type() const {
  return node() ? static_cast<const NumberNode*>(node())->type : Type::Signed;
}
int64_t Number::int64Value() const {
  if (!node()) return 0;
  const auto* n = static_cast<const NumberNode*>(node());
  switch (n->type) {
    case Type::Signed: return n->i;
    case Type::Unsigned: return static_cast<int64_t>(n->u);
    case Type::Real:
      if (std::isnan(n->d)) return 0;
      if (n->d >= 9223372036854775807.0) return INT64_MAX;
      if (n->d <= -9223372036854775808.0) return INT64_MIN;
      return static_cast<int64_t>(n->d);
  }
  return 0;
}
uint64_t Number::uint64Value() const {
  if (!node()) return 0;
  const auto* n = static_cast<const NumberNode*>(node());
  switch (n->type) {
    case Type::Signed: return static_cast<uint64_t>(n->i);
    case Type::Unsigned: return n->u;
    case Type::Real:
      if (std::isnan(n->d) || n->d <= 0) return n->d < 0 ? static_cast<uint64_t>(int64Value()) : 0;
      if (n->d >= 18446744073709551615.0) return UINT64_MAX;
      return static_cast<uint64_t>(n->d);
  }
  return 0;
}
double Number::doubleValue() const {
  if (!node()) return 0;
  const auto* n = static_cast<const NumberNode*>(node());
  switch (n->type) {
    case Type::Signed: return static_cast<double>(n->i);
    case Type::Unsigned: return static_cast<double>(n->u);
    case Type::Real: return n->d;
  }
  return 0;
}

Boolean::Boolean(bool value) : Value(std::make_shared<BooleanNode>(value)) {}
bool Boolean::boolValue() const { return node() && static_cast<const BooleanNode*>(node())->value; }

Array::Array(std::initializer_list<Value> values) : Value(std::make_shared<ArrayNode>(std::vector<Value>(values))) {}
Array::Array(std::vector<Value> values) : Value(std::make_shared<ArrayNode>(std::move(values))) {}
const std::vector<Value>& Array::values() const {
  static const std::vector<Value> empty;
  return node() ? static_cast<const ArrayNode*>(node())->values : empty;
}
Value Array::at(size_t index) const {
  const auto& v = values();
  return index < v.size() ? v[index] : Value();
}
void Array::append(Value value) { uniqueNode<ArrayNode>()->values.push_back(std::move(value)); }
void Array::insert(Value value, size_t index) {
  auto& v = uniqueNode<ArrayNode>()->values;
  v.insert(v.begin() + static_cast<ptrdiff_t>(std::min(index, v.size())), std::move(value));
}
void Array::removeAt(size_t index) {
  if (index >= count()) return;
  auto& v = uniqueNode<ArrayNode>()->values;
  v.erase(v.begin() + static_cast<ptrdiff_t>(index));
}

Dictionary::Dictionary(std::initializer_list<std::pair<const std::string, Value>> entries)
    : Value(std::make_shared<DictionaryNode>()) {
  auto& map = const_cast<DictionaryNode*>(static_cast<const DictionaryNode*>(node()))->entries;
  for (const auto& [key, value] : entries)
    if (value) map.insert_or_assign(key, value);
}
Dictionary::Dictionary(Map entries) : Value(std::make_shared<DictionaryNode>(std::move(entries))) {}
const Dictionary::Map& Dictionary::entries() const {
  static const Map empty;
  return node() ? static_cast<const DictionaryNode*>(node())->entries : empty;
}
Value Dictionary::get(std::string_view key) const {
  const auto& map = entries();
  auto it = map.find(key);
  return it == map.end() ? Value() : it->second;
}
bool Dictionary::contains(std::string_view key) const { return entries().find(key) != entries().end(); }
void Dictionary::set(std::string_view key, Value value) {
  if (!value) {
    remove(key);
    return;
  }
  auto& map = uniqueNode<DictionaryNode>()->entries;
  auto it = map.find(key);
  if (it != map.end())
    it->second = std::move(value);
  else
    map.emplace(std::string(key), std::move(value));
}
void Dictionary::remove(std::string_view key) {
  if (!contains(key)) return;
  auto& map = uniqueNode<DictionaryNode>()->entries;
  map.erase(map.find(key));
}

// ---- equality -----------------------------------------------------------

bool operator==(const Value& a, const Value& b) {
  if (a.node_ == b.node_) return true;
  if (a.kind() != b.kind()) return false;
  switch (a.kind()) {
    case ValueKind::Null: return true;
    case ValueKind::String: return a.asString().str() == b.asString().str();
    case ValueKind::Data: {
      auto x = a.asData().bytes(), y = b.asData().bytes();
      return std::equal(x.begin(), x.end(), y.begin(), y.end());
    }
    case ValueKind::Date:
      return a.asDate().timeIntervalSinceReferenceDate() == b.asDate().timeIntervalSinceReferenceDate();
    case ValueKind::Number: {
      Number x = a.asNumber(), y = b.asNumber();
      if (x.isReal() || y.isReal()) return x.doubleValue() == y.doubleValue();
      // Both integers: equal when the same mathematical value.
      bool xNeg = x.type() == Number::Type::Signed && x.int64Value() < 0;
      bool yNeg = y.type() == Number::Type::Signed && y.int64Value() < 0;
      return xNeg == yNeg && x.uint64Value() == y.uint64Value();
    }
    case ValueKind::Boolean: return a.asBoolean().boolValue() == b.asBoolean().boolValue();
    case ValueKind::Array: return a.asArray().values() == b.asArray().values();
    case ValueKind::Dictionary: return a.asDictionary().entries() == b.asDictionary().entries();
    case ValueKind::URL:
      return a.asURL().path() == b.asURL().path() && a.asURL().isDirectory() == b.asURL().isDirectory();
    case ValueKind::Error: {
      Error x = a.asError(), y = b.asError();
      return x.domain() == y.domain() && x.code() == y.code() && x.userInfo() == y.userInfo();
    }
  }
  return false;
}

// ---- text forms -----------------------------------------------------------

namespace {

std::string numberText(const Number& n) {
  char buf[64];
  switch (n.type()) {
    case Number::Type::Signed: return std::to_string(n.int64Value());
    case Number::Type::Unsigned: return std::to_string(n.uint64Value());
    case Number::Type::Real: {
      double d = n.doubleValue();
      if (std::isnan(d)) return "nan";
      if (std::isinf(d)) return d < 0 ? "-inf" : "inf";
      auto r = std::to_chars(buf, buf + sizeof buf, d);
      return std::string(buf, r.ptr);
    }
  }
  return "0";
}

std::string dateText(double seconds) {
  // "2001-01-01 00:00:00 +0000"
  double unixSeconds = std::floor(seconds + Date::kUnixEpochOffset);
  time_t t = static_cast<time_t>(unixSeconds);
  struct tm tm {};
  if (gmtime_r(&t, &tm) == nullptr) return "(invalid date)";
  char buf[64];
  strftime(buf, sizeof buf, "%Y-%m-%d %H:%M:%S +0000", &tm);
  return buf;
}

std::string dataText(std::span<const uint8_t> bytes) {
  static const char kHex[] = "0123456789abcdef";
  std::string out = "<";
  for (size_t i = 0; i < bytes.size(); ++i) {
    if (i > 0 && i % 4 == 0) out += ' ';
    out += kHex[bytes[i] >> 4];
    out += kHex[bytes[i] & 0xf];
  }
  out += '>';
  return out;
}

// Strings inside the bracketed forms are quoted unless they are plain words.
std::string quotedIfNeeded(std::string_view s) {
  bool plain = !s.empty();
  for (unsigned char c : s) {
    if (!(isalnum(c) || c == '_' || c == '$' || c == '.' || c == '/' || c == ':' || c == '-')) {
      plain = false;
      break;
    }
  }
  if (plain) return std::string(s);
  std::string out = "\"";
  for (char c : s) {
    switch (c) {
      case '"': out += "\\\""; break;
      case '\\': out += "\\\\"; break;
      case '\n': out += "\\n"; break;
      case '\t': out += "\\t"; break;
      default: out += c;
    }
  }
  out += '"';
  return out;
}

void describe(const Value& v, int indent, std::string& out);

void describeNested(const Value& v, int indent, std::string& out) {
  if (v.kind() == ValueKind::String) {
    out += quotedIfNeeded(v.asString().view());
  } else {
    describe(v, indent, out);
  }
}

void describe(const Value& v, int indent, std::string& out) {
  const std::string pad(static_cast<size_t>(indent) * 4, ' ');
  switch (v.kind()) {
    case ValueKind::Null: out += "(null)"; return;
    case ValueKind::String: out += v.asString().str(); return;
    case ValueKind::Data: out += dataText(v.asData().bytes()); return;
    case ValueKind::Date: out += dateText(v.asDate().timeIntervalSinceReferenceDate()); return;
    case ValueKind::Number: out += numberText(v.asNumber()); return;
    case ValueKind::Boolean: out += v.asBoolean().boolValue() ? "1" : "0"; return;
    case ValueKind::URL: out += v.asURL().absoluteString(); return;
    case ValueKind::Array: {
      out += "(\n";
      const auto& values = v.asArray().values();
      for (size_t i = 0; i < values.size(); ++i) {
        out += pad + "    ";
        describeNested(values[i], indent + 1, out);
        out += i + 1 < values.size() ? ",\n" : "\n";
      }
      out += pad + ")";
      return;
    }
    case ValueKind::Dictionary: {
      out += "{\n";
      for (const auto& [key, value] : v.asDictionary()) {
        out += pad + "    " + quotedIfNeeded(key) + " = ";
        describeNested(value, indent + 1, out);
        out += ";\n";
      }
      out += pad + "}";
      return;
    }
    case ValueKind::Error: {
      Error e = v.asError();
      out += "Error Domain=" + e.domain() + " Code=" + std::to_string(e.code()) + " \"";
      if (String d = e.localizedDescription())
        out += d.str();
      else if (e.domain() == kPOSIXErrorDomain)
        out += strerror(static_cast<int>(e.code()));
      else
        out += "(null)";
      out += "\"";
      Dictionary info = e.userInfo();
      if (!info.isEmpty()) {
        out += " UserInfo={";
        bool first = true;
        for (const auto& [key, value] : info) {
          if (!first) out += ", ";
          first = false;
          out += key + "=";
          describe(value, 0, out);
        }
        out += "}";
      }
      return;
    }
  }
}

}  // namespace

std::string Value::description() const {
  std::string out;
  describe(*this, 0, out);
  return out;
}

}  // namespace sl
