#include "platform/log/Probes.h"

#include "platform/log/ProbeSite.h"

// One definition of each semaphore, in the section tracers expect. Zero
// until a tracer attaches.
#define TN_DEFINE_SEMAPHORE(symbol) \
  __attribute__((section(".probes"))) volatile unsigned short symbol = 0

extern "C" {
TN_DEFINE_SEMAPHORE(tenond_client_new_semaphore);
TN_DEFINE_SEMAPHORE(tenond_client_done_semaphore);
TN_DEFINE_SEMAPHORE(tenond_request_input_semaphore);
TN_DEFINE_SEMAPHORE(tenond_request_semaphore);
TN_DEFINE_SEMAPHORE(tenond_request_output_semaphore);
TN_DEFINE_SEMAPHORE(tenond_db_load_semaphore);
TN_DEFINE_SEMAPHORE(tenond_discover_raw_semaphore);
TN_DEFINE_SEMAPHORE(tenond_plugin_add_semaphore);
TN_DEFINE_SEMAPHORE(tenond_plugin_ready_semaphore);
TN_DEFINE_SEMAPHORE(tenond_plugin_remove_semaphore);
}

// Every site must stay one copy, in its own function, so a program has
// exactly one site per probe: no inlining into callers (the note would be
// duplicated at each call), and with GCC no cloning for constant arguments.
#if defined(__clang__)
#define TN_PROBE_SITE __attribute__((noinline))
#else
#define TN_PROBE_SITE __attribute__((noinline, noipa))
#endif

namespace tn::probe {

TN_PROBE_SITE void fireClientNew(int pid) {
  TN_SDT_PROBE(tenond_client_new_semaphore, "client-new", 1, (pid));
}

TN_PROBE_SITE void fireClientDone(int pid) {
  TN_SDT_PROBE(tenond_client_done_semaphore, "client-done", 1, (pid));
}

TN_PROBE_SITE void fireRequestInput(int pid, const char* description) {
  TN_SDT_PROBE(tenond_request_input_semaphore, "request-input", 2, (pid, description));
}

TN_PROBE_SITE void fireRequest(int pid, const char* type) {
  TN_SDT_PROBE(tenond_request_semaphore, "request", 2, (pid, type));
}

TN_PROBE_SITE void fireRequestOutput(int pid, const char* description) {
  TN_SDT_PROBE(tenond_request_output_semaphore, "request-output", 2, (pid, description));
}

TN_PROBE_SITE void fireDbLoad(const char* domain, std::uint64_t code) {
  TN_SDT_PROBE(tenond_db_load_semaphore, "db-load", 2, (domain, code));
}

TN_PROBE_SITE void fireDiscoverRaw(unsigned int count) {
  TN_SDT_PROBE(tenond_discover_raw_semaphore, "discover-raw", 1, (count));
}

TN_PROBE_SITE void firePlugInAdd(const char* path) {
  TN_SDT_PROBE(tenond_plugin_add_semaphore, "plugin-add", 1, (path));
}

TN_PROBE_SITE void firePlugInReady(const char* uuid) {
  TN_SDT_PROBE(tenond_plugin_ready_semaphore, "plugin-ready", 1, (uuid));
}

TN_PROBE_SITE void firePlugInRemove(const char* path, bool resolved) {
  TN_SDT_PROBE(tenond_plugin_remove_semaphore, "plugin-remove", 2, (path, resolved));
}

}  // namespace tn::probe
