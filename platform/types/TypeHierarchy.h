#pragma once

// platform/types: the type hierarchy (library tn_types).
//
// On this system the types that hosts and plug-ins speak of are MIME types,
// so the hierarchy is the system's shared MIME database (its subclasses
// and aliases files), plus the parents every MIME type has implicitly,
// plus type declarations of Tenon's own for identifiers that are not MIME
// types. TypeSources.h says where these are read from, TypeTable.h what
// conformance means; docs/types.md describes both for authors.
//
// A TypeHierarchy holds the current TypeTable. It is loaded when the
// hierarchy is made, again on reload(), and, once watch() was called,
// whenever one of its files changes (inotify). Readers never wait for a
// reload and take no lock: snapshot() compares a stamp with the one its
// thread saw last and hands out the table it kept; only the first call on
// a thread after a reload takes the publishing lock, briefly.
//
//   auto table = types::TypeHierarchy::system().snapshot();
//   table->conforms("image/svg+xml", "application/xml");   // true

#include <atomic>
#include <cstdint>
#include <memory>
#include <mutex>
#include <string_view>

#include "platform/types/TypeSources.h"
#include "platform/types/TypeTable.h"
#include "platform/value/Result.h"

namespace types {

class TypeWatcher;

class TypeHierarchy {
 public:
  // Loads the table from paths now.
  explicit TypeHierarchy(TypePaths paths);
  // Stops watching; no reload runs after it returns.
  ~TypeHierarchy();
  TypeHierarchy(const TypeHierarchy&) = delete;
  TypeHierarchy& operator=(const TypeHierarchy&) = delete;

  // The process's hierarchy over TypePaths::fromEnvironment(), loaded at
  // the first call and watched from then on. Never destroyed.
  static TypeHierarchy& system();

  // The current table. Any thread; takes no lock unless the table changed
  // since this thread's previous call.
  std::shared_ptr<const TypeTable> snapshot() const;
  bool conforms(std::string_view type, std::string_view to) const { return snapshot()->conforms(type, to); }

  // Reads every source again and publishes the new table (problems are
  // logged on "ops"). Any thread; reloads run one at a time.
  void reload();

  // Follows changes of the sources with inotify from now on (one thread);
  // a second call does nothing. Errors: the inotify descriptor could not be
  // made.
  tn::Result<void> watch();

  const TypePaths& paths() const { return paths_; }
  // How many tables were published; for tests.
  uint64_t loadCount() const { return loads_.load(); }

 private:
  void publish(std::shared_ptr<const TypeTable> table);

  const TypePaths paths_;
  mutable std::mutex publishMutex_;             // guards table_ and its stamp's change
  std::shared_ptr<const TypeTable> table_;      // guarded by publishMutex_
  std::atomic<uint64_t> stamp_{0};              // process-wide unique stamp of table_
  std::atomic<uint64_t> loads_{0};
  std::mutex reloadMutex_;                      // one reload at a time
  std::mutex watchMutex_;
  std::unique_ptr<TypeWatcher> watcher_;        // guarded by watchMutex_
};

}  // namespace types
