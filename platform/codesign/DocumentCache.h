#pragma once

// DocumentCache: entitlement documents parsed once and reused.
//
// Every connection needs the documents of entitlements.d and of its bundle;
// parsing them each time would let a burst of connections make the daemon
// parse the same (up to 16 MiB) files over and over. The cache keeps the
// parsed result of a path for as long as the file there has the same
// device, inode, size, modification time and change time (nanoseconds as
// the file system keeps them): replacing the file (a new inode) or writing to
// it (size or times) makes the next read parse it again.
//
// The cache decides nothing about trust: callers check the open file against
// the trust rule on every use and only then ask the cache, so a verdict that
// changed (a directory made writable, an owner changed) counts at once and
// an untrusted file is never parsed at all.
//
// Bounds: at most kMaxEntries paths (the one unused longest goes first), and
// documents larger than kMaxCachedSize bytes are parsed each time and not
// kept. Thread-safe: the lock is held only to look up and to store, never
// while a file is read or parsed.

#include <sys/types.h>

#include <cstddef>
#include <memory>
#include <string>

#include "platform/value/Result.h"
#include "platform/value/Value.h"

namespace codesign {

class DocumentCache {
 public:
  static constexpr std::size_t kMaxEntries = 64;
  static constexpr off_t kMaxCachedSize = 1 << 20;

  using Parsed = std::shared_ptr<const tn::Result<tn::Value>>;

  // The process's cache.
  static DocumentCache& shared();

  // The document in the file open as fd (read from its start; path names it
  // in errors and keys the cache). Errors as bundle::readManifestDescriptor.
  Parsed read(int fd, const std::string& path);

  // How many times read() parsed a file rather than reusing a result; for
  // tests.
  std::size_t parseCount() const;
  // Empties the cache; for tests.
  void clear();

  DocumentCache();
  ~DocumentCache();
  DocumentCache(const DocumentCache&) = delete;
  DocumentCache& operator=(const DocumentCache&) = delete;

 private:
  struct State;
  std::unique_ptr<State> state_;
};

}  // namespace codesign
