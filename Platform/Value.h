// The value model: the objects that property lists, error records and the
// messages of the system are made of.
//
// Every value is a handle to an immutable node shared by reference count, so
// copying one costs an atomic increment. A handle may be null, which is how
// an absent object is written; asking a null handle for its content answers
// the empty or zero value of its kind, never a crash. The kinds are
//
//   String      bytes, nominally UTF-8 (file names that are not survive)
//   Data        bytes
//   Date        seconds since 2001-01-01 00:00:00 UTC
//   Number      signed or unsigned 64-bit integer, or a double
//   Boolean     true or false, a kind of its own (never equal to 0 or 1)
//   Array       ordered values
//   Dictionary  string keys to values, kept sorted by key
//   URL         a file URL (URL.h)
//   Error       an error record (Error.h)
//
// Arrays and dictionaries can be changed through their handle: a change
// applies to this handle alone. When the node is shared with any other
// handle it is copied first, so whatever was shared stays as it was. A
// "mutable copy" is therefore just a copy of the handle that is then
// changed. A null Array or Dictionary handle becomes an empty one on its
// first change.
#pragma once

#include <cstddef>
#include <cstdint>
#include <initializer_list>
#include <map>
#include <memory>
#include <span>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace sl {

enum class ValueKind : uint8_t {
  Null,
  String,
  Data,
  Date,
  Number,
  Boolean,
  Array,
  Dictionary,
  URL,
  Error,
};

class String;
class Data;
class Date;
class Number;
class Boolean;
class Array;
class Dictionary;
class URL;
class Error;

namespace detail {
struct Node {
  explicit Node(ValueKind k) : kind(k) {}
  virtual ~Node() = default;
  const ValueKind kind;
};
}  // namespace detail

class Value {
 public:
  Value() = default;
  Value(std::nullptr_t) {}  // NOLINT: null converts implicitly, as an absent object does

  bool isNull() const { return node_ == nullptr; }
  explicit operator bool() const { return node_ != nullptr; }
  ValueKind kind() const { return node_ ? node_->kind : ValueKind::Null; }

  // Each answers a handle to the same node when the value is of that kind,
  // and a null handle otherwise.
  String asString() const;
  Data asData() const;
  Date asDate() const;
  Number asNumber() const;
  Boolean asBoolean() const;
  Array asArray() const;
  Dictionary asDictionary() const;
  URL asURL() const;
  Error asError() const;

  // The text form that "%@" prints: a string is itself, a number its decimal
  // form, a boolean 1 or 0, a URL its URL string, an error record
  // `Error Domain=D Code=N "description" UserInfo={...}`, arrays and
  // dictionaries the bracketed description form. Null is "(null)".
  std::string description() const;

  // Deep equality of kind and content. Numbers compare by value (1 equals
  // 1.0); no value of one kind equals a value of another.
  friend bool operator==(const Value& a, const Value& b);

  // The name of the value's kind as messages print it: "String",
  // "Dictionary", ... ("Null" for a null handle).
  std::string_view typeName() const;

 protected:
  explicit Value(std::shared_ptr<const detail::Node> node) : node_(std::move(node)) {}
  const detail::Node* node() const { return node_.get(); }

  // For the changing members of Array and Dictionary: makes this handle the
  // only owner of its node, copying it when it is shared.
  template <class NodeT>
  NodeT* uniqueNode();

  template <class Handle, ValueKind K>
  Handle handleIf() const;

  std::shared_ptr<const detail::Node> node_;

  friend class Array;
  friend class Dictionary;
};

class String : public Value {
 public:
  String() = default;
  String(std::nullptr_t) {}  // NOLINT
  String(std::string_view bytes);  // NOLINT: literals and std::strings convert
  String(const char* cString);     // NOLINT
  String(const std::string& bytes) : String(std::string_view(bytes)) {}  // NOLINT
  String(std::string&& bytes);  // NOLINT

  // The bytes; empty for a null string.
  const std::string& str() const;
  std::string_view view() const { return str(); }
  const char* c_str() const { return str().c_str(); }
  size_t length() const { return str().size(); }

  friend bool operator==(const String& a, std::string_view b) { return !a.isNull() && a.view() == b; }

 private:
  friend class Value;
  explicit String(std::shared_ptr<const detail::Node> n) : Value(std::move(n)) {}
};

class Data : public Value {
 public:
  Data() = default;
  Data(std::nullptr_t) {}  // NOLINT
  explicit Data(std::span<const uint8_t> bytes);
  explicit Data(std::vector<uint8_t>&& bytes);
  explicit Data(std::string_view bytes);

  std::span<const uint8_t> bytes() const;
  size_t size() const { return bytes().size(); }

 private:
  friend class Value;
  explicit Data(std::shared_ptr<const detail::Node> n) : Value(std::move(n)) {}
};

class Date : public Value {
 public:
  Date() = default;
  Date(std::nullptr_t) {}  // NOLINT
  explicit Date(double secondsSinceReferenceDate);

  // Seconds since 2001-01-01 00:00:00 UTC; 0 for a null date.
  double timeIntervalSinceReferenceDate() const;
  static constexpr double kUnixEpochOffset = 978307200.0;  // 2001-01-01 in Unix seconds

 private:
  friend class Value;
  explicit Date(std::shared_ptr<const detail::Node> n) : Value(std::move(n)) {}
};

class Number : public Value {
 public:
  enum class Type : uint8_t { Signed, Unsigned, Real };

  Number() = default;
  Number(std::nullptr_t) {}  // NOLINT
  explicit Number(int64_t value);
  explicit Number(int value) : Number(static_cast<int64_t>(value)) {}
  explicit Number(long long value) : Number(static_cast<int64_t>(value)) {}
  // An unsigned value up to INT64_MAX is stored as signed; only larger ones
  // keep the unsigned type.
  explicit Number(uint64_t value);
  explicit Number(unsigned value) : Number(static_cast<uint64_t>(value)) {}
  explicit Number(unsigned long long value) : Number(static_cast<uint64_t>(value)) {}
  explicit Number(double value);

  Type type() const;
  bool isReal() const { return type() == Type::Real; }
  // Conversions as C would make them; 0 for a null number.
  int64_t int64Value() const;
  uint64_t uint64Value() const;
  double doubleValue() const;
  int32_t int32Value() const { return static_cast<int32_t>(int64Value()); }

 private:
  friend class Value;
  explicit Number(std::shared_ptr<const detail::Node> n) : Value(std::move(n)) {}
};

class Boolean : public Value {
 public:
  Boolean() = default;
  Boolean(std::nullptr_t) {}  // NOLINT
  explicit Boolean(bool value);

  // false for a null boolean.
  bool boolValue() const;

 private:
  friend class Value;
  explicit Boolean(std::shared_ptr<const detail::Node> n) : Value(std::move(n)) {}
};

class Array : public Value {
 public:
  Array() = default;
  Array(std::nullptr_t) {}  // NOLINT
  Array(std::initializer_list<Value> values);
  explicit Array(std::vector<Value> values);
  // A new, empty, non-null array.
  static Array create() { return Array(std::vector<Value>()); }

  size_t count() const { return values().size(); }
  bool isEmpty() const { return values().empty(); }
  // The value at index, or null past the end.
  Value at(size_t index) const;
  Value operator[](size_t index) const { return at(index); }
  const std::vector<Value>& values() const;
  auto begin() const { return values().begin(); }
  auto end() const { return values().end(); }

  void append(Value value);
  void insert(Value value, size_t index);  // index is clamped to count()
  void removeAt(size_t index);             // ignored past the end

 private:
  friend class Value;
  explicit Array(std::shared_ptr<const detail::Node> n) : Value(std::move(n)) {}
};

class Dictionary : public Value {
 public:
  using Map = std::map<std::string, Value, std::less<>>;

  Dictionary() = default;
  Dictionary(std::nullptr_t) {}  // NOLINT
  Dictionary(std::initializer_list<std::pair<const std::string, Value>> entries);
  explicit Dictionary(Map entries);
  // A new, empty, non-null dictionary.
  static Dictionary create() { return Dictionary(Map()); }

  size_t count() const { return entries().size(); }
  bool isEmpty() const { return entries().empty(); }
  // The value under key, or null.
  Value get(std::string_view key) const;
  bool contains(std::string_view key) const;
  const Map& entries() const;
  auto begin() const { return entries().begin(); }
  auto end() const { return entries().end(); }

  // Sets or replaces; a null value removes the key.
  void set(std::string_view key, Value value);
  void remove(std::string_view key);

 private:
  friend class Value;
  explicit Dictionary(std::shared_ptr<const detail::Node> n) : Value(std::move(n)) {}
};

}  // namespace sl
