// One user-data item as `stowline manifest` records it and `stowline verify`
// compares it; both describe items with the same code.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

namespace stowline {

struct ManifestItem {
  std::string path;  // relative to the container (data item name first) or group container
  std::string type;  // "file", "directory", "link", "fifo", "other"
  uint64_t size = 0;
  uint32_t mode = 0;   // permission bits, set-id and sticky bits
  std::string sha256;  // files
  std::string target;  // links
};

// Describes `relative` below the directory `baseFd` without following links
// on the way or at the end. Nullopt with *err set to the errno on failure
// (ENOENT when it does not exist).
std::optional<ManifestItem> describeManifestItem(int baseFd, const std::string& relative, int* err);

}  // namespace stowline
