// The system root.
//
// Every root the process has used is kept, interned, for the life of the
// process, and the current one is published through an atomic pointer. That
// lets systemRoot() hand out a reference that stays valid after a later
// setSystemRoot(), and lets readers go without a lock once the root is
// known. Roots are set a handful of times per process (once by the host,
// once per test), so keeping them all costs nothing worth counting.

#include "Platform/SystemRoot.h"

#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <mutex>
#include <set>
#include <string>
#include <vector>

namespace sl {

namespace {

constexpr char kRootEnvironmentVariable[] = "STOWLINE_ROOT";

std::mutex& rootMutex() {
  static std::mutex* const mutex = new std::mutex();
  return *mutex;
}

// Node-based, so a string's address never changes once it is in the set.
// Never destroyed: references to its strings may be held until exit.
std::set<std::string, std::less<>>& internedRoots() {
  static auto* const roots = new std::set<std::string, std::less<>>();
  return *roots;
}

// The current root, or null while it has not been decided.
std::atomic<const std::string*> gCurrentRoot{nullptr};

// The current working directory, for a relative root; "/" when it cannot
// be had (the relative root then hangs below "/").
std::string currentDirectory() {
  std::vector<char> buffer(PATH_MAX);
  for (int attempt = 0; attempt < 4; ++attempt) {
    if (::getcwd(buffer.data(), buffer.size()) != nullptr) return std::string(buffer.data());
    if (errno != ERANGE) break;
    buffer.resize(buffer.size() * 2);
  }
  return "/";
}

// Makes `path` absolute (relative to the working directory), folds runs of
// separators, drops "." components and the trailing separator. ".." stays:
// what it means depends on the links along the path, which are not looked
// at here. An empty path gives "/".
std::string normalizeRoot(std::string_view path) {
  std::string input;
  if (path.empty() || path.front() != '/') {
    input = currentDirectory();
    input += '/';
  }
  input.append(path);

  std::string out;
  size_t i = 0;
  while (i < input.size()) {
    while (i < input.size() && input[i] == '/') ++i;
    size_t end = input.find('/', i);
    if (end == std::string::npos) end = input.size();
    std::string_view component(input.data() + i, end - i);
    if (!component.empty() && component != ".") {
      out += '/';
      out.append(component);
    }
    i = end;
  }
  return out.empty() ? std::string("/") : out;
}

// Publishes `root` as the current root. The caller holds rootMutex().
const std::string* publishLocked(std::string root) {
  auto& roots = internedRoots();
  auto it = roots.find(root);
  if (it == roots.end()) it = roots.insert(std::move(root)).first;
  const std::string* current = &*it;
  gCurrentRoot.store(current, std::memory_order_release);
  return current;
}

}  // namespace

void setSystemRoot(std::string_view path) {
  std::lock_guard<std::mutex> guard(rootMutex());
  if (path.empty()) {
    // Undecided again: the next reader consults the environment.
    gCurrentRoot.store(nullptr, std::memory_order_release);
    return;
  }
  publishLocked(normalizeRoot(path));
}

const std::string& systemRoot() {
  if (const std::string* current = gCurrentRoot.load(std::memory_order_acquire)) return *current;
  std::lock_guard<std::mutex> guard(rootMutex());
  // Another thread may have decided it meanwhile.
  if (const std::string* current = gCurrentRoot.load(std::memory_order_acquire)) return *current;
  const char* fromEnvironment = ::getenv(kRootEnvironmentVariable);
  if (fromEnvironment == nullptr || fromEnvironment[0] == '\0') return *publishLocked("/");
  return *publishLocked(normalizeRoot(fromEnvironment));
}

URL systemRootURL() { return URL::fileURLWithPath(systemRoot(), true); }

std::string pathBelowSystemRoot(std::string_view absolute) {
  const std::string& root = systemRoot();
  std::string out = root == "/" ? std::string() : root;
  if (absolute.empty() || absolute.front() != '/') out += '/';
  out.append(absolute);
  return out;
}

}  // namespace sl
