#include "FileManager/StowlineAdditions.h"

#include <cstring>
#include <string_view>

#include "Platform/URL.h"

namespace StowlineAdditions {

// Linux file names are bytes with no encoding of their own. Our String holds
// bytes, so the conversion keeps them as they are: a name that is not valid
// UTF-8 survives byte for byte and, appended to a URL, names the same file
// again. Nothing is decoded, replaced or normalised here; whoever prints a
// name for people to read escapes it there.
sl::String stringWithFileSystemRepresentation(const char* bytes, size_t length) {
  if (bytes == nullptr) return nullptr;
  return sl::String(std::string_view(bytes, length));
}

sl::String stringWithFileSystemRepresentation(const char* bytes) {
  if (bytes == nullptr) return nullptr;
  return stringWithFileSystemRepresentation(bytes, strlen(bytes));
}

bool containsDotDotPathComponents(const sl::String& path) {
  for (const std::string& component : sl::pathComponents(path.view())) {
    if (component == "..") return true;
  }
  return false;
}

}  // namespace StowlineAdditions
