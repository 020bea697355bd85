#include "platform/trace/Probes.h"

#if __has_include(<sys/sdt.h>)
// The semaphores a tracer increments while it has a probe enabled. They live in ".probes"
// so that the probe notes can point tracers at them.
#define EK_DEFINE_PROBE(name) \
  unsigned short EK_PROBE_SEMAPHORE(name) __attribute__((section(".probes"))) = 0

extern "C" {

EK_DEFINE_PROBE(client_new);
EK_DEFINE_PROBE(client_done);
EK_DEFINE_PROBE(request_input);
EK_DEFINE_PROBE(request);
EK_DEFINE_PROBE(request_output);
EK_DEFINE_PROBE(db_load);
EK_DEFINE_PROBE(discover_raw);
EK_DEFINE_PROBE(plugin_add);
EK_DEFINE_PROBE(plugin_remove);
EK_DEFINE_PROBE(plugin_ready);
}
#endif
