// ek-sandbox-exec PROGRAM ARGS...: runs PROGRAM confined by a seccomp filter that allows
// everything. The filter changes nothing the program can do, but it marks the process as
// sandboxed: its Seccomp_filters count now exceeds that of process 1.

#include <errno.h>
#include <linux/filter.h>
#include <linux/seccomp.h>
#include <stddef.h>
#include <stdio.h>
#include <string.h>
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace {

int installAllowAllFilter() {
  struct sock_filter allow[] = {BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW)};
  struct sock_fprog program = {static_cast<unsigned short>(sizeof allow / sizeof allow[0]), allow};
  // Without no_new_privs an unprivileged process may not install a filter; with it, a
  // set-user-ID program run under the filter cannot gain privileges either.
  if (prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) != 0) return -1;
#ifdef SYS_seccomp
  if (syscall(SYS_seccomp, SECCOMP_SET_MODE_FILTER, 0, &program) == 0) return 0;
  if (errno != ENOSYS) return -1;
#endif
  return prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, &program, 0, 0);
}

}  // namespace

int main(int argc, char** argv) {
  if (argc < 2 || argv[1][0] == '\0') {
    fprintf(stderr, "usage: ek-sandbox-exec PROGRAM [ARGS...]\n");
    return 2;
  }
  if (installAllowAllFilter() != 0) {
    fprintf(stderr, "ek-sandbox-exec: installing the seccomp filter: %s\n", strerror(errno));
    return 126;
  }
  execvp(argv[1], argv + 1);
  fprintf(stderr, "ek-sandbox-exec: %s: %s\n", argv[1], strerror(errno));
  return 127;
}
