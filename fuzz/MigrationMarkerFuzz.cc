// Fuzz target for reading back a migration marker. Whatever the file holds,
// the validation either accepts it with no message, and then the four
// required keys and any second bundle path are strings, or rejects it with
// exactly one error line, under the validation's own function, that names
// the marker file or the offending second bundle path.
#include <cstdint>
#include <span>
#include <string>

#include "AppMigrator/Classification.h"
#include "Platform/Log.h"
#include "Platform/PropertyList.h"
#include "fuzz/FuzzSupport.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  using namespace sl::migrator;
  constexpr const char* kTarget = "MigrationMarkerFuzz";
  static const sl::URL kMarker = sl::URL::fileURLWithPath(
      std::string("/var/mobile/Applications/0C1D2E3F/") + kMigrationMarkerName, false);

  std::span<const uint8_t> bytes(data, size);
  MarkerValidation result = validateMigrationMarkerData(bytes, kMarker);
  sl::Dictionary read = sl::propertyListFromData(bytes).asDictionary();
  auto isString = [](const sl::Value& v) { return v.kind() == sl::ValueKind::String; };

  if (!result.marker.isNull()) {
    if (!result.messages.empty()) sl::fuzz::failure(kTarget, "accepted with a message");
    for (const char* key : {kBundlePathKey, kContainerTypeKey, kContainerPathKey, kBundleIdentifierKey})
      if (!isString(result.marker.get(key))) sl::fuzz::failure(kTarget, std::string("accepted without string ") + key);
    if (result.marker.contains(kSecondBundlePathKey) && !isString(result.marker.get(kSecondBundlePathKey)))
      sl::fuzz::failure(kTarget, "accepted a second bundle path that is not a string");
    if (read.isNull() || !(read == result.marker)) sl::fuzz::failure(kTarget, "accepted something other than the file");
    return 0;
  }
  if (result.messages.size() != 1) sl::fuzz::failure(kTarget, "rejected without exactly one message");
  const Message& message = result.messages.front();
  if (message.level != sl::kLogLevelError || std::string_view(message.function) != kValidateMarkerFunctionName ||
      !message.text.starts_with("SLAppMigrator: "))
    sl::fuzz::failure(kTarget, "rejection line of the wrong shape: " + message.text);
  if (message.text.find(kMarker.path()) == std::string::npos &&
      !message.text.starts_with("SLAppMigrator: Second bundle path was not a string: "))
    sl::fuzz::failure(kTarget, "rejection names neither the file nor the second bundle path: " + message.text);
  // The line carries the description of whatever the file held: it must
  // stay in proportion to the file (a line per value, indented at most
  // kMaxPropertyListDepth levels), not grow with the values a shared
  // container unfolds to.
  if (message.text.size() > 4096 + size * (4 * sl::kMaxPropertyListDepth + 64))
    sl::fuzz::failure(kTarget, "rejection line of " + std::to_string(message.text.size()) + " bytes for a file of " +
                                   std::to_string(size));
  return 0;
}
