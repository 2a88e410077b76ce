// Fuzz target for the XML property-list reader. Any input either reads as a
// value no deeper than the nesting limit, or is refused with an EINVAL
// record naming the format; never a crash, a hang or a leak.
#include <cerrno>
#include <cstdint>
#include <span>

#include "Platform/PropertyList.h"
#include "fuzz/FuzzSupport.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  constexpr const char* kTarget = "PropertyListXMLFuzz";
  sl::Error error;
  sl::Value value = sl::plist_detail::parseXML(std::span<const uint8_t>(data, size), &error);
  if (value.isNull()) {
    if (!error.isPOSIX(EINVAL)) sl::fuzz::failure(kTarget, "refused without an EINVAL record: " + error.description());
    if (!error.localizedDescription().str().starts_with("XML property list: "))
      sl::fuzz::failure(kTarget, "refusal does not name the format: " + error.description());
    return 0;
  }
  // XML cannot share nodes, so the tree is as large as the input.
  if (sl::fuzz::nesting(value) > sl::kMaxPropertyListDepth)
    sl::fuzz::failure(kTarget, "read containers nested deeper than the limit");
  (void)value.description();
  return 0;
}
