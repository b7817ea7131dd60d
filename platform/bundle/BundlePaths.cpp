#include "platform/bundle/BundlePaths.h"

#include <sys/stat.h>

#include <filesystem>
#include <system_error>

#include "platform/bundle/BundleLayout.h"

namespace bundle {
namespace {

bool hasEntry(const std::string& path) {
  struct stat status {};
  return ::lstat(path.c_str(), &status) == 0;
}

}  // namespace

std::string joinPath(const std::string& directory, std::string_view name) {
  std::string path = directory;
  if (path.empty() || path.back() != '/') path += '/';
  path += name;
  return path;
}

std::string absoluteBundlePath(std::string_view path) {
  if (path.empty()) return {};
  std::filesystem::path result(path);
  if (result.is_relative()) {
    std::error_code error;
    const std::filesystem::path current = std::filesystem::current_path(error);
    if (!error) result = current / result;
  }
  std::string text = result.lexically_normal().string();
  while (text.size() > 1 && text.back() == '/') text.pop_back();
  return text;
}

std::optional<std::string> findEnclosingBundle(const std::string& executablePath) {
  std::filesystem::path directory = std::filesystem::path(executablePath).parent_path();
  for (;;) {
    const std::string candidate = directory.string();
    if (candidate.empty()) return std::nullopt;
    if (hasEntry(joinPath(candidate, kInfoManifestName))) return candidate;
    const std::filesystem::path parent = directory.parent_path();
    if (parent == directory) return std::nullopt;  // "/" was the last candidate
    directory = parent;
  }
}

}  // namespace bundle
