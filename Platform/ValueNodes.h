// The nodes behind the value handles. Private to the value model's own
// sources (Value.cc, URL.cc, Error.cc).
#pragma once

#include <string>
#include <vector>

#include "Platform/Value.h"

namespace sl::detail {

struct StringNode : Node {
  explicit StringNode(std::string b) : Node(ValueKind::String), bytes(std::move(b)) {}
  std::string bytes;
};

struct DataNode : Node {
  explicit DataNode(std::vector<uint8_t> b) : Node(ValueKind::Data), bytes(std::move(b)) {}
  std::vector<uint8_t> bytes;
};

struct DateNode : Node {
  explicit DateNode(double s) : Node(ValueKind::Date), seconds(s) {}
  double seconds;
};

struct NumberNode : Node {
  explicit NumberNode(Number::Type t) : Node(ValueKind::Number), type(t) {}
  Number::Type type;
  union {
    int64_t i = 0;
    uint64_t u;
    double d;
  };
};

struct BooleanNode : Node {
  explicit BooleanNode(bool v) : Node(ValueKind::Boolean), value(v) {}
  bool value;
};

struct ArrayNode : Node {
  ArrayNode() : Node(ValueKind::Array) {}
  explicit ArrayNode(std::vector<Value> v) : Node(ValueKind::Array), values(std::move(v)) {}
  ArrayNode(const ArrayNode& other) : Node(ValueKind::Array), values(other.values) {}
  std::vector<Value> values;
};

struct DictionaryNode : Node {
  DictionaryNode() : Node(ValueKind::Dictionary) {}
  explicit DictionaryNode(Dictionary::Map e) : Node(ValueKind::Dictionary), entries(std::move(e)) {}
  DictionaryNode(const DictionaryNode& other) : Node(ValueKind::Dictionary), entries(other.entries) {}
  Dictionary::Map entries;
};

struct URLNode : Node {
  URLNode(std::string p, bool dir) : Node(ValueKind::URL), path(std::move(p)), isDirectory(dir) {}
  std::string path;
  bool isDirectory;
};

struct ErrorNode : Node {
  ErrorNode(std::string d, int64_t c, Dictionary info)
      : Node(ValueKind::Error), domain(std::move(d)), code(c), userInfo(std::move(info)) {}
  std::string domain;
  int64_t code;
  Dictionary userInfo;
};

}  // namespace sl::detail
