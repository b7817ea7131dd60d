// A seccomp filter for tests that need a sandboxed process.

#pragma once

#include <linux/filter.h>
#include <linux/seccomp.h>
#include <sys/prctl.h>

namespace tn::test {

// Installs a filter that allows every system call, so that the calling
// process runs under one filter more than its parent. Async-signal-safe, for
// a forked child of a process with threads.
inline bool installAllowAllFilter() {
  sock_filter allowAll[] = {BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW)};
  sock_fprog program{};
  program.len = 1;
  program.filter = allowAll;
  return ::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) == 0 &&
         ::prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, &program, 0, 0) == 0;
}

}  // namespace tn::test
