// The binary property-list format, "bplist00".
//
// Layout: the 8-byte magic, the objects, an offset table (one big-endian
// offset per object, all of one width), and a 32-byte trailer: 5 unused
// bytes, the sort version, the offset width, the reference width, then as
// 8-byte big-endian numbers the object count, the top object's index and
// the offset table's position. Each object starts with a marker byte whose
// high nibble is its type and whose low nibble is a size or a count; a count
// of 15 or more is written as 0xF followed by an integer object.
//
//   0x00 null, 0x08 false, 0x09 true, 0x0F fill
//   0x1n integer of 2^n bytes (1, 2 and 4 unsigned, 8 signed, 16 signed)
//   0x2n real of 2^n bytes (4 or 8)
//   0x33 date: 8-byte real, seconds since 2001-01-01 UTC
//   0x4n data, 0x5n ASCII string, 0x6n UTF-16BE string (n code units)
//   0x8n UID of n+1 bytes
//   0xAn array, 0xBn ordered set, 0xCn set: n object references
//   0xDn dictionary: n key references, then n value references
//
// What the reader decides where the format leaves room:
//   - null, fill and UID objects have no value in this model and are
//     refused; sets and ordered sets are read as arrays;
//   - a 16-byte integer is read when it fits 64 bits: high half zero (an
//     unsigned value) or the sign extension of a negative low half;
//   - bytes of 0x80 and above in an ASCII string are read as Latin-1;
//   - in a UTF-16 string, a lone code unit 0xDC80..0xDCFF is the byte
//     (unit - 0xDC00) of a string that is not UTF-8 (what the writer makes
//     of such bytes); any other lone surrogate becomes U+FFFD.
//   - a dictionary key that repeats keeps its last value.
// Objects are parsed once and cached by index, so a file whose containers
// share children (a legitimate DAG) costs time in its size, not in the size
// of the tree it unfolds to; nesting is still checked for every place a
// shared container lands. What the reader returns is such a tree all the
// same (its handles share the nodes), and describing, comparing or writing
// it visits every place a node lands, so a file whose top object unfolds to
// more values than unfoldLimit() allows is refused. Without shared containers
// a file unfolds to at most about one value per byte; the limit leaves room
// for sharing sixteen times that, and never more than kMaxUnfoldedValues.
#include <algorithm>
#include <cerrno>
#include <cstring>
#include <unordered_map>

#include "Platform/Format.h"
#include "Platform/PropertyList.h"

namespace sl::plist_detail {

namespace {

constexpr uint8_t kMagic[8] = {'b', 'p', 'l', 'i', 's', 't', '0', '0'};
constexpr size_t kHeaderSize = sizeof kMagic;
constexpr size_t kTrailerSize = 32;
constexpr uint64_t kMaxUnfoldedValues = uint64_t{1} << 24;
constexpr uint64_t kUnfoldedValuesPerByte = 16;
constexpr uint64_t kUnfoldedValuesAlways = 4096;

uint64_t unfoldLimit(size_t fileSize) {
  return std::min<uint64_t>(kMaxUnfoldedValues, kUnfoldedValuesAlways + kUnfoldedValuesPerByte * fileSize);
}

using ull = unsigned long long;

uint64_t readBigEndian(const uint8_t* p, size_t width) {
  uint64_t v = 0;
  for (size_t k = 0; k < width; ++k) v = (v << 8) | p[k];
  return v;
}

double bitsToDouble(uint64_t bits) {
  double d;
  std::memcpy(&d, &bits, sizeof d);
  return d;
}

// ---- reader ---------------------------------------------------------------

class BinaryReader {
 public:
  explicit BinaryReader(std::span<const uint8_t> bytes) : bytes_(bytes) {}

  Value read(Error* error) {
    Value top;
    if (!readTrailer() || !parseObject(topObject_, 0, &top)) {
      fail(error, EINVAL, "bplist: " + message_);
      return nullptr;
    }
    return top;
  }

 private:
  enum : uint8_t { kUnseen, kOnPath, kDone };

  bool bad(std::string message) {
    message_ = std::move(message);
    return false;
  }

  bool readTrailer() {
    if (bytes_.size() < kHeaderSize + kTrailerSize + 2)
      return bad(format("file of %zu bytes is too short", bytes_.size()));
    if (std::memcmp(bytes_.data(), kMagic, kHeaderSize) != 0)
      return bad(format("unsupported version \"%s\"",
                        std::string(reinterpret_cast<const char*>(bytes_.data()) + 6, 2)));
    const uint8_t* t = bytes_.data() + bytes_.size() - kTrailerSize;
    offsetSize_ = t[6];
    refSize_ = t[7];
    numObjects_ = readBigEndian(t + 8, 8);
    topObject_ = readBigEndian(t + 16, 8);
    tableOffset_ = readBigEndian(t + 24, 8);
    if (offsetSize_ < 1 || offsetSize_ > 8) return bad(format("offset size %u is invalid", unsigned{offsetSize_}));
    if (refSize_ < 1 || refSize_ > 8) return bad(format("object reference size %u is invalid", unsigned{refSize_}));
    if (numObjects_ == 0) return bad("the file holds no objects");
    if (topObject_ >= numObjects_)
      return bad(format("top object %llu out of range (%llu objects)", ull{topObject_}, ull{numObjects_}));
    uint64_t tableEnd = bytes_.size() - kTrailerSize;
    if (tableOffset_ <= kHeaderSize || tableOffset_ > tableEnd)
      return bad(format("offset table at %llu is outside the file (%zu bytes)", ull{tableOffset_}, bytes_.size()));
    if (numObjects_ > (tableEnd - tableOffset_) / offsetSize_)
      return bad(format("offset table of %llu objects runs past the trailer", ull{numObjects_}));
    // numObjects_ is now below the file size, which bounds these.
    state_.assign(numObjects_, kUnseen);
    height_.assign(numObjects_, 0);
    unfolded_.assign(numObjects_, 1);
    cache_.resize(numObjects_);
    return true;
  }

  // Whether [start, start + length) lies in the object area.
  bool inObjects(uint64_t start, uint64_t length) const {
    return start <= tableOffset_ && length <= tableOffset_ - start;
  }

  // The object's count and where its content starts.
  bool readCount(uint64_t index, uint64_t offset, uint64_t* count, uint64_t* start) {
    uint8_t info = bytes_[offset] & 0x0F;
    if (info != 0x0F) {
      *count = info;
      *start = offset + 1;
      return true;
    }
    if (!inObjects(offset + 1, 1)) return bad(format("count of object %llu runs past the objects", ull{index}));
    uint8_t marker = bytes_[offset + 1];
    if ((marker >> 4) != 0x1 || (marker & 0x0F) > 3)
      return bad(format("count of object %llu is not an integer (marker 0x%02x)", ull{index}, unsigned{marker}));
    size_t width = size_t{1} << (marker & 0x0F);
    if (!inObjects(offset + 2, width)) return bad(format("count of object %llu runs past the objects", ull{index}));
    *count = readBigEndian(&bytes_[offset + 2], width);
    *start = offset + 2 + width;
    return true;
  }

  // Checks that `count` items of `unit` bytes from `start` lie in the object area.
  bool contentFits(uint64_t index, uint64_t start, uint64_t count, uint64_t unit) {
    uint64_t length;
    if (__builtin_mul_overflow(count, unit, &length) || !inObjects(start, length))
      return bad(format("object %llu: count %llu runs past the end of the objects", ull{index}, ull{count}));
    return true;
  }

  // Parses object `index`, which sits inside `level` containers.
  bool parseObject(uint64_t index, int level, Value* out) {
    if (index >= numObjects_)
      return bad(format("object reference %llu out of range (%llu objects)", ull{index}, ull{numObjects_}));
    if (state_[index] == kOnPath) return bad(format("object %llu contains itself", ull{index}));
    if (state_[index] == kDone) {
      if (level + height_[index] > kMaxPropertyListDepth)
        return bad(format("containers nested deeper than %d levels", kMaxPropertyListDepth));
      *out = cache_[index];
      return true;
    }
    uint64_t offset = readBigEndian(&bytes_[tableOffset_ + index * offsetSize_], offsetSize_);
    if (offset < kHeaderSize || offset >= tableOffset_)
      return bad(format("offset %llu of object %llu is outside the objects", ull{offset}, ull{index}));

    uint8_t marker = bytes_[offset];
    uint8_t info = marker & 0x0F;
    Value value;
    int height = 0;
    switch (marker >> 4) {
      case 0x0:
        if (marker == 0x08 || marker == 0x09) {
          value = Boolean(marker == 0x09);
          break;
        }
        return bad(format("object %llu (marker 0x%02x) is not a value", ull{index}, unsigned{marker}));
      case 0x1: {
        if (info > 4) return bad(format("integer object %llu has invalid size marker 0x%02x", ull{index}, unsigned{marker}));
        size_t width = size_t{1} << info;
        if (!inObjects(offset + 1, width)) return bad(format("integer object %llu runs past the objects", ull{index}));
        const uint8_t* p = &bytes_[offset + 1];
        if (width < 8) {
          value = Number(readBigEndian(p, width));
        } else if (width == 8) {
          value = Number(static_cast<int64_t>(readBigEndian(p, 8)));
        } else {
          uint64_t high = readBigEndian(p, 8), low = readBigEndian(p + 8, 8);
          if (high == 0)
            value = Number(low);
          else if (high == ~uint64_t{0} && (low >> 63) != 0)
            value = Number(static_cast<int64_t>(low));
          else
            return bad(format("integer object %llu does not fit in 64 bits", ull{index}));
        }
        break;
      }
      case 0x2:
      case 0x3: {
        bool isDate = (marker >> 4) == 0x3;
        if ((isDate && info != 3) || (!isDate && info != 2 && info != 3))
          return bad(format("object %llu has invalid marker 0x%02x", ull{index}, unsigned{marker}));
        size_t width = size_t{1} << info;
        if (!inObjects(offset + 1, width)) return bad(format("object %llu runs past the objects", ull{index}));
        uint64_t bits = readBigEndian(&bytes_[offset + 1], width);
        double d;
        if (width == 4) {
          float f;
          uint32_t b32 = static_cast<uint32_t>(bits);
          std::memcpy(&f, &b32, sizeof f);
          d = f;
        } else {
          d = bitsToDouble(bits);
        }
        value = isDate ? Value(Date(d)) : Value(Number(d));
        break;
      }
      case 0x4:
      case 0x5:
      case 0x6: {
        uint64_t count, start;
        uint64_t unit = (marker >> 4) == 0x6 ? 2 : 1;
        if (!readCount(index, offset, &count, &start) || !contentFits(index, start, count, unit)) return false;
        const uint8_t* p = &bytes_[start];
        if ((marker >> 4) == 0x4) {
          value = Data(std::span<const uint8_t>(p, count));
        } else if ((marker >> 4) == 0x5) {
          std::string s;
          s.reserve(count);
          for (uint64_t k = 0; k < count; ++k) appendUTF8(&s, p[k]);  // Latin-1 above 0x7F
          value = String(std::move(s));
        } else {
          value = String(decodeUTF16(p, count));
        }
        break;
      }
      case 0x8:
        return bad(format("object %llu is a UID, which property lists here do not hold", ull{index}));
      case 0xA:
      case 0xB:
      case 0xC:
      case 0xD: {
        bool isDict = (marker >> 4) == 0xD;
        uint64_t count, start;
        if (!readCount(index, offset, &count, &start) ||
            !contentFits(index, start, count, uint64_t{refSize_} * (isDict ? 2 : 1)))
          return false;
        if (level + 1 > kMaxPropertyListDepth)
          return bad(format("containers nested deeper than %d levels", kMaxPropertyListDepth));
        state_[index] = kOnPath;
        int childHeight = 0;
        uint64_t unfolded = 1;
        auto child = [&](uint64_t position, Value* v) {
          uint64_t ref = readBigEndian(&bytes_[position], refSize_);
          if (!parseObject(ref, level + 1, v)) return false;
          childHeight = std::max(childHeight, int{height_[ref]});
          unfolded += unfolded_[ref];
          if (unfolded > unfoldLimit(bytes_.size()))
            return bad(format("object %llu unfolds to more than %llu values", ull{index},
                              ull{unfoldLimit(bytes_.size())}));
          return true;
        };
        if (isDict) {
          Dictionary::Map map;
          for (uint64_t k = 0; k < count; ++k) {
            Value key, v;
            if (!child(start + k * refSize_, &key)) return false;
            if (key.kind() != ValueKind::String)
              return bad(format("key %llu of dictionary object %llu is a %s, not a string", ull{k}, ull{index},
                                std::string(key.typeName())));
            if (!child(start + (count + k) * refSize_, &v)) return false;
            map.insert_or_assign(key.asString().str(), std::move(v));
          }
          value = Dictionary(std::move(map));
        } else {
          std::vector<Value> values;
          values.reserve(count);
          for (uint64_t k = 0; k < count; ++k) {
            Value v;
            if (!child(start + k * refSize_, &v)) return false;
            values.push_back(std::move(v));
          }
          value = Array(std::move(values));
        }
        height = childHeight + 1;
        unfolded_[index] = unfolded;
        break;
      }
      default:
        return bad(format("object %llu has unknown marker 0x%02x", ull{index}, unsigned{marker}));
    }
    state_[index] = kDone;
    height_[index] = static_cast<uint16_t>(height);
    cache_[index] = value;
    *out = std::move(value);
    return true;
  }

  static std::string decodeUTF16(const uint8_t* p, uint64_t count) {
    std::string s;
    s.reserve(count * 2);
    for (uint64_t k = 0; k < count; ++k) {
      uint32_t unit = (uint32_t{p[2 * k]} << 8) | p[2 * k + 1];
      if (unit >= 0xD800 && unit <= 0xDBFF && k + 1 < count) {
        uint32_t next = (uint32_t{p[2 * k + 2]} << 8) | p[2 * k + 3];
        if (next >= 0xDC00 && next <= 0xDFFF) {
          appendUTF8(&s, 0x10000 + ((unit - 0xD800) << 10) + (next - 0xDC00));
          ++k;
          continue;
        }
      }
      if (unit >= 0xDC80 && unit <= 0xDCFF)
        s.push_back(static_cast<char>(unit - 0xDC00));  // a byte that was not UTF-8
      else if (unit >= 0xD800 && unit <= 0xDFFF)
        appendUTF8(&s, 0xFFFD);
      else
        appendUTF8(&s, unit);
    }
    return s;
  }

  std::span<const uint8_t> bytes_;
  uint8_t offsetSize_ = 0;
  uint8_t refSize_ = 0;
  uint64_t numObjects_ = 0;
  uint64_t topObject_ = 0;
  uint64_t tableOffset_ = 0;
  std::vector<uint8_t> state_;
  std::vector<uint16_t> height_;  // containers from the object down, at most kMaxPropertyListDepth
  std::vector<uint64_t> unfolded_;  // values in the tree the object unfolds to, at most unfoldLimit()
  std::vector<Value> cache_;
  std::string message_;
};

// ---- writer ---------------------------------------------------------------

int widthFor(uint64_t v) {
  int width = 1;
  while (width < 8 && (v >> (8 * width)) != 0) ++width;
  return width;
}

void appendBigEndian(std::vector<uint8_t>* out, uint64_t v, int width) {
  for (int k = width - 1; k >= 0; --k) out->push_back(static_cast<uint8_t>(v >> (8 * k)));
}

// An integer object of the smallest of 1, 2, 4 or 8 bytes that holds v
// (an 8-byte integer being signed).
void appendInteger(std::vector<uint8_t>* out, int64_t v) {
  if (v >= 0 && v <= 0xFF) {
    out->push_back(0x10);
    appendBigEndian(out, static_cast<uint64_t>(v), 1);
  } else if (v >= 0 && v <= 0xFFFF) {
    out->push_back(0x11);
    appendBigEndian(out, static_cast<uint64_t>(v), 2);
  } else if (v >= 0 && v <= 0xFFFFFFFF) {
    out->push_back(0x12);
    appendBigEndian(out, static_cast<uint64_t>(v), 4);
  } else {
    out->push_back(0x13);
    appendBigEndian(out, static_cast<uint64_t>(v), 8);
  }
}

void appendMarker(std::vector<uint8_t>* out, uint8_t type, uint64_t count) {
  if (count < 15) {
    out->push_back(static_cast<uint8_t>(type << 4 | count));
  } else {
    out->push_back(static_cast<uint8_t>(type << 4 | 0x0F));
    // Counts fit in int64 (they count bytes in memory).
    appendInteger(out, static_cast<int64_t>(count));
  }
}

uint64_t doubleBits(double d) {
  uint64_t bits;
  std::memcpy(&bits, &d, sizeof bits);
  return bits;
}

class BinaryWriter {
 public:
  bool write(const Value& top, std::vector<uint8_t>* out, Error* error) {
    uint64_t topIndex;
    if (!add(top, 0, &topIndex)) return fail(error, EINVAL, "bplist: " + message_);
    int refSize = widthFor(objects_.size() - 1);
    std::vector<uint8_t> bytes(kMagic, kMagic + kHeaderSize);
    std::vector<uint64_t> offsets;
    offsets.reserve(objects_.size());
    for (const Object& object : objects_) {
      offsets.push_back(bytes.size());
      encode(object, refSize, &bytes);
    }
    uint64_t tableOffset = bytes.size();
    int offsetSize = widthFor(offsets.back());
    for (uint64_t offset : offsets) appendBigEndian(&bytes, offset, offsetSize);
    bytes.insert(bytes.end(), 6, 0);  // unused, sort version
    bytes.push_back(static_cast<uint8_t>(offsetSize));
    bytes.push_back(static_cast<uint8_t>(refSize));
    appendBigEndian(&bytes, objects_.size(), 8);
    appendBigEndian(&bytes, topIndex, 8);
    appendBigEndian(&bytes, tableOffset, 8);
    *out = std::move(bytes);
    return true;
  }

 private:
  struct Object {
    Value value;
    std::vector<uint64_t> refs;  // an array's elements; a dictionary's keys, then its values
  };

  bool bad(std::string message) {
    message_ = std::move(message);
    return false;
  }

  // Scalars that are cheap to compare are written once however often they
  // occur (dictionary keys above all); containers and data are not shared.
  static std::string uniqueKey(const Value& v) {
    auto bitsKey = [](char tag, uint64_t bits) {
      std::string key(1, tag);
      key.append(reinterpret_cast<const char*>(&bits), sizeof bits);
      return key;
    };
    switch (v.kind()) {
      case ValueKind::String: return "s" + v.asString().str();
      case ValueKind::Boolean: return v.asBoolean().boolValue() ? "T" : "F";
      case ValueKind::Date: return bitsKey('d', doubleBits(v.asDate().timeIntervalSinceReferenceDate()));
      case ValueKind::Number: {
        Number n = v.asNumber();
        switch (n.type()) {
          case Number::Type::Signed: return bitsKey('i', static_cast<uint64_t>(n.int64Value()));
          case Number::Type::Unsigned: return bitsKey('u', n.uint64Value());
          case Number::Type::Real: return bitsKey('r', doubleBits(n.doubleValue()));
        }
        return {};
      }
      default: return {};
    }
  }

  bool add(const Value& v, int level, uint64_t* index) {
    switch (v.kind()) {
      case ValueKind::Null: return bad("a null value has no property-list form");
      case ValueKind::URL: return bad("a URL has no property-list form");
      case ValueKind::Error: return bad("an error record has no property-list form");
      case ValueKind::Array:
      case ValueKind::Dictionary: {
        if (level + 1 > kMaxPropertyListDepth)
          return bad(format("containers nested deeper than %d levels", kMaxPropertyListDepth));
        *index = objects_.size();
        objects_.push_back({v, {}});
        std::vector<uint64_t> refs;
        uint64_t ref;
        if (v.kind() == ValueKind::Array) {
          refs.reserve(v.asArray().count());
          for (const Value& element : v.asArray()) {
            if (!add(element, level + 1, &ref)) return false;
            refs.push_back(ref);
          }
        } else {
          const Dictionary::Map& entries = v.asDictionary().entries();
          refs.reserve(entries.size() * 2);
          for (const auto& [key, element] : entries) {
            if (!add(String(key), level + 1, &ref)) return false;
            refs.push_back(ref);
          }
          for (const auto& [key, element] : entries) {
            if (!add(element, level + 1, &ref)) return false;
            refs.push_back(ref);
          }
        }
        objects_[*index].refs = std::move(refs);
        return true;
      }
      default: {
        std::string key = uniqueKey(v);
        if (!key.empty()) {
          auto [it, inserted] = unique_.try_emplace(std::move(key), objects_.size());
          if (!inserted) {
            *index = it->second;
            return true;
          }
        }
        *index = objects_.size();
        objects_.push_back({v, {}});
        return true;
      }
    }
  }

  static void encodeString(const std::string& s, std::vector<uint8_t>* out) {
    bool ascii = std::all_of(s.begin(), s.end(), [](char c) { return static_cast<uint8_t>(c) < 0x80; });
    if (ascii) {
      appendMarker(out, 0x5, s.size());
      out->insert(out->end(), s.begin(), s.end());
      return;
    }
    std::vector<uint16_t> units;
    units.reserve(s.size());
    for (size_t i = 0; i < s.size();) {
      size_t at = i;
      int32_t cp = decodeUTF8(s, &i);
      if (cp < 0) {
        units.push_back(static_cast<uint16_t>(0xDC00 + static_cast<uint8_t>(s[at])));
      } else if (cp >= 0x10000) {
        units.push_back(static_cast<uint16_t>(0xD800 + ((cp - 0x10000) >> 10)));
        units.push_back(static_cast<uint16_t>(0xDC00 + ((cp - 0x10000) & 0x3FF)));
      } else {
        units.push_back(static_cast<uint16_t>(cp));
      }
    }
    appendMarker(out, 0x6, units.size());
    for (uint16_t unit : units) appendBigEndian(out, unit, 2);
  }

  static void encode(const Object& object, int refSize, std::vector<uint8_t>* out) {
    const Value& v = object.value;
    switch (v.kind()) {
      case ValueKind::String: encodeString(v.asString().str(), out); break;
      case ValueKind::Data: {
        auto bytes = v.asData().bytes();
        appendMarker(out, 0x4, bytes.size());
        out->insert(out->end(), bytes.begin(), bytes.end());
        break;
      }
      case ValueKind::Date:
        out->push_back(0x33);
        appendBigEndian(out, doubleBits(v.asDate().timeIntervalSinceReferenceDate()), 8);
        break;
      case ValueKind::Number: {
        Number n = v.asNumber();
        if (n.type() == Number::Type::Real) {
          out->push_back(0x23);
          appendBigEndian(out, doubleBits(n.doubleValue()), 8);
        } else if (n.type() == Number::Type::Unsigned) {
          out->push_back(0x14);  // 16 bytes, high half zero: an unsigned 64-bit value
          appendBigEndian(out, 0, 8);
          appendBigEndian(out, n.uint64Value(), 8);
        } else {
          appendInteger(out, n.int64Value());
        }
        break;
      }
      case ValueKind::Boolean: out->push_back(v.asBoolean().boolValue() ? 0x09 : 0x08); break;
      case ValueKind::Array:
      case ValueKind::Dictionary: {
        bool isDict = v.kind() == ValueKind::Dictionary;
        appendMarker(out, isDict ? 0xD : 0xA, isDict ? object.refs.size() / 2 : object.refs.size());
        for (uint64_t ref : object.refs) appendBigEndian(out, ref, refSize);
        break;
      }
      default: break;  // refused by add()
    }
  }

  std::vector<Object> objects_;
  std::unordered_map<std::string, uint64_t> unique_;
  std::string message_;
};

}  // namespace

Value parseBinary(std::span<const uint8_t> bytes, Error* error) { return BinaryReader(bytes).read(error); }

bool writeBinary(const Value& value, std::vector<uint8_t>* out, Error* error) {
  return BinaryWriter().write(value, out, error);
}

}  // namespace sl::plist_detail
