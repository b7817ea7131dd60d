#pragma once

// The registrar's in-memory state and what a scan produces (internal to
// tn_registrar).

#include <map>
#include <memory>
#include <string>
#include <unordered_map>
#include <vector>

#include "platform/registrar/Records.h"
#include "platform/registrar/StoredRecords.h"

namespace registrar {

// The registry as it stands: stored facts and the records made from them.
// Immutable once built; a change builds a new State.
struct State {
  tn::UUID knowledge;
  std::string locale;
  std::vector<std::string> languages;
  std::map<std::string, StoredApp> storedApps;          // by path
  std::map<std::string, StoredPlugIn> storedPlugIns;    // by path
  std::map<std::string, StoredExtensionPoint> storedPoints;  // by identifier
  std::map<std::string, AppPtr> apps;                   // by path
  std::map<std::string, PlugInPtr> plugIns;             // by path
  std::unordered_map<tn::UUID, PlugInPtr> byUUID;
  std::unordered_multimap<std::string, PlugInPtr> byIdentifierKey;  // equalityKey(identifier)
  std::map<std::string, ExtensionPointPtr, std::less<>> points;
};

// What a scan found: the stored facts the registry should hold.
struct ScanPlan {
  std::map<std::string, StoredApp> apps;
  std::map<std::string, StoredPlugIn> plugIns;
  std::map<std::string, StoredExtensionPoint> points;
  size_t skipped = 0;
};

}  // namespace registrar
