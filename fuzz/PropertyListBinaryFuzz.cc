// Fuzz target for the binary property-list reader. Any input either reads
// as a value within the nesting limit, or is refused with an EINVAL record
// whose message starts "bplist: "; never a crash, a hang or a leak. What it
// reads, the binary writer must accept.
#include <cerrno>
#include <cstdint>
#include <span>
#include <vector>

#include "Platform/PropertyList.h"
#include "fuzz/FuzzSupport.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  constexpr const char* kTarget = "PropertyListBinaryFuzz";
  sl::Error error;
  sl::Value value = sl::plist_detail::parseBinary(std::span<const uint8_t>(data, size), &error);
  if (value.isNull()) {
    if (!error.isPOSIX(EINVAL)) sl::fuzz::failure(kTarget, "refused without an EINVAL record: " + error.description());
    if (!error.localizedDescription().str().starts_with("bplist: "))
      sl::fuzz::failure(kTarget, "refusal does not name the format: " + error.description());
    return 0;
  }
  // Shared containers may unfold to far more than the input holds; the
  // checks below walk the tree, so they look at the modest ones only.
  size_t budget = size_t{1} << 18;
  if (!sl::fuzz::unfoldsWithin(value, &budget)) return 0;
  if (sl::fuzz::nesting(value) > sl::kMaxPropertyListDepth)
    sl::fuzz::failure(kTarget, "read containers nested deeper than the limit");
  std::vector<uint8_t> bytes;
  if (!sl::plist_detail::writeBinary(value, &bytes, &error))
    sl::fuzz::failure(kTarget, "binary writer refused a value the reader made: " + error.description());
  return 0;
}
