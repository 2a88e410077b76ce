// Classifying one entry of the old container root, without changing anything.
//
// The migrator's introspection and the `stowline plan` command share this
// decision. classifyContainer() reads what it needs (the container's listing,
// lstat of the entries whose names hold a dot, bundle identifiers, the
// migration marker) through a ContainerProbe, in the order the decision needs
// it, and never writes: it returns the decision and the host-log lines that
// the migrator writes for it, in order. Acting on the decision (logging,
// deleting the entry) is the caller's business.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "AppMigrator/OldLayout.h"
#include "Platform/Error.h"
#include "Platform/URL.h"
#include "Platform/Value.h"

namespace sl::migrator {

// The functions under which the migrator logs the lines made here.
inline constexpr char kIntrospectFunctionName[] = "-[SLAppMigrator _introspectContainer:orderResultEarly:]";
inline constexpr char kValidateMarkerFunctionName[] = "-[SLAppMigrator _loadAndValidateMigrationMarkerAtURL:]";

// One host-log line: level, the function it is logged under, the text.
struct Message {
  int level = 0;
  const char* function = "";
  std::string text;
  bool operator==(const Message& other) const {
    return level == other.level && std::string_view(function) == other.function && text == other.text;
  }
};

// A marker read back: the dictionary when it is valid (null otherwise) and
// the lines that explain a rejection.
struct MarkerValidation {
  Dictionary marker;
  std::vector<Message> messages;
};

// Reads the marker at `url` and checks its keys; never logs.
MarkerValidation validateMigrationMarker(const URL& url);

// Checks the marker whose file content is `bytes`, as the call above does
// with what it reads; `url` is the file the messages name.
MarkerValidation validateMigrationMarkerData(std::span<const uint8_t> bytes, const URL& url);

// The identifier that the bundle directory declares; null when it cannot be
// read as a bundle or declares none.
String bundleIdentifierForBundle(const URL& bundle);

// What the classification asks of the container. The default answers from
// the file system; tests answer from tables.
class ContainerProbe {
 public:
  virtual ~ContainerProbe() = default;
  // Every entry of the container, links included, in listing order; the
  // error record on failure.
  virtual std::optional<std::vector<URL>> listContainer(const URL& container, Error* error);
  // lstat of the entry: 0 with *isLink set, or the errno of the failure.
  virtual int lstatEntry(const URL& entry, bool* isLink);
  virtual String bundleIdentifier(const URL& bundle) { return bundleIdentifierForBundle(bundle); }
  virtual MarkerValidation validateMarker(const URL& marker) { return validateMigrationMarker(marker); }
};

enum class DecisionKind {
  RecordBuilt,   // an application bundle or VPN plug-in was found: the record goes to migration
  MarkerFound,   // a valid marker: it is the record
  Delete,        // not a directory, or nothing to migrate in it
  LeaveInPlace,  // cannot be handled safely now
  Vanished,      // gone since the old container root was listed
};

// "recordBuilt", "markerFound", "delete", "leaveInPlace", "vanished".
const char* decisionKindName(DecisionKind kind);

struct Decision {
  DecisionKind kind = DecisionKind::LeaveInPlace;
  // The container record, for RecordBuilt and MarkerFound; null otherwise.
  Dictionary record;
  // The early flag as the last step set it; unset when no step set it (it
  // is meaningful for records only).
  std::optional<bool> early;
  // The line that explains the outcome: for a record the one that found its
  // principal bundle or the marker, otherwise the one about the entry's fate.
  Message reason;
  // Every line the migrator logs for this entry, in order (the marker's own
  // validation lines included).
  std::vector<Message> messages;
};

Decision classifyContainer(const URL& container, ContainerProbe& probe);
Decision classifyContainer(const URL& container);

// How many of `records` claim each identifier ("BundleIdentifier"). Two
// containers that claim one would both move their data into that
// application's one data container, the later over the earlier: the
// migration leaves every record whose identifier counts more than one in
// place.
std::map<std::string, size_t> identifierClaims(const std::vector<Dictionary>& records);

}  // namespace sl::migrator
