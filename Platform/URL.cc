#include "Platform/URL.h"

#include "Platform/ValueNodes.h"

namespace sl {

using detail::URLNode;

namespace {

// Folds runs of separators and drops a trailing one (the root keeps its).
std::string normalisedPath(std::string_view path) {
  std::string out;
  out.reserve(path.size());
  for (char c : path) {
    if (c == '/' && !out.empty() && out.back() == '/') continue;
    out += c;
  }
  if (out.size() > 1 && out.back() == '/') out.pop_back();
  return out;
}

// A path is handed to the system as a C string: a NUL byte would end it
// early, so that it named another file (a directory above the one meant).
bool holdsNul(std::string_view s) { return s.find('\0') != std::string_view::npos; }

}  // namespace

URL URL::fileURLWithPath(std::string_view path, bool isDirectory) {
  if (path.empty() || holdsNul(path)) return URL();
  return URL(std::make_shared<URLNode>(normalisedPath(path), isDirectory));
}

const std::string& URL::path() const {
  static const std::string empty;
  return node() ? static_cast<const URLNode*>(node())->path : empty;
}

bool URL::isDirectory() const { return node() && static_cast<const URLNode*>(node())->isDirectory; }

std::string URL::absoluteString() const {
  if (isNull()) return {};
  std::string out = "file://" + percentEncodePath(path());
  if (isDirectory() && path() != "/") out += '/';
  return out;
}

std::string URL::lastPathComponent() const {
  const std::string& p = path();
  if (p.empty() || p == "/") return p;
  size_t slash = p.rfind('/');
  return slash == std::string::npos ? p : p.substr(slash + 1);
}

std::string URL::pathExtension() const {
  std::string last = lastPathComponent();
  size_t dot = last.rfind('.');
  if (dot == std::string::npos || dot == 0 || dot + 1 == last.size()) return {};
  return last.substr(dot + 1);
}

URL URL::URLByAppendingPathComponent(std::string_view component, bool isDirectory) const {
  if (isNull() || holdsNul(component)) return URL();
  const std::string& base = path();
  std::string p;
  p.reserve(base.size() + 1 + component.size());
  p += base;
  if (base != "/") p += '/';
  p += component;
  // A plain name after a normalised path leaves nothing to fold; listings
  // make one URL per entry this way.
  if (component.empty() || component.find('/') != std::string_view::npos) return fileURLWithPath(p, isDirectory);
  return URL(std::make_shared<URLNode>(std::move(p), isDirectory));
}

URL URL::URLByAppendingPathExtension(std::string_view extension) const {
  if (isNull() || holdsNul(extension)) return URL();
  std::string p = path();
  p += '.';
  p += extension;
  return fileURLWithPath(p, isDirectory());
}

URL URL::URLByDeletingLastPathComponent() const {
  const std::string& p = path();
  if (p.empty()) return URL();
  if (p == "/") return fileURLWithPath("/", true);
  size_t slash = p.rfind('/');
  if (slash == std::string::npos) return fileURLWithPath(".", true);
  if (slash == 0) return fileURLWithPath("/", true);
  return fileURLWithPath(std::string_view(p).substr(0, slash), true);
}

std::vector<std::string> pathComponents(std::string_view path) {
  std::vector<std::string> out;
  size_t i = 0;
  if (!path.empty() && path[0] == '/') {
    out.emplace_back("/");
    i = 1;
  }
  while (i < path.size()) {
    size_t slash = path.find('/', i);
    if (slash == std::string_view::npos) slash = path.size();
    if (slash > i) out.emplace_back(path.substr(i, slash - i));
    i = slash + 1;
  }
  return out;
}

std::string percentEncodePath(std::string_view path) {
  static const char kHex[] = "0123456789ABCDEF";
  std::string out;
  out.reserve(path.size());
  for (unsigned char c : path) {
    bool keep = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
                std::string_view("-._~!$&'()*+,;=:@/").find(static_cast<char>(c)) != std::string_view::npos;
    if (keep) {
      out += static_cast<char>(c);
    } else {
      out += '%';
      out += kHex[c >> 4];
      out += kHex[c & 0xf];
    }
  }
  return out;
}

}  // namespace sl
