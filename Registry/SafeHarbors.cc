// The installer library's two calls: safe harbor registration and the
// data-protection update of the data containers the registry knows.

#include <sys/stat.h>

#include <cerrno>
#include <cstring>

#include "FileManager/SLFileManager.h"
#include "Registry/EmbeddedRegistry.h"
#include "Support/Errors.h"
#include "Support/Log.h"

namespace {

// The class data containers are brought to.
constexpr int32_t kDataContainerProtectionClass = 4;

}  // namespace

bool EmbeddedRegistry::registerSafeHarbor(const sl::String& path, const sl::String& identifier, int containerType,
                                          sl::Error* error) {
  static constexpr char kFunctionName[] = "-[EmbeddedRegistry registerSafeHarbor:identifier:containerType:error:]";
  std::lock_guard lock(mutex_);
  struct stat st;
  if (::stat(path.c_str(), &st) != 0) {
    const int statErrno = errno;
    return sl::fail(error, _CreateError(kFunctionName, __LINE__, sl::kPOSIXErrorDomain, statErrno,
                                        "Safe harbor %s for %@ cannot be registered: stat failed: %s", path.str(),
                                        identifier, strerror(statErrno)));
  }
  if (!S_ISDIR(st.st_mode)) {
    return sl::fail(error, _CreateError(kFunctionName, __LINE__, sl::kPOSIXErrorDomain, ENOTDIR,
                                        "Safe harbor %s for %@ cannot be registered: not a directory", path.str(),
                                        identifier));
  }
  std::optional<rg::Statement> statement = db_.prepare(
      "INSERT INTO safe_harbors(identifier, path, container_type) VALUES(?1, ?2, ?3) "
      "ON CONFLICT(identifier) DO UPDATE SET path = ?2, container_type = ?3",
      error);
  return statement && statement->bind(1, identifier.str()).bind(2, path.str()).bind(3, int64_t{containerType}).run(error);
}

std::optional<std::pair<std::string, int>> EmbeddedRegistry::safeHarborForIdentifier(const std::string& identifier) {
  std::lock_guard lock(mutex_);
  std::optional<rg::Statement> statement =
      db_.prepare("SELECT path, container_type FROM safe_harbors WHERE identifier = ?", nullptr);
  if (!statement) return std::nullopt;
  statement->bind(1, identifier);
  if (!statement->step(nullptr)) return std::nullopt;
  return std::make_pair(statement->text(0).value_or(""), static_cast<int>(statement->integer(1)));
}

// Without the option set to true there is nothing to do, and that is a
// success. Every data container is tried; one failure makes the answer false.
bool EmbeddedRegistry::updateContainerDataProtection(const sl::Dictionary& options) {
  static constexpr char kFunctionName[] = "-[EmbeddedRegistry updateContainerDataProtection:]";
  if (!options.get(kSLUpdateSystemAppDataContainerDataProtection).asBoolean().boolValue()) return true;
  std::lock_guard lock(mutex_);
  std::vector<std::string> containers;
  {
    sl::Error error;
    std::optional<rg::Statement> statement =
        db_.prepare("SELECT data_container FROM applications WHERE data_container IS NOT NULL", &error);
    if (!statement) {
      SLLog(sl::kLogLevelError, kFunctionName, "Failed to list data containers: %@", error);
      return false;
    }
    while (statement->step(&error)) containers.push_back(statement->text(0).value_or(""));
    if (statement->failed()) {
      SLLog(sl::kLogLevelError, kFunctionName, "Failed to list data containers: %@", error);
      return false;
    }
  }
  bool ok = true;
  for (const std::string& container : containers) {
    sl::Error error;
    if (!SLFileManager::defaultManager().setDataProtectionClassOfItemAtURL(
            sl::URL::fileURLWithPath(container, true), kDataContainerProtectionClass, {}, &error)) {
      SLLog(sl::kLogLevelError, kFunctionName, "Failed to set class %d on %s: %@", kDataContainerProtectionClass,
            container, error);
      ok = false;
    }
  }
  return ok;
}
