#define _GNU_SOURCE
#include "bench/LeanEcho.h"

#include <errno.h>
#include <pthread.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <time.h>
#include <unistd.h>

enum { kHeader = 16, kMaxBody = 64 * 1024, kFlagWantsReply = 1, kFlagReply = 2 };

static uint32_t get_u32(const uint8_t* p) {
  return (uint32_t)p[0] << 24 | (uint32_t)p[1] << 16 | (uint32_t)p[2] << 8 | p[3];
}

static void put_u32(uint8_t* p, uint32_t v) {
  p[0] = (uint8_t)(v >> 24);
  p[1] = (uint8_t)(v >> 16);
  p[2] = (uint8_t)(v >> 8);
  p[3] = (uint8_t)v;
}

static uint64_t now_ns(void) {
  struct timespec ts;
  clock_gettime(CLOCK_MONOTONIC, &ts);
  return (uint64_t)ts.tv_sec * 1000000000u + (uint64_t)ts.tv_nsec;
}

/* Reads one whole frame into buf (kHeader + kMaxBody bytes); its size, 0 on close or error. */
static size_t read_frame(int fd, uint8_t* buf) {
  size_t have = 0;
  size_t need = kHeader;
  while (have < need) {
    ssize_t got = recv(fd, buf + have, kHeader + kMaxBody - have, 0);
    if (got <= 0) {
      if (got < 0 && errno == EINTR) continue;
      return 0;
    }
    have += (size_t)got;
    if (need == kHeader && have >= kHeader) {
      uint32_t length = get_u32(buf);
      if (length > kMaxBody) return 0;
      need = kHeader + length;
    }
  }
  return have == need ? need : 0; /* one frame in flight: more bytes mean a broken peer */
}

static int write_all(int fd, const uint8_t* bytes, size_t size) {
  while (size > 0) {
    ssize_t sent = send(fd, bytes, size, MSG_NOSIGNAL);
    if (sent < 0) {
      if (errno == EINTR) continue;
      return -1;
    }
    bytes += sent;
    size -= (size_t)sent;
  }
  return 0;
}

/* ---- server ---- */

typedef struct connection {
  int fd;
  pthread_t thread;
  struct connection* next;
} connection;

struct lean_echo_server {
  char directory[108];
  char path[108];
  int listen_fd;
  pthread_t accept_thread;
  pthread_mutex_t mutex;
  connection* connections; /* guarded by mutex */
};

static void* serve(void* argument) {
  connection* c = argument;
  uint8_t* buf = malloc(kHeader + kMaxBody);
  size_t size;
  while (buf && (size = read_frame(c->fd, buf)) > 0) {
    uint32_t flags = get_u32(buf + 4);
    if (!(flags & kFlagWantsReply)) continue;
    put_u32(buf + 4, kFlagReply);
    if (write_all(c->fd, buf, size) != 0) break;
  }
  free(buf);
  shutdown(c->fd, SHUT_RDWR);
  return NULL;
}

static void* accept_loop(void* argument) {
  lean_echo_server* server = argument;
  for (;;) {
    int fd = accept4(server->listen_fd, NULL, NULL, SOCK_CLOEXEC);
    if (fd < 0) {
      if (errno == EINTR || errno == ECONNABORTED) continue;
      return NULL; /* shut down by stop */
    }
    connection* c = calloc(1, sizeof *c);
    if (!c) {
      close(fd);
      continue;
    }
    c->fd = fd;
    pthread_mutex_lock(&server->mutex);
    if (pthread_create(&c->thread, NULL, serve, c) != 0) {
      close(fd);
      free(c);
    } else {
      c->next = server->connections;
      server->connections = c;
    }
    pthread_mutex_unlock(&server->mutex);
  }
}

lean_echo_server* lean_echo_server_start(void) {
  lean_echo_server* server = calloc(1, sizeof *server);
  if (!server) return NULL;
  server->listen_fd = -1;
  pthread_mutex_init(&server->mutex, NULL);
  const char* tmp = getenv("TMPDIR");
  if (!tmp || !*tmp) tmp = "/tmp";
  struct sockaddr_un address = {.sun_family = AF_UNIX};
  if ((size_t)snprintf(server->directory, sizeof server->directory, "%s/leanecho-XXXXXX", tmp) >=
          sizeof server->directory ||
      !mkdtemp(server->directory)) {
    free(server);
    return NULL;
  }
  snprintf(server->path, sizeof server->path, "%.90s/echo", server->directory);
  memcpy(address.sun_path, server->path, strlen(server->path));
  server->listen_fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (server->listen_fd < 0 ||
      bind(server->listen_fd, (const struct sockaddr*)&address, sizeof address) != 0 ||
      listen(server->listen_fd, 128) != 0 ||
      pthread_create(&server->accept_thread, NULL, accept_loop, server) != 0) {
    int saved = errno;
    if (server->listen_fd >= 0) close(server->listen_fd);
    unlink(server->path);
    rmdir(server->directory);
    free(server);
    errno = saved;
    return NULL;
  }
  return server;
}

const char* lean_echo_server_path(const lean_echo_server* server) {
  return server->path;
}

void lean_echo_server_stop(lean_echo_server* server) {
  if (!server) return;
  /* shutdown wakes the accept; the descriptor is closed once no thread can name it. */
  shutdown(server->listen_fd, SHUT_RDWR);
  pthread_join(server->accept_thread, NULL);
  close(server->listen_fd);
  for (connection* c = server->connections; c;) {
    connection* next = c->next;
    shutdown(c->fd, SHUT_RDWR);
    pthread_join(c->thread, NULL);
    close(c->fd);
    free(c);
    c = next;
  }
  pthread_mutex_destroy(&server->mutex);
  unlink(server->path);
  rmdir(server->directory);
  free(server);
}

/* ---- client ---- */

/* Releases the client threads at once, or tells them to leave when not all could start. */
typedef struct {
  pthread_mutex_t mutex;
  pthread_cond_t cond;
  int state; /* 0 wait, 1 go, 2 leave */
  uint64_t warm_end;
  uint64_t end;
} start_gate;

typedef struct {
  int fd;
  const uint8_t* body;
  size_t body_size;
  start_gate* gate;
  uint64_t* latencies;
  size_t count;
  size_t capacity;
  uint64_t failures;
  uint64_t finished;
} worker;

static void* client(void* argument) {
  worker* w = argument;
  start_gate* gate = w->gate;
  pthread_mutex_lock(&gate->mutex);
  while (gate->state == 0) pthread_cond_wait(&gate->cond, &gate->mutex);
  int state = gate->state;
  uint64_t warm_end = gate->warm_end;
  uint64_t end = gate->end;
  pthread_mutex_unlock(&gate->mutex);
  uint8_t* frame = malloc(kHeader + w->body_size);
  uint8_t* buf = malloc(kHeader + kMaxBody);
  if (state != 1 || !frame || !buf) {
    w->failures += state == 1;
    goto out;
  }
  put_u32(frame, (uint32_t)w->body_size);
  put_u32(frame + 4, kFlagWantsReply);
  memcpy(frame + kHeader, w->body, w->body_size);
  for (uint64_t id = 1;; ++id) {
    put_u32(frame + 8, (uint32_t)(id >> 32));
    put_u32(frame + 12, (uint32_t)id);
    uint64_t sent = now_ns();
    if (sent >= end) break;
    if (write_all(w->fd, frame, kHeader + w->body_size) != 0 || read_frame(w->fd, buf) == 0 ||
        get_u32(buf + 12) != (uint32_t)id || !(get_u32(buf + 4) & kFlagReply)) {
      w->failures++;
      break;
    }
    uint64_t received = now_ns();
    if (sent < warm_end) continue;
    if (w->count == w->capacity) {
      size_t capacity = w->capacity ? w->capacity * 2 : 1u << 16;
      uint64_t* grown = realloc(w->latencies, capacity * sizeof *grown);
      if (!grown) {
        w->failures++;
        break;
      }
      w->latencies = grown;
      w->capacity = capacity;
    }
    w->latencies[w->count++] = received - sent;
  }
out:
  w->finished = now_ns();
  free(frame);
  free(buf);
  return NULL;
}

static int connect_unix(const char* path) {
  struct sockaddr_un address = {.sun_family = AF_UNIX};
  if (strlen(path) >= sizeof address.sun_path) {
    errno = ENAMETOOLONG;
    return -1;
  }
  memcpy(address.sun_path, path, strlen(path));
  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd >= 0 && connect(fd, (const struct sockaddr*)&address, sizeof address) != 0) {
    int saved = errno;
    close(fd);
    errno = saved;
    return -1;
  }
  return fd;
}

int lean_echo_run(const char* path, unsigned connections, double warmup, double duration,
                  const uint8_t* body, size_t body_size, lean_echo_result* result) {
  memset(result, 0, sizeof *result);
  if (connections == 0 || connections > 4096 || body_size > kMaxBody) {
    errno = EINVAL;
    return -1;
  }
  worker* workers = calloc(connections, sizeof *workers);
  pthread_t* threads = calloc(connections, sizeof *threads);
  start_gate gate = {PTHREAD_MUTEX_INITIALIZER, PTHREAD_COND_INITIALIZER, 0, 0, 0};
  unsigned opened = 0;
  unsigned started = 0;
  int status = 0;
  if (!workers || !threads) {
    status = -1;
    goto out;
  }
  for (; opened < connections; ++opened) {
    workers[opened].fd = connect_unix(path);
    if (workers[opened].fd < 0) {
      status = -1;
      goto out;
    }
  }
  for (; started < connections; ++started) {
    worker* w = &workers[started];
    w->body = body;
    w->body_size = body_size;
    w->gate = &gate;
    if (pthread_create(&threads[started], NULL, client, w) != 0) {
      status = -1;
      break;
    }
  }
  /* The clock starts once every thread runs. */
  pthread_mutex_lock(&gate.mutex);
  gate.state = status == 0 ? 1 : 2;
  gate.warm_end = now_ns() + (uint64_t)(warmup * 1e9);
  gate.end = gate.warm_end + (uint64_t)(duration * 1e9);
  pthread_cond_broadcast(&gate.cond);
  pthread_mutex_unlock(&gate.mutex);
  uint64_t last = gate.warm_end;
  for (unsigned i = 0; i < started; ++i) {
    pthread_join(threads[i], NULL);
    result->requests += workers[i].count;
    result->failures += workers[i].failures;
    if (workers[i].finished > last) last = workers[i].finished;
  }
  if (status != 0) goto out;
  result->seconds = (double)(last - gate.warm_end) / 1e9;
  result->latencies_ns = malloc((result->requests ? result->requests : 1) * sizeof(uint64_t));
  if (!result->latencies_ns) {
    status = -1;
    goto out;
  }
  size_t at = 0;
  for (unsigned i = 0; i < started; ++i) {
    if (workers[i].count) {
      memcpy(result->latencies_ns + at, workers[i].latencies, workers[i].count * sizeof(uint64_t));
    }
    at += workers[i].count;
  }
out:;
  int saved = errno;
  for (unsigned i = 0; workers && i < opened; ++i) {
    close(workers[i].fd);
    free(workers[i].latencies);
  }
  free(workers);
  free(threads);
  errno = saved;
  return status;
}

void lean_echo_result_free(lean_echo_result* result) {
  free(result->latencies_ns);
  result->latencies_ns = NULL;
}
