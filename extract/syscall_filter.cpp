#include "extract/syscall_filter.hpp"

#include <fcntl.h>
#include <linux/capability.h>
#include <seccomp.h>
#include <sched.h>
#include <signal.h>
#include <sys/ioctl.h>
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <termios.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <memory>

#if defined(__SANITIZE_ADDRESS__)
#define ORVANE_FILTER_ASAN 1
#elif defined(__has_feature)
#if __has_feature(address_sanitizer)
#define ORVANE_FILTER_ASAN 1
#endif
#endif
#ifndef ORVANE_FILTER_ASAN
#define ORVANE_FILTER_ASAN 0
#endif

namespace orvane {
namespace extract {
namespace {

// Calls allowed whatever their arguments.
const char* const kAllowed[] = {
    // Reading files and folders.
    "read", "readv", "pread64", "preadv", "preadv2", "lseek", "fstat", "newfstatat", "stat",
    "lstat", "statx", "fstatfs", "statfs", "access", "faccessat", "faccessat2", "readlink",
    "readlinkat", "getdents", "getdents64", "fadvise64", "getcwd", "close", "close_range", "dup",
    "dup2", "dup3", "fcntl", "poll", "ppoll", "select", "pselect6", "pipe", "pipe2",
    "epoll_create1", "epoll_ctl", "epoll_wait", "epoll_pwait", "eventfd2",
    // Writing replies and diagnostics to the descriptors already open. Files are only ever
    // opened for reading (below), so these reach pipes, memory files and the terminal.
    "write", "writev",
    // Files in memory, for members decoded out of archives.
    "memfd_create", "ftruncate",
    // Memory.
    "brk", "mmap", "munmap", "mremap", "mprotect", "madvise", "mincore",
    // Threads and time.
    "futex", "set_robust_list", "get_robust_list", "rseq", "set_tid_address", "sched_yield",
    "sched_getaffinity", "sched_getparam", "sched_getscheduler", "gettid", "getpid", "getppid",
    "getpgrp", "getuid", "geteuid", "getgid", "getegid", "getgroups", "getresuid", "getresgid",
    "uname", "sysinfo", "getrandom", "clock_gettime", "clock_getres", "gettimeofday", "time",
    "nanosleep", "clock_nanosleep", "getitimer", "setitimer", "alarm", "times", "getrusage",
    "getrlimit", "prlimit64", "setrlimit", "getpriority", "prctl", "arch_prctl",
    "rt_sigaction", "rt_sigprocmask", "rt_sigreturn", "rt_sigpending", "rt_sigtimedwait",
    "rt_sigsuspend", "sigaltstack", "restart_syscall", "exit", "exit_group",
    // Converters run as child programs in process groups of their own.
    "execve", "execveat", "vfork", "wait4", "waitid", "setpgid", "getpgid", "umask",
};

// Open flags that write, create or truncate (an unnamed file needs write access, so the access
// mode covers it).
constexpr uint32_t kWritingOpenFlags = O_ACCMODE | O_CREAT | O_TRUNC | O_APPEND;

// Thread and process creation flags that would leave the filter's view: new namespaces.
constexpr unsigned long kNamespaceFlags = CLONE_NEWNS | CLONE_NEWUSER | CLONE_NEWPID |
                                          CLONE_NEWNET | CLONE_NEWIPC | CLONE_NEWUTS |
                                          CLONE_NEWCGROUP;

// A comparison of the low 32 bits of argument `arg` (int arguments, which the C library
// sign-extends).
scmp_arg_cmp Arg32(unsigned arg, scmp_compare op, uint32_t a, uint32_t b = 0) {
  return scmp_arg_cmp{arg, op, a, b};
}

struct Release {
  void operator()(scmp_filter_ctx ctx) const { seccomp_release(ctx); }
};

bool Build(scmp_filter_ctx ctx, std::string* error) {
  auto fail = [&](const char* what, int rc) {
    *error = std::string("cannot add the rule for ") + what + ": " + std::strerror(-rc);
    return false;
  };
  int rc;
  for (const char* name : kAllowed) {
    const int nr = seccomp_syscall_resolve_name(name);
    if (nr == __NR_SCMP_ERROR) continue;  // not a call of this architecture
    if ((rc = seccomp_rule_add(ctx, SCMP_ACT_ALLOW, nr, 0)) != 0) return fail(name, rc);
  }
  // Opening only for reading.
  if ((rc = seccomp_rule_add(ctx, SCMP_ACT_ALLOW, SCMP_SYS(openat), 1,
                             Arg32(2, SCMP_CMP_MASKED_EQ, kWritingOpenFlags, 0))) != 0) {
    return fail("openat", rc);
  }
  if ((rc = seccomp_rule_add(ctx, SCMP_ACT_ALLOW, SCMP_SYS(open), 1,
                             Arg32(1, SCMP_CMP_MASKED_EQ, kWritingOpenFlags, 0))) != 0) {
    return fail("open", rc);
  }
  // Threads and child programs, in this process's namespaces. The C library tries clone3 first
  // and falls back to clone on ENOSYS.
  if ((rc = seccomp_rule_add(ctx, SCMP_ACT_ALLOW, SCMP_SYS(clone), 1,
                             scmp_arg_cmp{0, SCMP_CMP_MASKED_EQ, kNamespaceFlags, 0})) != 0) {
    return fail("clone", rc);
  }
  if ((rc = seccomp_rule_add(ctx, SCMP_ACT_ERRNO(ENOSYS), SCMP_SYS(clone3), 0)) != 0 ||
      (rc = seccomp_rule_add(ctx, SCMP_ACT_ERRNO(ENOSYS), SCMP_SYS(openat2), 0)) != 0) {
    return fail("clone3 and openat2", rc);
  }
  // Signals to itself (abort, raise) and to the process groups of the converters it started:
  // a negative pid, never -1, which means every process.
  const pid_t self = getpid();
  if ((rc = seccomp_rule_add(ctx, SCMP_ACT_ALLOW, SCMP_SYS(tgkill), 1,
                             Arg32(0, SCMP_CMP_EQ, static_cast<uint32_t>(self)))) != 0 ||
      (rc = seccomp_rule_add(ctx, SCMP_ACT_ALLOW, SCMP_SYS(kill), 1,
                             Arg32(0, SCMP_CMP_EQ, static_cast<uint32_t>(self)))) != 0 ||
      (rc = seccomp_rule_add(ctx, SCMP_ACT_ALLOW, SCMP_SYS(kill), 1,
                             Arg32(0, SCMP_CMP_GE, 0x80000000u))) != 0 ||
      (rc = seccomp_rule_add(ctx, SCMP_ACT_ERRNO(EACCES), SCMP_SYS(kill), 1,
                             Arg32(0, SCMP_CMP_EQ, 0xFFFFFFFFu))) != 0) {
    return fail("signals", rc);
  }
  // Terminal queries the libraries make on their standard streams.
  for (const unsigned long request : {static_cast<unsigned long>(TCGETS),
                                      static_cast<unsigned long>(TIOCGWINSZ),
                                      static_cast<unsigned long>(FIONREAD)}) {
    if ((rc = seccomp_rule_add(ctx, SCMP_ACT_ALLOW, SCMP_SYS(ioctl), 1,
                               Arg32(1, SCMP_CMP_EQ, static_cast<uint32_t>(request)))) != 0) {
      return fail("ioctl", rc);
    }
  }
#if ORVANE_FILTER_ASAN
  // The leak checker of sanitizer builds stops the threads at exit by tracing them from a
  // helper thread of its own.
  if ((rc = seccomp_rule_add(ctx, SCMP_ACT_ALLOW, SCMP_SYS(ptrace), 0)) != 0) {
    return fail("ptrace", rc);
  }
#endif
  return true;
}

// Root's powers shrink to reading and searching whatever it is given, for the helper and for
// every program it starts (the bounding set, where the service manager left this process the
// right to change it). Nothing is asked for that the process did not have.
bool KeepOnlyReading(std::string* error) {
  for (int cap = 0; cap <= CAP_LAST_CAP; ++cap) {
    if (cap != CAP_DAC_READ_SEARCH) prctl(PR_CAPBSET_DROP, cap, 0, 0, 0);
  }
  struct __user_cap_header_struct header = {_LINUX_CAPABILITY_VERSION_3, 0};
  struct __user_cap_data_struct data[_LINUX_CAPABILITY_U32S_3] = {};
  if (syscall(SYS_capget, &header, data) != 0) {
    *error = std::string("cannot read the capabilities: ") + std::strerror(errno);
    return false;
  }
  const uint32_t keep = CAP_TO_MASK(CAP_DAC_READ_SEARCH);
  for (int i = 0; i < _LINUX_CAPABILITY_U32S_3; ++i) {
    const uint32_t mask = i == CAP_TO_INDEX(CAP_DAC_READ_SEARCH) ? keep : 0;
    data[i].effective &= mask;
    data[i].permitted &= mask;
    data[i].inheritable = 0;
  }
  if (syscall(SYS_capset, &header, data) != 0) {
    *error = std::string("cannot drop the capabilities: ") + std::strerror(errno);
    return false;
  }
  return true;
}

}  // namespace

bool ConfineExtractionHelper(std::string* error) {
  if (!KeepOnlyReading(error)) return false;
  std::unique_ptr<void, Release> ctx(seccomp_init(SCMP_ACT_ERRNO(EPERM)));
  if (!ctx) {
    *error = "cannot set up the system-call filter";
    return false;
  }
  if (!Build(ctx.get(), error)) return false;
  const int rc = seccomp_load(ctx.get());
  if (rc != 0) {
    *error = std::string("cannot install the system-call filter: ") + std::strerror(-rc);
    return false;
  }
  return true;
}

}  // namespace extract
}  // namespace orvane
