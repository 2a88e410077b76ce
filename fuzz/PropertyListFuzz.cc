// Fuzz target for the property-list readers and writers.
//
// Any input is parsed (either format, by its magic). Whatever parses is
// written in both formats and read back, and the second writing must give
// the same bytes as the first: the writers accept what the readers make
// (XML may refuse text XML 1.0 cannot carry and dates beyond year 9999;
// binary refuses nothing a reader made), and nothing is lost on the way.
#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <iterator>
#include <vector>

#include "Platform/PropertyList.h"

namespace {

// Whether the tree the value unfolds to stays within *budget (nodes plus
// the bytes of strings and data). A binary list may share one container
// from many places, which is cheap to read but exponential to write out.
bool unfoldsWithin(const sl::Value& value, size_t* budget) {
  size_t cost = 1 + value.asString().length() + value.asData().size();
  if (cost > *budget) return false;
  *budget -= cost;
  if (sl::Array array = value.asArray()) {
    for (const sl::Value& element : array)
      if (!unfoldsWithin(element, budget)) return false;
  } else if (sl::Dictionary dict = value.asDictionary()) {
    for (const auto& [key, element] : dict)
      if (!unfoldsWithin(element, budget)) return false;
  }
  return true;
}

[[noreturn]] void failure(const char* what, const sl::Error& error) {
  std::fprintf(stderr, "PropertyListFuzz: %s: %s\n", what, error.description().c_str());
  std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  sl::Value value = sl::propertyListFromData(std::span<const uint8_t>(data, size));
  size_t budget = size_t{1} << 20;
  if (value.isNull() || !unfoldsWithin(value, &budget)) return 0;

  for (sl::PropertyListFormat format : {sl::PropertyListFormat::XML, sl::PropertyListFormat::Binary}) {
    bool xml = format == sl::PropertyListFormat::XML;
    std::vector<uint8_t> first, second;
    sl::Error error;
    if (!sl::dataFromPropertyList(value, format, &first, &error)) {
      if (xml && (error.isPOSIX(EILSEQ) || error.isPOSIX(EINVAL))) continue;
      failure(xml ? "XML writer refused a parsed value" : "binary writer refused a parsed value", error);
    }
    sl::Value back = sl::propertyListFromData(first, &error);
    if (back.isNull()) failure(xml ? "XML output does not parse" : "binary output does not parse", error);
    if (!sl::dataFromPropertyList(back, format, &second, &error))
      failure("writer refused a value read from its own output", error);
    if (second != first) failure(xml ? "XML round trip changed the value" : "binary round trip changed the value", error);
  }
  return 0;
}

#ifdef SL_FUZZ_STANDALONE_DRIVER
// Without libFuzzer: runs the target once over each file named.
int main(int argc, char** argv) {
  for (int k = 1; k < argc; ++k) {
    std::ifstream in(argv[k], std::ios::binary);
    if (!in) {
      std::fprintf(stderr, "PropertyListFuzz: cannot read %s\n", argv[k]);
      return 2;
    }
    std::vector<uint8_t> bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    LLVMFuzzerTestOneInput(bytes.data(), bytes.size());
  }
  std::printf("PropertyListFuzz: ran %d inputs\n", argc - 1);
  return 0;
}
#endif
