#include "platform/types/TypeSources.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <optional>

#include <fmt/format.h>

#include "platform/value/Document.h"

namespace types {
namespace {

constexpr std::string_view kDefaultDataDirectories = "/usr/local/share:/usr/share";
constexpr std::string_view kDeclarationSuffix = ".manifest";

std::string environment(const char* name) {
  const char* value = std::getenv(name);
  return value ? value : "";
}

// The file's bytes; none (with a problem) when it is unreadable, not a
// regular file or too large, and none without a problem when it is absent.
std::optional<std::string> readBounded(const std::string& path, TypeTableBuilder& builder) {
  const int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK);
  if (fd < 0) {
    if (errno != ENOENT && errno != ENOTDIR) builder.addProblem(fmt::format("{}: cannot read: {}", path, std::strerror(errno)));
    return std::nullopt;
  }
  struct stat status {};
  std::optional<std::string> contents;
  if (::fstat(fd, &status) != 0 || !S_ISREG(status.st_mode)) {
    builder.addProblem(fmt::format("{}: not a regular file", path));
  } else if (static_cast<size_t>(status.st_size) > kMaxFileSize) {
    builder.addProblem(fmt::format("{}: larger than {} bytes; ignored", path, kMaxFileSize));
  } else {
    std::string bytes(static_cast<size_t>(status.st_size), '\0');
    size_t done = 0;
    while (done < bytes.size()) {
      const ssize_t n = ::read(fd, bytes.data() + done, bytes.size() - done);
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) break;
      done += static_cast<size_t>(n);
    }
    bytes.resize(done);
    contents = std::move(bytes);
  }
  ::close(fd);
  return contents;
}

std::string_view trimmed(std::string_view text) {
  const auto first = text.find_first_not_of(" \t\r");
  if (first == std::string_view::npos) return {};
  return text.substr(first, text.find_last_not_of(" \t\r") - first + 1);
}

// Each "first second" line of contents (blank lines and '#' comments
// skipped) to each(first, second, origin).
template <typename Each>
void forEachPair(TypeTableBuilder& builder, std::string_view contents, const std::string& name, Each each) {
  size_t lineNumber = 0;
  while (!contents.empty()) {
    const size_t end = contents.find('\n');
    const std::string_view line = trimmed(contents.substr(0, end));
    contents = end == std::string_view::npos ? std::string_view() : contents.substr(end + 1);
    ++lineNumber;
    if (line.empty() || line.front() == '#') continue;
    const std::string origin = fmt::format("{}:{}", name, lineNumber);
    const size_t space = line.find_first_of(" \t");
    const std::string_view first = line.substr(0, space);
    const std::string_view second = space == std::string_view::npos ? std::string_view() : trimmed(line.substr(space));
    if (line.size() > kMaxLineLength || !isMimeTypeName(first) || !isMimeTypeName(second)) {
      builder.addProblem(fmt::format("{}: not two MIME types; ignored", origin));
      continue;
    }
    each(first, second, origin);
  }
}

void addDeclaration(TypeTableBuilder& builder, const tn::Value& declaration, const std::string& origin) {
  const std::string* identifier = declaration["identifier"].string();
  if (!identifier || !isDeclaredTypeName(*identifier)) {
    builder.addProblem(fmt::format("{}: a declaration needs an identifier that is not a MIME type; ignored", origin));
    return;
  }
  builder.addType(*identifier, origin);
  const tn::Value& parents = declaration["parents"];
  if (parents.isNull()) return;
  if (!parents.isArray()) {
    builder.addProblem(fmt::format("{}: parents of {} are not a list; ignored", origin, *identifier));
    return;
  }
  for (const tn::Value& parent : *parents.array()) {
    const std::string* name = parent.string();
    if (name && isTypeName(*name)) {
      builder.addParent(*identifier, *name, origin);
    } else {
      builder.addProblem(fmt::format("{}: a parent of {} is not a type name; ignored", origin, *identifier));
    }
  }
}

std::vector<std::string> declarationFiles(const std::string& directory, TypeTableBuilder& builder) {
  std::vector<std::string> files;
  std::error_code error;
  for (std::filesystem::directory_iterator it(directory, error), end; !error && it != end; it.increment(error)) {
    const std::string name = it->path().filename().string();
    if (name.starts_with(".") || !name.ends_with(kDeclarationSuffix)) continue;
    files.push_back(it->path().string());
  }
  std::sort(files.begin(), files.end());
  if (files.size() > kMaxDeclarationFiles) {
    builder.addProblem(fmt::format("{}: more than {} documents; the rest are ignored", directory, kMaxDeclarationFiles));
    files.resize(kMaxDeclarationFiles);
  }
  return files;
}

}  // namespace

TypePaths TypePaths::forRoot(const std::string& root, const std::string& dataDirectories) {
  TypePaths paths;
  std::string_view list = dataDirectories.empty() ? kDefaultDataDirectories : std::string_view(dataDirectories);
  while (!list.empty() && paths.mimeDirectories.size() < kMaxDataDirectories) {
    const size_t colon = list.find(':');
    std::string_view directory = list.substr(0, colon);
    list = colon == std::string_view::npos ? std::string_view() : list.substr(colon + 1);
    while (directory.size() > 1 && directory.ends_with('/')) directory.remove_suffix(1);
    if (!directory.starts_with('/')) continue;  // relative entries mean nothing here
    std::string mime = root + std::string(directory == "/" ? "" : directory) + "/mime";
    if (std::find(paths.mimeDirectories.begin(), paths.mimeDirectories.end(), mime) == paths.mimeDirectories.end()) {
      paths.mimeDirectories.push_back(std::move(mime));
    }
  }
  paths.declarationsDirectory = root + "/usr/share/tenon/types";
  return paths;
}

TypePaths TypePaths::fromEnvironment() { return forRoot(environment("TENON_ROOT"), environment("XDG_DATA_DIRS")); }

void addSubclassLines(TypeTableBuilder& builder, std::string_view contents, const std::string& name) {
  forEachPair(builder, contents, name, [&](std::string_view type, std::string_view parent, const std::string& origin) {
    builder.addType(type, origin);
    builder.addParent(type, parent, origin);
  });
}

void addAliasLines(TypeTableBuilder& builder, std::string_view contents, const std::string& name) {
  forEachPair(builder, contents, name, [&](std::string_view alias, std::string_view canonical,
                                           const std::string& origin) { builder.addAlias(alias, canonical, origin); });
}

void addDeclarations(TypeTableBuilder& builder, const tn::Value& document, const std::string& name) {
  const tn::Value& list = document["types"];
  if (!list.isArray()) {
    builder.addProblem(fmt::format("{}: not a dictionary with a \"types\" list; ignored", name));
    return;
  }
  size_t position = 0;
  for (const tn::Value& declaration : *list.array()) {
    addDeclaration(builder, declaration, fmt::format("{}: types[{}]", name, position++));
  }
}

std::shared_ptr<const TypeTable> loadTypeTable(const TypePaths& paths) {
  TypeTableBuilder builder;
  for (const std::string& directory : paths.mimeDirectories) {
    if (auto aliases = readBounded(directory + "/aliases", builder)) {
      addAliasLines(builder, *aliases, directory + "/aliases");
    }
    if (auto subclasses = readBounded(directory + "/subclasses", builder)) {
      addSubclassLines(builder, *subclasses, directory + "/subclasses");
    }
  }
  for (const std::string& file : declarationFiles(paths.declarationsDirectory, builder)) {
    std::optional<std::string> bytes = readBounded(file, builder);
    if (!bytes) continue;
    tn::Result<tn::Value> document = tn::readDocument(*bytes, file);
    if (!document.ok()) {
      builder.addProblem(document.error().localizedDescription() + "; ignored");
      continue;
    }
    addDeclarations(builder, *document, file);
  }
  return builder.build();
}

}  // namespace types
