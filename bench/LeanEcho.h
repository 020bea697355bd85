/* The floor under every round-trip figure: the leanest client and server the kernel allows for
 * this framing. Blocking sockets, one thread per connection, a 16-byte header and a fixed body
 * sent as one write, the reply read with one recv when it arrives whole. No poll, no timeout
 * and no decoding: what is left is the socket round trip and the wake-ups it needs. */
#ifndef EKORA_BENCH_LEAN_ECHO_H
#define EKORA_BENCH_LEAN_ECHO_H

#include <stddef.h>
#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

typedef struct lean_echo_server lean_echo_server;

/* Listens on a new socket in a private temporary directory and answers each frame that wants a
 * reply with the same body, the reply flag and the same id. NULL with errno on failure. */
lean_echo_server* lean_echo_server_start(void);
const char* lean_echo_server_path(const lean_echo_server* server);
/* Closes every connection, joins every thread, removes the directory and frees the server. */
void lean_echo_server_stop(lean_echo_server* server);

typedef struct {
  uint64_t requests;      /* round trips measured */
  uint64_t failures;      /* connections that broke; their thread stopped */
  double seconds;         /* wall time of the measured phase */
  uint64_t* latencies_ns; /* requests entries, malloc'ed; free with lean_echo_result_free */
} lean_echo_result;

/* Closed-loop load on the Unix socket at path: connections threads, each sending body in a
 * frame that wants a reply and waiting for the answer, for warmup then duration seconds.
 * 0 on success; -1 with errno when a connection cannot be opened at the start. */
int lean_echo_run(const char* path, unsigned connections, double warmup, double duration,
                  const uint8_t* body, size_t body_size, lean_echo_result* result);
void lean_echo_result_free(lean_echo_result* result);

#ifdef __cplusplus
}
#endif

#endif
