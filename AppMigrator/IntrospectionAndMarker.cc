// SLAppMigrator: classifying the entries of the old container root, and
// reading back the migration marker that an earlier run left in a container.
//
// An entry is an old container holding an application bundle and/or a VPN
// plug-in (a record is built for it), a container that an interrupted run
// began to migrate (its marker is the record), something holding nothing to
// migrate (deleted), or something that cannot be handled safely now (left in
// place for the main pass's final check). The decision itself is made
// without side effects in Classification.cc (`stowline plan` shares it);
// here it is logged and carried out.

#include <vector>

#include "AppMigrator/AppMigrator.h"
#include "AppMigrator/Classification.h"
#include "FileManager/SLFileManager.h"

namespace {

void logMessages(const std::vector<sl::migrator::Message>& messages) {
  for (const sl::migrator::Message& message : messages) {
    sl::hostLogWrite(__FILE__, message.function, __LINE__, "Movanta", message.level, message.text);
  }
}

}  // namespace

sl::Dictionary SLAppMigrator::_introspectContainer(const sl::URL& url, bool* orderResultEarly) {
  using sl::migrator::DecisionKind;
  sl::migrator::Decision decision = sl::migrator::classifyContainer(url);
  logMessages(decision.messages);
  if (decision.early && orderResultEarly) *orderResultEarly = *decision.early;
  switch (decision.kind) {
    case DecisionKind::RecordBuilt:
    case DecisionKind::MarkerFound:
      return decision.record;
    case DecisionKind::Delete:
      // The deletion's own failure is ignored: the main pass's final check
      // finds what is left.
      (void)SLFileManager::defaultManager().removeItemAtURL(url);
      return nullptr;
    case DecisionKind::LeaveInPlace:
    case DecisionKind::Vanished:
      return nullptr;
  }
  return nullptr;
}

sl::String SLAppMigrator::_bundleIdentifierForBundle(const sl::URL& bundle) {
  return sl::migrator::bundleIdentifierForBundle(bundle);
}

sl::Dictionary SLAppMigrator::_loadAndValidateMigrationMarkerAtURL(const sl::URL& url) {
  sl::migrator::MarkerValidation validation = sl::migrator::validateMigrationMarker(url);
  logMessages(validation.messages);
  return validation.marker;
}
