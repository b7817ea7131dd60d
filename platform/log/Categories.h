// Categories: the five process-wide log objects of subsystem
// "com.ostrel.Tenon", one per category.
//
//   ops()        what the daemon does: start, stop, database loads, plug-ins
//   traffic()    requests and replies between clients and the daemon
//   extension()  plug-in (extension) discovery and life cycle
//   rg()         the registrar: installs, scans, the store
//   sandbox()    sandbox checks and extension tokens
//
// Each accessor returns the same object every time; the first call (from
// any thread) makes it with makeCategoryLog() through a CategorySlot, so a
// category whose object cannot be made falls back to the default log.
// Objects are never destroyed: code running while the process exits may
// still log.

#pragma once

#include <memory>

#include "platform/log/LogObject.h"

namespace tn::log {

Log& ops();
Log& traffic();
Log& extension();
Log& rg();
Log& sandbox();

// The categories' maker: asks the platform log (createLog) for the object of
// subsystem "com.ostrel.Tenon" and `category`. Null when it cannot be made.
std::shared_ptr<Log> makeCategoryLog(const char* category);

}  // namespace tn::log
