#pragma once

// platform/locale: the user's current language, and news of its changes
// (library tn_locale).
//
// The machine's locale is configured in $TENON_ROOT/etc/locale.conf, lines
// of KEY=value (quotes allowed, '#' comments), of which LC_ALL, LC_MESSAGES
// and LANG are read, in that order of precedence. Without the file (or
// without those keys) the process environment's LC_ALL, LC_MESSAGES and LANG
// count, in the same order. The value is reduced to language and region:
// "de_DE.UTF-8@euro" is "de_DE"; "C", "POSIX" and nothing at all are "en".

#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "platform/dispatch/SerialQueue.h"
#include "platform/notify/DirectoryWatch.h"
#include "platform/value/Result.h"

namespace locale {

// $TENON_ROOT/etc/locale.conf
std::string localeConfigurationPath();

// The current locale, read afresh: "de_DE", "fr", "en".
std::string currentLocale();
// The same with the configuration file at `configurationPath`.
std::string currentLocale(const std::string& configurationPath);

// `locale` reduced as described above.
std::string normalizedLocale(std::string_view locale);

// The localizations to try for `locale`, most specific first: "de_DE" gives
// {"de_DE", "de"}, "fr" gives {"fr"}. Names that could not be a directory
// entry ("..", anything with '/') are left out.
std::vector<std::string> localeFallbacks(std::string_view locale);

// Runs a handler on a queue whenever the current locale changes (the file
// is written, replaced, created or removed, and the locale it gives differs
// from the one seen before). The directory $TENON_ROOT/etc is created
// (0755) when missing, so the watch can start before the file exists.
class LocaleWatcher {
 public:
  static tn::Result<std::unique_ptr<LocaleWatcher>> create(std::shared_ptr<tn::dispatch::SerialQueue> queue,
                                                           std::function<void(const std::string& locale)> handler);
  ~LocaleWatcher();

  LocaleWatcher(std::unique_ptr<notify::DirectoryWatch> watch);

 private:
  std::unique_ptr<notify::DirectoryWatch> watch_;
};

}  // namespace locale
