#include "tenond/database/TNDatabase.h"

#include <cstdlib>
#include <filesystem>
#include <system_error>

#include "platform/log/Log.h"

namespace tnd {

std::string TNDatabase::defaultDatabasePath() {
  const char* root = std::getenv("TENON_ROOT");
  return std::string(root ? root : "") + "/var/db/Tenon-Annotations";
}

bool TNDatabase::initWithDatabase(const std::optional<std::string>& path) {
  annotationsPath_ = path ? *path : defaultDatabasePath();
  const std::filesystem::path directory = std::filesystem::path(annotationsPath_).parent_path();
  if (directory.empty()) return true;  // a bare file name lives in the working directory
  std::error_code error;
  std::filesystem::create_directories(directory, error);
  if (error || !std::filesystem::is_directory(directory)) {
    TN_LOG_ERROR(tn::log::ops(), "cannot use {} for the annotation file: {}", directory.string(),
                 error ? error.message() : std::string("not a directory"));
    return false;
  }
  return true;
}

}  // namespace tnd
