// Probes: the daemon's USDT trace probes, provider "tenond".
//
//   probe            arguments
//   client-new       int client pid
//   client-done      int client pid
//   request-input    int client pid, const char* printed description of the request message
//   request          int client pid, const char* request type (may be null)
//   request-output   int client pid, const char* printed description of the reply
//   db-load          const char* error domain, uint64_t error code
//   discover-raw     unsigned int candidate count
//   plugin-add       const char* path
//   plugin-ready     const char* plug-in UUID as a string
//   plugin-remove    const char* path, bool whether the path resolved
//
// Each probe has a semaphore that tracers (bpftrace, systemtap) increment
// while attached, so the probe has a real is-enabled test:
//
//   if (TN_PROBE_ENABLED(request_input)) { ... }
//
// Fire probes with the TN_PROBE_* macros below. Each tests the semaphore
// first and evaluates its arguments only when a tracer is attached, so a
// probe nobody watches costs one load and one branch. The description probes
// take a callable returning std::string; it is called only when the probe is
// enabled, and the string is freed right after the probe fires:
//
//   TN_PROBE_REQUEST_INPUT(pid, [&] { return describe(message); });
//
// The probe sites themselves are the tn::probe::fire* functions, one per
// probe and out of line in Probes.cpp, so a program that fires any probe
// carries all ten, each with exactly one site; `readelf -n` lists them as
// stapsdt notes.

#pragma once

#include <cstdint>
#include <string>
#include <utility>

// The semaphores, named tenond_<probe with underscores>_semaphore. Tracers
// write them; the program only reads them.
extern "C" {
extern volatile unsigned short tenond_client_new_semaphore;
extern volatile unsigned short tenond_client_done_semaphore;
extern volatile unsigned short tenond_request_input_semaphore;
extern volatile unsigned short tenond_request_semaphore;
extern volatile unsigned short tenond_request_output_semaphore;
extern volatile unsigned short tenond_db_load_semaphore;
extern volatile unsigned short tenond_discover_raw_semaphore;
extern volatile unsigned short tenond_plugin_add_semaphore;
extern volatile unsigned short tenond_plugin_ready_semaphore;
extern volatile unsigned short tenond_plugin_remove_semaphore;
}

// True while a tracer is attached to the probe; `probe` is its name with
// underscores, e.g. TN_PROBE_ENABLED(client_new).
#define TN_PROBE_ENABLED(probe) (__builtin_expect(tenond_##probe##_semaphore != 0, 0))

namespace tn::probe {

// The probe sites. Each fires its probe unconditionally (a no-op unless a
// tracer is attached); call them through the macros, which test the
// semaphore first. String arguments must stay valid for the call only.
void fireClientNew(int pid);
void fireClientDone(int pid);
void fireRequestInput(int pid, const char* description);
void fireRequest(int pid, const char* type);
void fireRequestOutput(int pid, const char* description);
void fireDbLoad(const char* domain, std::uint64_t code);
void fireDiscoverRaw(unsigned int count);
void firePlugInAdd(const char* path);
void firePlugInReady(const char* uuid);
void firePlugInRemove(const char* path, bool resolved);

// Calls `describe` and returns its text; names what the description probes
// require of their callable.
template <typename Describe>
std::string describeWith(Describe&& describe) {
  return std::string(std::forward<Describe>(describe)());
}

}  // namespace tn::probe

#define TN_PROBE_FIRE_IF_ENABLED(probe, fire)  \
  do {                                        \
    if (TN_PROBE_ENABLED(probe)) [[unlikely]] \
      fire;                                   \
  } while (0)

#define TN_PROBE_CLIENT_NEW(pid) \
  TN_PROBE_FIRE_IF_ENABLED(client_new, ::tn::probe::fireClientNew(pid))
#define TN_PROBE_CLIENT_DONE(pid) \
  TN_PROBE_FIRE_IF_ENABLED(client_done, ::tn::probe::fireClientDone(pid))
// The callable is the last argument, variadic so that a lambda whose capture
// list holds commas ([&, this]) needs no extra parentheses.
#define TN_PROBE_REQUEST_INPUT(pid, ...)                  \
  TN_PROBE_FIRE_IF_ENABLED(request_input,                 \
                           ::tn::probe::fireRequestInput( \
                               pid, ::tn::probe::describeWith(__VA_ARGS__).c_str()))
#define TN_PROBE_REQUEST(pid, type) \
  TN_PROBE_FIRE_IF_ENABLED(request, ::tn::probe::fireRequest(pid, type))
#define TN_PROBE_REQUEST_OUTPUT(pid, ...)                  \
  TN_PROBE_FIRE_IF_ENABLED(request_output,                 \
                           ::tn::probe::fireRequestOutput( \
                               pid, ::tn::probe::describeWith(__VA_ARGS__).c_str()))
#define TN_PROBE_DB_LOAD(domain, code) \
  TN_PROBE_FIRE_IF_ENABLED(db_load, ::tn::probe::fireDbLoad(domain, code))
#define TN_PROBE_DISCOVER_RAW(count) \
  TN_PROBE_FIRE_IF_ENABLED(discover_raw, ::tn::probe::fireDiscoverRaw(count))
#define TN_PROBE_PLUGIN_ADD(path) \
  TN_PROBE_FIRE_IF_ENABLED(plugin_add, ::tn::probe::firePlugInAdd(path))
// `uuid` is evaluated only when enabled, so it may be an expression that
// makes the string, e.g. TN_PROBE_PLUGIN_READY(plugIn.uuid().string().c_str()).
#define TN_PROBE_PLUGIN_READY(uuid) \
  TN_PROBE_FIRE_IF_ENABLED(plugin_ready, ::tn::probe::firePlugInReady(uuid))
#define TN_PROBE_PLUGIN_REMOVE(path, resolved) \
  TN_PROBE_FIRE_IF_ENABLED(plugin_remove, ::tn::probe::firePlugInRemove(path, resolved))
