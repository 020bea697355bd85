#pragma once

// Static trace probes under the provider "ekd". With <sys/sdt.h> and semaphores, a probe's
// arguments are only built while a tracer has it enabled:
//   if (EK_PROBE_ENABLED(request_output)) EK_PROBE2(request_output, pid, text.c_str());
// Without the header the probes compile to nothing.

#if __has_include(<sys/sdt.h>)
#define _SDT_HAS_SEMAPHORES 1
#include <sys/sdt.h>

#define EK_PROBE_SEMAPHORE(name) ekd_##name##_semaphore
#define EK_DECLARE_PROBE(name) \
  extern "C" unsigned short EK_PROBE_SEMAPHORE(name) __attribute__((unused))

EK_DECLARE_PROBE(client_new);
EK_DECLARE_PROBE(client_done);
EK_DECLARE_PROBE(request_input);
EK_DECLARE_PROBE(request);
EK_DECLARE_PROBE(request_output);
EK_DECLARE_PROBE(db_load);
EK_DECLARE_PROBE(discover_raw);
EK_DECLARE_PROBE(plugin_add);
EK_DECLARE_PROBE(plugin_remove);
EK_DECLARE_PROBE(plugin_ready);

#define EK_PROBE_ENABLED(name) (__builtin_expect(EK_PROBE_SEMAPHORE(name) != 0, 0))
#define EK_PROBE1(name, a) STAP_PROBE1(ekd, name, a)
#define EK_PROBE2(name, a, b) STAP_PROBE2(ekd, name, a, b)
#else
#define EK_PROBE_ENABLED(name) false
#define EK_PROBE1(name, a) ((void)0)
#define EK_PROBE2(name, a, b) ((void)0)
#endif
