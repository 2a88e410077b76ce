// Fuzz target for the property-list writers against the readers.
//
// Any input is parsed (either format, by its magic). Whatever parses is
// written in both formats and read back. The value read back must equal the
// one written, as far as the format carries it (XML keeps dates to the whole
// second), and writing it again must give the same bytes: the writers accept
// what the readers make (XML may refuse text XML 1.0 cannot carry and dates
// beyond year 9999; binary refuses nothing a reader made), and nothing is
// lost on the way.
#include <cerrno>
#include <cmath>
#include <cstdint>
#include <string>
#include <vector>

#include "Platform/PropertyList.h"
#include "fuzz/FuzzSupport.h"

namespace {

constexpr const char* kTarget = "PropertyListRoundTripFuzz";

bool sameReal(double a, double b) {
  if (std::isnan(a) || std::isnan(b)) return std::isnan(a) && std::isnan(b);
  return a == b && std::signbit(a) == std::signbit(b);
}

// Whether `back`, read from what `original` was written as, is the same
// value. XML writes dates rounded down to the whole second.
bool same(const sl::Value& original, const sl::Value& back, bool xml) {
  if (original.kind() != back.kind()) return false;
  switch (original.kind()) {
    case sl::ValueKind::Date: {
      double written = original.asDate().timeIntervalSinceReferenceDate();
      return sameReal(xml ? std::floor(written) : written, back.asDate().timeIntervalSinceReferenceDate());
    }
    case sl::ValueKind::Number: {
      sl::Number a = original.asNumber(), b = back.asNumber();
      if (a.isReal() != b.isReal()) return false;
      return a.isReal() ? sameReal(a.doubleValue(), b.doubleValue()) : original == back;
    }
    case sl::ValueKind::Array: {
      sl::Array a = original.asArray(), b = back.asArray();
      if (a.count() != b.count()) return false;
      for (size_t k = 0; k < a.count(); ++k)
        if (!same(a.at(k), b.at(k), xml)) return false;
      return true;
    }
    case sl::ValueKind::Dictionary: {
      sl::Dictionary a = original.asDictionary(), b = back.asDictionary();
      if (a.count() != b.count()) return false;
      for (const auto& [key, element] : a)
        if (!b.contains(key) || !same(element, b.get(key), xml)) return false;
      return true;
    }
    default:
      return original == back;
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  sl::Value value = sl::propertyListFromData(std::span<const uint8_t>(data, size));
  size_t budget = size_t{1} << 20;
  if (value.isNull() || !sl::fuzz::unfoldsWithin(value, &budget)) return 0;

  for (sl::PropertyListFormat format : {sl::PropertyListFormat::XML, sl::PropertyListFormat::Binary}) {
    const bool xml = format == sl::PropertyListFormat::XML;
    const std::string name = xml ? "XML" : "binary";
    std::vector<uint8_t> first, second;
    sl::Error error;
    if (!sl::dataFromPropertyList(value, format, &first, &error)) {
      if (xml && (error.isPOSIX(EILSEQ) || error.isPOSIX(EINVAL))) continue;
      sl::fuzz::failure(kTarget, name + " writer refused a parsed value: " + error.description());
    }
    sl::PropertyListFormat readAs;
    sl::Value back = sl::propertyListFromData(first, &error, &readAs);
    if (back.isNull()) sl::fuzz::failure(kTarget, name + " output does not parse: " + error.description());
    if (readAs != format) sl::fuzz::failure(kTarget, name + " output reads as the other format");
    if (!same(value, back, xml))
      sl::fuzz::failure(kTarget, name + " round trip changed the value:\n" + value.description() + "\nbecame\n" +
                                     back.description());
    if (!sl::dataFromPropertyList(back, format, &second, &error))
      sl::fuzz::failure(kTarget, name + " writer refused a value read from its own output: " + error.description());
    if (second != first) sl::fuzz::failure(kTarget, name + " output differs when written again");
  }
  return 0;
}
