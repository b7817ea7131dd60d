#include "platform/warden/SeccompProgram.h"

#include <linux/audit.h>
#include <linux/seccomp.h>
#include <sys/syscall.h>

#include <algorithm>
#include <cerrno>
#include <cstddef>
#include <cstdint>

namespace warden {
namespace {

struct SystemCall {
  std::string_view name;
  long number;  // -1: not on this machine
};

#define TN_SYSCALL(name) {#name, SYS_##name}
#define TN_MISSING(name) {#name, -1}

// Calls a profile may deny: those that reach beyond the process (debugging
// others, the kernel's configuration, mounts, modules, keys, namespaces).
constexpr SystemCall kTable[] = {
    TN_SYSCALL(ptrace), TN_SYSCALL(process_vm_readv), TN_SYSCALL(process_vm_writev),
    TN_SYSCALL(mount), TN_SYSCALL(umount2), TN_SYSCALL(pivot_root), TN_SYSCALL(chroot),
    TN_SYSCALL(init_module), TN_SYSCALL(finit_module), TN_SYSCALL(delete_module),
    TN_SYSCALL(kexec_load), TN_SYSCALL(reboot), TN_SYSCALL(swapon), TN_SYSCALL(swapoff),
    TN_SYSCALL(acct), TN_SYSCALL(settimeofday), TN_SYSCALL(clock_settime), TN_SYSCALL(adjtimex),
    TN_SYSCALL(sethostname), TN_SYSCALL(setdomainname), TN_SYSCALL(bpf), TN_SYSCALL(perf_event_open),
    TN_SYSCALL(keyctl), TN_SYSCALL(add_key), TN_SYSCALL(request_key), TN_SYSCALL(userfaultfd),
    TN_SYSCALL(unshare), TN_SYSCALL(setns), TN_SYSCALL(personality), TN_SYSCALL(quotactl),
    TN_SYSCALL(open_by_handle_at), TN_SYSCALL(name_to_handle_at), TN_SYSCALL(fanotify_init),
    TN_SYSCALL(lookup_dcookie), TN_SYSCALL(vhangup), TN_SYSCALL(syslog), TN_SYSCALL(io_uring_setup),
    TN_SYSCALL(socket), TN_SYSCALL(connect), TN_SYSCALL(bind), TN_SYSCALL(listen),
#ifdef SYS_iopl
    TN_SYSCALL(iopl), TN_SYSCALL(ioperm),
#else
    TN_MISSING(iopl), TN_MISSING(ioperm),
#endif
#ifdef SYS_kexec_file_load
    TN_SYSCALL(kexec_file_load),
#else
    TN_MISSING(kexec_file_load),
#endif
};

#undef TN_SYSCALL
#undef TN_MISSING

#if defined(__x86_64__)
constexpr uint32_t kArchitecture = AUDIT_ARCH_X86_64;
constexpr uint32_t kOtherAbiBit = 0x40000000;  // __X32_SYSCALL_BIT
#elif defined(__aarch64__)
constexpr uint32_t kArchitecture = AUDIT_ARCH_AARCH64;
constexpr uint32_t kOtherAbiBit = 0;
#else
#error "the seccomp program knows x86-64 and AArch64 only"
#endif

constexpr uint32_t kDenied = SECCOMP_RET_ERRNO | (EPERM & SECCOMP_RET_DATA);

sock_filter statement(uint16_t code, uint32_t k) { return sock_filter{code, 0, 0, k}; }
sock_filter jump(uint16_t code, uint32_t k, uint8_t ifTrue, uint8_t ifFalse) {
  return sock_filter{code, ifTrue, ifFalse, k};
}

}  // namespace

bool isKnownSystemCall(std::string_view name) {
  return std::any_of(std::begin(kTable), std::end(kTable),
                     [&](const SystemCall& call) { return call.name == name; });
}

std::vector<sock_filter> buildSeccompProgram(const std::vector<std::string>& denied) {
  std::vector<uint32_t> numbers;
  for (const SystemCall& call : kTable) {
    if (call.number < 0) continue;
    if (std::find(denied.begin(), denied.end(), call.name) != denied.end()) {
      numbers.push_back(static_cast<uint32_t>(call.number));
    }
  }
  std::vector<sock_filter> program;
  program.push_back(statement(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, arch)));
  program.push_back(jump(BPF_JMP | BPF_JEQ | BPF_K, kArchitecture, 1, 0));
  program.push_back(statement(BPF_RET | BPF_K, SECCOMP_RET_KILL_PROCESS));
  program.push_back(statement(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, nr)));
  if (kOtherAbiBit != 0) {
    program.push_back(jump(BPF_JMP | BPF_JSET | BPF_K, kOtherAbiBit, 0, 1));
    program.push_back(statement(BPF_RET | BPF_K, kDenied));
  }
  for (const uint32_t number : numbers) {
    program.push_back(jump(BPF_JMP | BPF_JEQ | BPF_K, number, 0, 1));
    program.push_back(statement(BPF_RET | BPF_K, kDenied));
  }
  program.push_back(statement(BPF_RET | BPF_K, SECCOMP_RET_ALLOW));
  return program;
}

}  // namespace warden
