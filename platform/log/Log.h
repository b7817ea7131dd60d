// platform/log: structured logging and trace probes for Tenon (library tn_log).
//
// Logging. Messages are logged on log objects of subsystem
// "com.ostrel.Tenon", one per category: ops(), traffic(), extension(), rg(),
// sandbox(); plus the default log (no subsystem) for messages about the
// process as a whole. Levels are default, info, debug and error; default and
// error are always on, info and debug are turned on per category by the
// environment variable TENON_LOG (or configure()). Calls go through macros
// that skip argument evaluation and formatting when the level is off:
//
//   TN_LOG_INFO(tn::log::traffic(), "client {} connected", pid);
//
// Records go to one process-wide sink: the systemd journal when stderr is
// connected to it, otherwise one line per message on stderr; tests install a
// CaptureSink (ScopedCaptureSink) and assert on what was logged.
//
// Probes. USDT trace probes of provider "tenond" with semaphores, fired with
// the TN_PROBE_* macros (Probes.h) and listed by `readelf -n`.
//
// docs/logging.md describes both for operators. The library depends on the
// formatting library, libsystemd and threads; nothing else of the repository.
//
//   Level.h          the four levels
//   LogObject.h      Log, the log object; createLog(); defaultLog()
//   Categories.h     the five category accessors
//   CategorySlot.h   once-only making of a category's object, with fallback
//   LogMacros.h      TN_LOG_DEFAULT / _INFO / _DEBUG / _ERROR
//   LogSettings.h    the TENON_LOG syntax
//   Configuration.h  configure(), reading TENON_LOG
//   Sink.h Record.h  where records go, and what they carry
//   Output.h         the current sink: setSink(), currentSink()
//   StderrSink.h  JournalSink.h  CaptureSink.h
//   Probes.h         the USDT probes
//
// Including this header includes all of the public headers above.

#pragma once

#include "platform/log/CaptureSink.h"
#include "platform/log/Categories.h"
#include "platform/log/CategorySlot.h"
#include "platform/log/Configuration.h"
#include "platform/log/JournalSink.h"
#include "platform/log/Level.h"
#include "platform/log/LogMacros.h"
#include "platform/log/LogObject.h"
#include "platform/log/LogSettings.h"
#include "platform/log/Names.h"
#include "platform/log/Output.h"
#include "platform/log/Probes.h"
#include "platform/log/Record.h"
#include "platform/log/Sink.h"
#include "platform/log/StderrSink.h"
