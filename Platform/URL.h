// File URLs: the way paths travel between the operations of the system.
//
// A URL holds a path as bytes (so names that are not UTF-8 survive) and
// whether it names a directory. Its text form is the URL string:
// "file://" + the percent-encoded path + "/" for a directory, as in
// file:///private/var/mobile/Applications/. The path itself never ends in a
// separator except for the root "/", and runs of separators are folded; no
// other normalisation is done ("." and ".." stay, a relative path stays
// relative).
#pragma once

#include <string>
#include <string_view>
#include <vector>

#include "Platform/Value.h"

namespace sl {

class URL : public Value {
 public:
  URL() = default;
  URL(std::nullptr_t) {}  // NOLINT

  // A file URL for the path given as bytes. An empty path gives a null URL,
  // and so does one holding a NUL byte (the system would read it as a
  // shorter path); appending a component or extension that holds one too.
  static URL fileURLWithPath(std::string_view path, bool isDirectory);
  static URL fileURLWithFileSystemRepresentation(const char* bytes, bool isDirectory) {
    return fileURLWithPath(bytes ? std::string_view(bytes) : std::string_view(), isDirectory);
  }

  // The path; empty for a null URL.
  const std::string& path() const;
  // The path as the C string that system calls take; "" for a null URL.
  const char* fileSystemRepresentation() const { return path().c_str(); }
  bool isDirectory() const;
  // "file://..." as described above; empty for a null URL.
  std::string absoluteString() const;

  // The last component ("/" for the root, "" for a null URL).
  std::string lastPathComponent() const;
  // What follows the last dot of the last component, when that dot is not
  // its first or last character; "" otherwise.
  std::string pathExtension() const;

  URL URLByAppendingPathComponent(std::string_view component, bool isDirectory) const;
  URL URLByAppendingPathExtension(std::string_view extension) const;
  // The parent directory ("/" stays "/"); a directory URL.
  URL URLByDeletingLastPathComponent() const;

 private:
  friend class Value;
  explicit URL(std::shared_ptr<const detail::Node> n) : Value(std::move(n)) {}
};

// Splits a path into its components: "/" first for an absolute path, then
// each non-empty component ("/a//b/" gives "/", "a", "b"; "a/../b" gives
// "a", "..", "b").
std::vector<std::string> pathComponents(std::string_view path);

// Percent-encodes the bytes of a path for a URL string: unreserved
// characters, the sub-delimiters, ':', '@' and '/' stay; every other byte
// becomes %XX.
std::string percentEncodePath(std::string_view path);

}  // namespace sl
