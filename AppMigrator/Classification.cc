// Classifying the entries of the old container root, and reading back the
// migration marker, without writing anything.

#include "AppMigrator/Classification.h"

#include <sys/stat.h>

#include <cerrno>
#include <cstring>
#include <memory>
#include <utility>

#include "FileManager/SLFileManager.h"
#include "Platform/Bundle.h"
#include "Platform/Format.h"
#include "Platform/Log.h"
#include "Platform/PropertyList.h"

namespace sl::migrator {

namespace {

constexpr char kAppExtension[] = "app";
constexpr char kVPNPluginExtension[] = "vpnplugin";

// An entry whose last component holds no dot at all is plain data and is not
// even stat'ed. This is deliberately wider than "has a path extension":
// ".hidden" and "name." have none, yet they are examined.
bool lastComponentHasDot(const URL& url) { return url.lastPathComponent().find('.') != std::string::npos; }

bool isStringValue(const Value& value) { return value.kind() == ValueKind::String; }

// Collects the lines of one classification and ends it.
class Outcome {
 public:
  template <class... Args>
  void log(int level, FormatString<std::type_identity_t<Args>...> format, const Args&... args) {
    decision_.messages.push_back({level, kIntrospectFunctionName, sl::format(format, args...)});
  }
  void append(std::vector<Message> messages) {
    for (Message& message : messages) decision_.messages.push_back(std::move(message));
  }
  Decision& decision() { return decision_; }
  // Ends with `kind`, the last line logged being the reason.
  Decision finish(DecisionKind kind) {
    decision_.kind = kind;
    if (!decision_.messages.empty()) decision_.reason = decision_.messages.back();
    return std::move(decision_);
  }

 private:
  Decision decision_;
};

}  // namespace

const char* decisionKindName(DecisionKind kind) {
  switch (kind) {
    case DecisionKind::RecordBuilt:
      return "recordBuilt";
    case DecisionKind::MarkerFound:
      return "markerFound";
    case DecisionKind::Delete:
      return "delete";
    case DecisionKind::LeaveInPlace:
      return "leaveInPlace";
    case DecisionKind::Vanished:
      return "vanished";
  }
  return "unknown";
}

std::optional<std::vector<URL>> ContainerProbe::listContainer(const URL& container, Error* error) {
  return SLFileManager::defaultManager().urlsForItemsInDirectoryAtURL(container, false /* links included */, error);
}

int ContainerProbe::lstatEntry(const URL& entry, bool* isLink) {
  struct stat st;
  if (::lstat(entry.fileSystemRepresentation(), &st) != 0) {
    const int statErrno = errno;
    return statErrno;
  }
  *isLink = S_ISLNK(st.st_mode);
  return 0;
}

String bundleIdentifierForBundle(const URL& bundle) {
  std::shared_ptr<Bundle> reader = Bundle::createUnique(bundle);
  if (!reader) return nullptr;
  return reader->identifier();
}

MarkerValidation validateMigrationMarker(const URL& url) {
  std::vector<uint8_t> bytes;
  // A file that cannot be read holds no dictionary, just as an empty one.
  if (!readFileContents(url, &bytes)) bytes.clear();
  return validateMigrationMarkerData(bytes, url);
}

MarkerValidation validateMigrationMarkerData(std::span<const uint8_t> bytes, const URL& url) {
  MarkerValidation result;
  auto reject = [&result](std::string text) {
    result.messages.push_back({kLogLevelError, kValidateMarkerFunctionName, std::move(text)});
    return std::move(result);
  };
  // Missing, unreadable, malformed or not a dictionary all read as null.
  Dictionary marker = propertyListFromData(bytes).asDictionary();
  if (marker.isNull()) return reject(sl::format("SLAppMigrator: Failed to load migration marker file from %@", url));
  if (!isStringValue(marker.get(kBundlePathKey))) {
    return reject(sl::format("SLAppMigrator: Failed to get bundle path from migration marker file %@", url));
  }
  // Only the kind is checked: a type other than App or VPNBundle is passed
  // on as it is.
  if (!isStringValue(marker.get(kContainerTypeKey))) {
    return reject(sl::format("SLAppMigrator: Failed to get container type from migration marker file %@", url));
  }
  if (!isStringValue(marker.get(kContainerPathKey))) {
    return reject(sl::format("SLAppMigrator: Failed to get container path from migration marker file %@", url));
  }
  if (!isStringValue(marker.get(kBundleIdentifierKey))) {
    return reject(sl::format("SLAppMigrator: Failed to get container bundle ID from migration marker file %@", url));
  }
  if (marker.contains(kSecondBundlePathKey) && !isStringValue(marker.get(kSecondBundlePathKey))) {
    return reject(
        sl::format("SLAppMigrator: Second bundle path was not a string: %@", marker.get(kSecondBundlePathKey)));
  }
  // Keys beyond the five are kept and travel on with the record.
  result.marker = std::move(marker);
  return result;
}

Decision classifyContainer(const URL& url, ContainerProbe& probe) {
  Outcome out;
  Decision& decision = out.decision();

  Error error;
  const std::optional<std::vector<URL>> entries = probe.listContainer(url, &error);
  if (!entries) {
    if (error.isPOSIX(ENOTDIR)) {
      out.log(kLogLevelError, "SLAppMigrator: Found regular file at %@ ; removing", url);
      return out.finish(DecisionKind::Delete);
    }
    if (error.isPOSIX(ENOENT)) {
      out.log(kLogLevelNotice, "SLAppMigrator: Got ENOENT when introspecting %@ ; ignoring (likely raced with stowd)",
              url);
      return out.finish(DecisionKind::Vanished);
    }
    out.log(kLogLevelError, "SLAppMigrator: Failed to get URLs in container %@ : %@", url, error);
    return out.finish(DecisionKind::LeaveInPlace);
  }

  Dictionary record = Dictionary::create();
  record.set(kContainerPathKey, String(url.path()));

  URL appBundle;
  URL vpnPlugin;
  Message found;  // the line that named the principal bundle
  // Once a marker failed to load, the record is dropped: later entries are
  // still examined (and can still stop the classification or save the
  // container from deletion), but nothing more is recorded.
  bool recordDropped = false;
  Message markerFailure;

  for (const URL& entry : *entries) {
    if (!lastComponentHasDot(entry)) continue;

    // Before any name is compared: an entry that cannot be examined stops
    // this container, whatever it is.
    bool isLink = false;
    if (const int statErrno = probe.lstatEntry(entry, &isLink); statErrno != 0) {
      out.log(kLogLevelError, "SLAppMigrator: Failed to stat path %s : %s", entry.path(), strerror(statErrno));
      return out.finish(DecisionKind::LeaveInPlace);
    }
    const std::string extension = entry.pathExtension();

    if (extension == kAppExtension) {
      if (isLink) {
        out.log(kLogLevelError, "SLAppMigrator: Skipping container with app symlink at %@", entry);
        return out.finish(DecisionKind::LeaveInPlace);
      }
      out.log(kLogLevelNotice, "SLAppMigrator: Found app %@", entry);
      const Message foundApp = decision.messages.back();
      String identifier = probe.bundleIdentifier(entry);
      if (identifier.isNull()) {
        out.log(kLogLevelError, "SLAppMigrator: Could not get identifier for bundle at %@", entry);
        continue;
      }
      appBundle = entry;
      if (!recordDropped) {
        record.set(kBundlePathKey, String(entry.path()));
        record.set(kContainerTypeKey, String(kContainerTypeApp));
        record.set(kBundleIdentifierKey, identifier);
        decision.early = true;
        found = foundApp;
      }
    } else if (extension == kVPNPluginExtension) {
      out.log(kLogLevelNotice, "SLAppMigrator: Found vpn plugin %@", entry);
      const Message foundPlugin = decision.messages.back();
      if (isLink) {
        out.log(kLogLevelError, "SLAppMigrator: VPN plugin was symlink; skipping container %@", entry);
        return out.finish(DecisionKind::LeaveInPlace);
      }
      String identifier = probe.bundleIdentifier(entry);
      if (identifier.isNull()) continue;
      vpnPlugin = entry;
      // An application bundle, once found, stays the principal bundle.
      if (appBundle.isNull() && !recordDropped) {
        record.set(kBundlePathKey, String(entry.path()));
        record.set(kContainerTypeKey, String(kContainerTypeVPNBundle));
        record.set(kBundleIdentifierKey, identifier);
        decision.early = false;
        found = foundPlugin;
      }
    } else if (entry.lastPathComponent() == kMigrationMarkerName) {
      out.log(kLogLevelNotice, "SLAppMigrator: Found migration marker %@", entry);
      const Message foundMarker = decision.messages.back();
      if (isLink) {
        out.log(kLogLevelError, "SLAppMigrator: Migration marker was symlink; skipping container %@", entry);
        return out.finish(DecisionKind::LeaveInPlace);
      }
      MarkerValidation validation = probe.validateMarker(entry);
      out.append(std::move(validation.messages));
      if (!validation.marker.isNull()) {
        // The marker wins over everything else in the container: what was
        // gathered so far is dropped and nothing after it is looked at.
        decision.early = validation.marker.get(kContainerTypeKey).asString() == kContainerTypeApp;
        decision.record = std::move(validation.marker);
        Decision result = out.finish(DecisionKind::MarkerFound);
        result.reason = foundMarker;
        return result;
      }
      out.log(kLogLevelError, "SLAppMigrator: Failed to load migration marker file from %@", entry);
      markerFailure = decision.messages.back();
      recordDropped = true;
    }
  }

  if (appBundle.isNull() && vpnPlugin.isNull()) {
    out.log(kLogLevelError, "SLAppMigrator: No app or vpn bundle found in container %@ ; removing it", url);
    return out.finish(DecisionKind::Delete);
  }
  if (recordDropped) {
    // The reason is the marker's failure, not whatever came after it.
    Decision result = out.finish(DecisionKind::LeaveInPlace);
    result.reason = markerFailure;
    return result;
  }

  if (!appBundle.isNull() && !vpnPlugin.isNull()) record.set(kSecondBundlePathKey, String(vpnPlugin.path()));
  decision.record = std::move(record);
  Decision result = out.finish(DecisionKind::RecordBuilt);
  result.reason = found;
  return result;
}

Decision classifyContainer(const URL& container) {
  ContainerProbe probe;
  return classifyContainer(container, probe);
}

std::map<std::string, size_t> identifierClaims(const std::vector<Dictionary>& records) {
  std::map<std::string, size_t> claims;
  for (const Dictionary& record : records) ++claims[record.get(kBundleIdentifierKey).asString().str()];
  return claims;
}

}  // namespace sl::migrator
