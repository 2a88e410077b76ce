// The preferences store.
//
// Nothing is cached but the changes not yet synchronised: a read takes the
// domain's file as it is on disk now (so another process's synchronised
// changes show at once) and lays this process's pending changes over it.
// Pending changes are kept by the domain file's path rather than by the
// domain's name, so a change of the system root never carries a change into
// another root's file. One mutex guards the pending changes and is held for
// a whole read or synchronise, which also keeps two synchronises of this
// process from interleaving their read-merge-write.

#include "Platform/Preferences.h"

#include <cerrno>
#include <cstring>
#include <functional>
#include <map>
#include <mutex>
#include <string>

#include "Platform/Format.h"
#include "Platform/Mkpath.h"
#include "Platform/PropertyList.h"
#include "Platform/SystemRoot.h"

namespace sl {

namespace {

constexpr char kPreferencesDirectory[] = "/private/var/mobile/Library/Preferences/";
constexpr mode_t kPreferencesDirectoryMode = 0755;

// Key to value; a null value is a removal.
using PendingChanges = std::map<std::string, Value, std::less<>>;

struct Store {
  std::mutex mutex;
  std::map<std::string, PendingChanges, std::less<>> pendingByFile;
};

// Never destroyed, so that threads still running at exit can use it.
Store& store() {
  static Store* const instance = new Store();
  return *instance;
}

}  // namespace

URL preferencesFileURL(std::string_view domain) {
  URL directory = URL::fileURLWithPath(pathBelowSystemRoot(kPreferencesDirectory), true);
  std::string name(domain);
  name += ".plist";
  return directory.URLByAppendingPathComponent(name, false);
}

Value preferencesCopyValue(std::string_view key, std::string_view domain) {
  URL file = preferencesFileURL(domain);
  Store& s = store();
  std::lock_guard<std::mutex> guard(s.mutex);
  if (auto pending = s.pendingByFile.find(file.path()); pending != s.pendingByFile.end()) {
    if (auto change = pending->second.find(key); change != pending->second.end()) return change->second;
  }
  return dictionaryWithContentsOfURL(file).get(key);
}

void preferencesSetValue(std::string_view key, const Value& value, std::string_view domain) {
  URL file = preferencesFileURL(domain);
  Store& s = store();
  std::lock_guard<std::mutex> guard(s.mutex);
  s.pendingByFile[file.path()].insert_or_assign(std::string(key), value);
}

bool preferencesSynchronize(std::string_view domain, Error* error) {
  URL file = preferencesFileURL(domain);
  Store& s = store();
  std::lock_guard<std::mutex> guard(s.mutex);
  auto pending = s.pendingByFile.find(file.path());
  // Nothing pending: the file already holds what this process knows.
  if (pending == s.pendingByFile.end() || pending->second.empty()) return true;

  URL directory = file.URLByDeletingLastPathComponent();
  // mkpath_np returns its error number rather than setting errno.
  int result = mkpath_np(directory.fileSystemRepresentation(), kPreferencesDirectoryMode);
  if (result != 0 && result != EEXIST) {
    if (error != nullptr) {
      *error = Error::posix(result, format("mkpath_np of %s failed: %s", directory.path(), strerror(result)));
    }
    return false;
  }

  // A missing, unreadable or malformed file counts as an empty domain: the
  // write replaces it.
  Dictionary merged = dictionaryWithContentsOfURL(file);
  if (merged.isNull()) merged = Dictionary::create();
  for (const auto& [key, value] : pending->second) merged.set(key, value);
  if (!writePropertyListToURL(merged, file, PropertyListFormat::XML, error)) return false;

  s.pendingByFile.erase(pending);
  return true;
}

void preferencesResetForTesting() {
  Store& s = store();
  std::lock_guard<std::mutex> guard(s.mutex);
  s.pendingByFile.clear();
}

}  // namespace sl
