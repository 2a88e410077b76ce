// Fuzz target for the mount-table parser. Whatever the text, there is at
// most one mount per line, and each mount survives the table's own escaping:
// written back as a mountinfo line with its blanks, tabs, newlines and
// backslashes in octal, it reads back the same.
#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "Platform/DeviceRegistry.h"
#include "fuzz/FuzzSupport.h"

namespace {

std::string escaped(const std::string& field) {
  std::string out;
  for (char c : field) {
    if (c == ' ' || c == '\t' || c == '\n' || c == '\\') {
      unsigned byte = static_cast<unsigned char>(c);
      out += '\\';
      out += static_cast<char>('0' + (byte >> 6));
      out += static_cast<char>('0' + ((byte >> 3) & 7));
      out += static_cast<char>('0' + (byte & 7));
    } else {
      out += c;
    }
  }
  return out;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  constexpr const char* kTarget = "MountInfoFuzz";
  std::string_view text(reinterpret_cast<const char*>(data), size);
  std::vector<sl::MountEntry> table = sl::parseMountInfo(text);
  size_t lines = 1;
  for (char c : text) lines += c == '\n';
  if (table.size() > lines) sl::fuzz::failure(kTarget, "more mounts than lines");
  for (const sl::MountEntry& entry : table) {
    if (entry.mntFromName.empty() || entry.mntOnName.empty()) sl::fuzz::failure(kTarget, "an empty field");
    if (entry.mntFromName.size() > size || entry.mntOnName.size() > size)
      sl::fuzz::failure(kTarget, "a field longer than the text");
    std::string line = "36 35 98:0 / " + escaped(entry.mntOnName) + " rw,noatime master:1 - ext4 " +
                       escaped(entry.mntFromName) + " rw,errors=continue";
    std::vector<sl::MountEntry> again = sl::parseMountInfo(line);
    if (again.size() != 1 || again[0].mntFromName != entry.mntFromName || again[0].mntOnName != entry.mntOnName)
      sl::fuzz::failure(kTarget, "a mount does not survive its escaping: " + line);
  }
  return 0;
}
