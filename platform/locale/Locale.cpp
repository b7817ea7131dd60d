#include "platform/locale/Locale.h"

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <map>
#include <mutex>

#include "platform/log/Log.h"
#include "platform/paths/InstancePaths.h"

namespace locale {
namespace {

constexpr const char* kLocaleKeys[] = {"LC_ALL", "LC_MESSAGES", "LANG"};
constexpr const char* kConfigurationName = "locale.conf";

std::string_view trimmed(std::string_view text) {
  const auto first = text.find_first_not_of(" \t\r");
  if (first == std::string_view::npos) return {};
  const auto last = text.find_last_not_of(" \t\r");
  return text.substr(first, last - first + 1);
}

bool isPlainName(std::string_view name) {
  return !name.empty() && name != "." && name != ".." && name.find('/') == std::string_view::npos &&
         name.find('\0') == std::string_view::npos;
}

// KEY=value lines of the configuration file; unreadable means none.
std::map<std::string, std::string> readConfiguration(const std::string& path) {
  std::map<std::string, std::string> values;
  std::ifstream in(path);
  std::string line;
  while (std::getline(in, line)) {
    const std::string_view text = trimmed(line);
    if (text.empty() || text.front() == '#') continue;
    const auto equals = text.find('=');
    if (equals == std::string_view::npos) continue;
    std::string_view value = trimmed(text.substr(equals + 1));
    if (value.size() >= 2 && (value.front() == '"' || value.front() == '\'') && value.back() == value.front()) {
      value = value.substr(1, value.size() - 2);
    }
    values[std::string(trimmed(text.substr(0, equals)))] = std::string(value);
  }
  return values;
}

}  // namespace

std::string localeConfigurationPath() { return paths::platformRoot() + "/etc/" + kConfigurationName; }

std::string normalizedLocale(std::string_view locale) {
  const auto end = locale.find_first_of(".@");
  const std::string_view base = trimmed(locale.substr(0, end));
  if (base.empty() || base == "C" || base == "POSIX") return "en";
  return std::string(base);
}

std::string currentLocale() { return currentLocale(localeConfigurationPath()); }

std::string currentLocale(const std::string& configurationPath) {
  const std::map<std::string, std::string> configured = readConfiguration(configurationPath);
  for (const char* key : kLocaleKeys) {
    if (auto found = configured.find(key); found != configured.end() && !found->second.empty()) {
      return normalizedLocale(found->second);
    }
  }
  for (const char* key : kLocaleKeys) {
    if (const char* value = std::getenv(key); value != nullptr && *value != '\0') return normalizedLocale(value);
  }
  return "en";
}

std::vector<std::string> localeFallbacks(std::string_view locale) {
  std::vector<std::string> fallbacks;
  if (isPlainName(locale)) fallbacks.emplace_back(locale);
  if (const auto underscore = locale.find('_'); underscore != std::string_view::npos && underscore > 0) {
    const std::string_view language = locale.substr(0, underscore);
    if (isPlainName(language)) fallbacks.emplace_back(language);
  }
  return fallbacks;
}

tn::Result<std::unique_ptr<LocaleWatcher>> LocaleWatcher::create(
    std::shared_ptr<tn::dispatch::SerialQueue> queue, std::function<void(const std::string& locale)> handler) {
  const std::filesystem::path directory = std::filesystem::path(localeConfigurationPath()).parent_path();
  std::error_code ignored;
  std::filesystem::create_directories(directory, ignored);

  struct Seen {
    std::mutex mutex;
    std::string locale;
  };
  auto seen = std::make_shared<Seen>();
  seen->locale = currentLocale();
  auto watch = notify::DirectoryWatch::create(
      directory.string(), [seen, queue, handler = std::move(handler)](const notify::DirectoryChanges& changes) {
        if (changes.directoryGone) {
          TN_LOG_ERROR(tn::log::ops(), "locale changes are no longer seen: {} is gone",
                       std::filesystem::path(localeConfigurationPath()).parent_path().string());
          return;
        }
        if (!changes.touches(kConfigurationName)) return;
        std::string now = currentLocale();
        {
          const std::lock_guard lock(seen->mutex);
          if (now == seen->locale) return;
          seen->locale = now;
        }
        queue->async([handler, now = std::move(now)] { handler(now); });
      });
  if (!watch) return watch.error();
  return std::make_unique<LocaleWatcher>(std::move(*watch));
}

LocaleWatcher::LocaleWatcher(std::unique_ptr<notify::DirectoryWatch> watch) : watch_(std::move(watch)) {}

LocaleWatcher::~LocaleWatcher() = default;

}  // namespace locale
