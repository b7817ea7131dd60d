#pragma once

// tenond/database: the daemon's view of the installed plug-ins.
//
// TNDatabase will hold the plug-in cache over the registrar, the annotation
// store and the registrar observer. Until those land it is the smallest base
// the server needs: the annotation file location, the delegate told about
// removed plug-ins, and the cache limit.

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace tnd {

// Told about plug-ins that are about to be uninstalled.
class TNDatabaseDelegate {
 public:
  virtual ~TNDatabaseDelegate() = default;
  // `identifiers` name the plug-ins (bundle identifiers) being removed.
  virtual void removedPlugIns(const std::vector<std::string>& identifiers) = 0;
};

class TNDatabase {
 public:
  virtual ~TNDatabase() = default;

  // The annotation file: the -d path as given, else the default location
  // $TENON_ROOT/var/db/Tenon-Annotations.
  const std::string& annotationsPath() const { return annotationsPath_; }
  static std::string defaultDatabasePath();

  std::weak_ptr<TNDatabaseDelegate> delegate() const { return delegate_; }
  void setDelegate(std::weak_ptr<TNDatabaseDelegate> delegate) { delegate_ = std::move(delegate); }

  uint32_t cacheLimit() const { return cacheLimit_; }
  void setCacheLimit(uint32_t limit) { cacheLimit_ = limit; }

 protected:
  TNDatabase() = default;

  // The base initialiser. Takes the -d path unchanged (none for the default
  // location). Fails, logging why, when the directory that is to hold the
  // annotation file does not exist and cannot be created: the store could
  // never be saved there.
  bool initWithDatabase(const std::optional<std::string>& path);

 private:
  std::string annotationsPath_;
  std::weak_ptr<TNDatabaseDelegate> delegate_;
  uint32_t cacheLimit_ = 0;
};

}  // namespace tnd
