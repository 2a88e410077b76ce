// Fuzz target for the os-release parser behind the system-version
// dictionary. Whatever the text, the result holds only the three keys, each
// a non-empty string that spans a single line, and the build version falls
// back to the product version.
#include <cstdint>
#include <string_view>

#include "Platform/SystemVersion.h"
#include "fuzz/FuzzSupport.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  constexpr const char* kTarget = "OSReleaseFuzz";
  sl::Dictionary version = sl::parseOSRelease(std::string_view(reinterpret_cast<const char*>(data), size));
  if (version.isNull()) sl::fuzz::failure(kTarget, "no dictionary");
  for (const auto& [key, value] : version) {
    if (key != sl::kSystemProductNameKey && key != sl::kSystemProductVersionKey && key != sl::kSystemBuildVersionKey)
      sl::fuzz::failure(kTarget, "unexpected key " + key);
    sl::String text = value.asString();
    if (text.isNull() || text.length() == 0) sl::fuzz::failure(kTarget, key + " is not a non-empty string");
    if (text.str().find('\n') != std::string::npos) sl::fuzz::failure(kTarget, key + " spans several lines");
    if (text.length() > size) sl::fuzz::failure(kTarget, key + " is longer than the text");
  }
  if (version.contains(sl::kSystemProductVersionKey) && !version.contains(sl::kSystemBuildVersionKey))
    sl::fuzz::failure(kTarget, "a product version without a build version");
  return 0;
}
