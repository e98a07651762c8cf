// How the sandbox is put together.
//
// Four layers, each applied on its own so that a kernel without one still
// gets the others, and each reported in the returned line:
//
// 1. no_new_privs. Nothing this process starts can gain privileges, and it
//    is what lets an unprivileged process install the two filters below.
//
// 2. The address-space limit (RLIMIT_AS), soft and hard, so the process
//    cannot raise it again. A parser fed a hostile size then sees a failed
//    allocation instead of pushing the machine into swap.
//
// 3. Landlock filesystem rules. The rule set handles every filesystem right
//    the kernel's ABI version knows, so whatever is not granted is refused:
//    the policy's read paths get read rights, its write paths get read,
//    write, create, remove, truncate and rename-across-directories ("refer")
//    rights, and a fixed list of system paths keeps a running process
//    working (dynamic libraries and iconv modules loaded late, locale, time
//    zone and ICU data, /proc/self for glibc and sanitizers, the CPU list
//    behind sysconf, /dev/null and /dev/urandom). Nothing is granted execute
//    (mapping a library needs only read) nor the right to make devices,
//    fifos, sockets or symbolic links. On ABI 4 and later TCP bind and connect
//    are handled with no rule allowing them; on ABI 6 and later the process is
//    also scoped: no abstract unix sockets and no signals out of its domain.
//    Paths that do not exist are left out (system layouts differ); a policy
//    path that is missing is counted in the report. The kernel reads the
//    attribute struct in its newest layout; older kernels accept it because
//    the fields they do not know are zero.
//
// 4. A seccomp filter (libseccomp) that allows by default and refuses a list
//    of calls with EPERM: the ones that reach out (sockets, except a
//    socketpair, which only connects the process to itself), run programs,
//    touch other processes, or expose large kernel surfaces. Two need care:
//    clone is refused only when it asks for a new namespace (its flags are
//    the first argument), and clone3, whose flags sit behind a pointer the
//    filter cannot read, fails with ENOSYS so that glibc falls back to clone.
//    The filter is synchronised to every thread that already exists.
//    Non-native system-call ABIs (32-bit entry points) are killed by
//    libseccomp's default, so they cannot be used to step around the list.
#include "platform/Sandbox.h"

#include <fcntl.h>
#include <linux/landlock.h>
#include <sched.h>
#include <seccomp.h>
#include <sys/ioctl.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <string_view>

#include <fmt/format.h>

namespace platform {
namespace {

std::string errorText(int err) {
  char buffer[256];
  return strerror_r(err, buffer, sizeof buffer);
}

// A descriptor closed when it goes out of scope.
class UniqueFd {
 public:
  explicit UniqueFd(int fd) : fd_(fd) {}
  UniqueFd(const UniqueFd&) = delete;
  UniqueFd& operator=(const UniqueFd&) = delete;
  ~UniqueFd() {
    if (fd_ >= 0) ::close(fd_);
  }
  int get() const { return fd_; }

 private:
  int fd_;
};

// --- Landlock ---------------------------------------------------------------

// Rights that the installed kernel headers may be too old to name, by the ABI
// version that introduced them.
constexpr std::uint64_t kFsTruncate = 1ULL << 14;  // 3
constexpr std::uint64_t kFsIoctlDev = 1ULL << 15;  // 5
constexpr std::uint64_t kNetBindTcp = 1ULL << 0;   // 4
constexpr std::uint64_t kNetConnectTcp = 1ULL << 1;
constexpr std::uint64_t kScopeAbstractUnixSocket = 1ULL << 0;  // 6
constexpr std::uint64_t kScopeSignal = 1ULL << 1;

struct RulesetAttr {
  std::uint64_t handledAccessFs = 0;
  std::uint64_t handledAccessNet = 0;
  std::uint64_t scoped = 0;
};

constexpr std::uint64_t kReadFile = LANDLOCK_ACCESS_FS_READ_FILE;
constexpr std::uint64_t kReadTree = kReadFile | LANDLOCK_ACCESS_FS_READ_DIR;
constexpr std::uint64_t kWriteTree =
    kReadTree | LANDLOCK_ACCESS_FS_WRITE_FILE | LANDLOCK_ACCESS_FS_REMOVE_FILE |
    LANDLOCK_ACCESS_FS_REMOVE_DIR | LANDLOCK_ACCESS_FS_MAKE_REG | LANDLOCK_ACCESS_FS_MAKE_DIR |
    LANDLOCK_ACCESS_FS_REFER | kFsTruncate;
// The only rights the kernel accepts on a rule for something not a directory.
constexpr std::uint64_t kFileRights = LANDLOCK_ACCESS_FS_EXECUTE | LANDLOCK_ACCESS_FS_WRITE_FILE |
                                      LANDLOCK_ACCESS_FS_READ_FILE | kFsTruncate | kFsIoctlDev;

std::uint64_t handledFsRights(int abi) {
  std::uint64_t rights = (LANDLOCK_ACCESS_FS_MAKE_SYM << 1) - 1;  // version 1
  if (abi >= 2) rights |= LANDLOCK_ACCESS_FS_REFER;
  if (abi >= 3) rights |= kFsTruncate;
  if (abi >= 5) rights |= kFsIoctlDev;
  return rights;
}

struct SystemPath {
  const char* path;
  std::uint64_t rights;
};

// What any process of ours needs to keep working once confined.
constexpr SystemPath kSystemPaths[] = {
    {"/usr/lib", kReadTree},
    {"/lib", kReadTree},
    {"/lib64", kReadTree},
    {"/usr/lib64", kReadTree},
    {"/usr/local/lib", kReadTree},
    {"/etc/ld.so.cache", kReadFile},
    {"/etc/localtime", kReadFile},
    {"/usr/share/zoneinfo", kReadTree},
    {"/usr/share/locale", kReadTree},
    {"/usr/share/icu", kReadTree},
    {"/proc/self", kReadTree},
    {"/sys/devices/system/cpu", kReadTree},
    {"/dev/null", kReadFile | LANDLOCK_ACCESS_FS_WRITE_FILE},
    {"/dev/urandom", kReadFile},
};

// Adds a rule granting `rights` below `path`; false when the path does not
// exist or cannot be opened, which leaves it out.
bool addPathRule(int rulesetFd, const std::string& path, std::uint64_t rights,
                 std::uint64_t handled) {
  UniqueFd fd(::open(path.c_str(), O_PATH | O_CLOEXEC));
  if (fd.get() < 0) return false;
  struct stat st {};
  if (::fstat(fd.get(), &st) != 0) return false;
  if (!S_ISDIR(st.st_mode)) rights &= kFileRights;
  landlock_path_beneath_attr rule{};
  rule.allowed_access = rights & handled;
  rule.parent_fd = fd.get();
  if (rule.allowed_access == 0) return true;
  return ::syscall(SYS_landlock_add_rule, rulesetFd, LANDLOCK_RULE_PATH_BENEATH, &rule, 0) == 0;
}

std::string applyLandlock(const SandboxPolicy& policy) {
  long abi = ::syscall(SYS_landlock_create_ruleset, nullptr, 0, LANDLOCK_CREATE_RULESET_VERSION);
  if (abi < 0) {
    if (errno == ENOSYS) return "landlock unavailable (kernel lacks it)";
    if (errno == EOPNOTSUPP) return "landlock unavailable (disabled at boot)";
    return fmt::format("landlock unavailable ({})", errorText(errno));
  }
  RulesetAttr attr;
  attr.handledAccessFs = handledFsRights(static_cast<int>(abi));
  if (abi >= 4) attr.handledAccessNet = kNetBindTcp | kNetConnectTcp;
  if (abi >= 6) attr.scoped = kScopeAbstractUnixSocket | kScopeSignal;
  UniqueFd ruleset(static_cast<int>(::syscall(SYS_landlock_create_ruleset, &attr, sizeof attr, 0)));
  if (ruleset.get() < 0) return fmt::format("landlock failed (ruleset: {})", errorText(errno));

  for (const SystemPath& system : kSystemPaths) {
    addPathRule(ruleset.get(), system.path, system.rights, attr.handledAccessFs);
  }
  int missing = 0;
  for (const std::string& path : policy.readPaths) {
    if (!addPathRule(ruleset.get(), path, kReadTree, attr.handledAccessFs)) ++missing;
  }
  for (const std::string& path : policy.writePaths) {
    if (!addPathRule(ruleset.get(), path, kWriteTree, attr.handledAccessFs)) ++missing;
  }
  if (::syscall(SYS_landlock_restrict_self, ruleset.get(), 0) != 0) {
    return fmt::format("landlock failed (restrict: {})", errorText(errno));
  }
  std::string line = fmt::format("landlock ABI {}", abi);
  if (missing > 0) {
    line += fmt::format(" ({} policy path{} missing)", missing, missing == 1 ? "" : "s");
  }
  return line;
}

// --- seccomp ----------------------------------------------------------------

// Refused outright with EPERM. Names this architecture lacks are skipped.
constexpr const char* kRefusedCalls[] = {
    // New connections; the descriptors the process already has keep working.
    "socket", "connect", "bind", "listen", "accept", "accept4",
    // Running programs.
    "execve", "execveat",
    // Other processes' memory.
    "ptrace", "process_vm_readv", "process_vm_writev",
    // The filesystem tree.
    "mount", "umount", "umount2", "pivot_root", "chroot", "fsopen", "fsconfig", "fsmount", "fspick",
    "move_mount", "open_tree", "mount_setattr",
    // Kernel surfaces a parser never needs.
    "keyctl", "add_key", "request_key", "bpf", "perf_event_open", "kexec_load", "kexec_file_load",
    "init_module", "finit_module", "delete_module", "unshare", "setns", "personality",
    "userfaultfd", "io_uring_setup", "io_uring_enter", "io_uring_register"};

// The clone flags that create namespaces (CLONE_NEWTIME shares its bit with
// the exit signal in clone's flags, and clone cannot ask for it).
constexpr std::uint64_t kNamespaceFlags[] = {CLONE_NEWNS,  CLONE_NEWCGROUP, CLONE_NEWUTS,
                                             CLONE_NEWIPC, CLONE_NEWUSER,   CLONE_NEWPID,
                                             CLONE_NEWNET};

std::string applySeccomp() {
  scmp_filter_ctx ctx = seccomp_init(SCMP_ACT_ALLOW);
  if (ctx == nullptr) return "seccomp failed (cannot create a filter)";
  struct Release {
    scmp_filter_ctx ctx;
    ~Release() { seccomp_release(ctx); }
  } release{ctx};

  int refused = 0;
  int rc = seccomp_attr_set(ctx, SCMP_FLTATR_CTL_TSYNC, 1);
  if (rc != 0) return fmt::format("seccomp failed (thread sync: {})", errorText(-rc));
  for (const char* name : kRefusedCalls) {
    int number = seccomp_syscall_resolve_name(name);
    if (number < 0) continue;  // not a system call here
    rc = seccomp_rule_add(ctx, SCMP_ACT_ERRNO(EPERM), number, 0);
    if (rc != 0) return fmt::format("seccomp failed ({}: {})", name, errorText(-rc));
    ++refused;
  }
#if !defined(__s390__) && !defined(__s390x__)  // those put the flags second
  for (std::uint64_t flag : kNamespaceFlags) {
    rc = seccomp_rule_add(ctx, SCMP_ACT_ERRNO(EPERM), SCMP_SYS(clone), 1,
                          SCMP_A0(SCMP_CMP_MASKED_EQ, flag, flag));
    if (rc != 0) return fmt::format("seccomp failed (clone: {})", errorText(-rc));
  }
  ++refused;
#endif
  if (int clone3 = seccomp_syscall_resolve_name("clone3"); clone3 >= 0) {
    rc = seccomp_rule_add(ctx, SCMP_ACT_ERRNO(ENOSYS), clone3, 0);
    if (rc != 0) return fmt::format("seccomp failed (clone3: {})", errorText(-rc));
    ++refused;
  }
  // Pushing input into the controlling terminal would reach past every
  // other layer. The kernel reads the request as 32 bits, so only those are
  // compared.
  rc = seccomp_rule_add(ctx, SCMP_ACT_ERRNO(EPERM), SCMP_SYS(ioctl), 1,
                        SCMP_A1(SCMP_CMP_MASKED_EQ, 0xFFFFFFFFu, TIOCSTI));
  if (rc != 0) return fmt::format("seccomp failed (ioctl: {})", errorText(-rc));
  ++refused;

  rc = seccomp_load(ctx);
  if (rc != 0) return fmt::format("seccomp failed (load: {})", errorText(-rc));
  return fmt::format("seccomp ({} calls refused)", refused);
}

// --- the rest -------------------------------------------------------------

std::string formatBytes(std::uint64_t bytes) {
  constexpr std::uint64_t kMiB = std::uint64_t{1} << 20;
  if (bytes % kMiB == 0) return fmt::format("{} MiB", bytes / kMiB);
  return fmt::format("{} bytes", bytes);
}

std::string applyAddressSpaceLimit(std::uint64_t limit) {
  if (limit == 0) return "address space unlimited";
  rlimit current{};
  if (::getrlimit(RLIMIT_AS, &current) != 0) {
    return fmt::format("address space limit failed ({})", errorText(errno));
  }
  rlim_t value = static_cast<rlim_t>(limit);
  if (current.rlim_max != RLIM_INFINITY && current.rlim_max < value) value = current.rlim_max;
  rlimit wanted{value, value};
  if (::setrlimit(RLIMIT_AS, &wanted) != 0) {
    return fmt::format("address space limit failed ({})", errorText(errno));
  }
  return "address space " + formatBytes(value);
}

}  // namespace

int landlockABI() {
  long abi = ::syscall(SYS_landlock_create_ruleset, nullptr, 0, LANDLOCK_CREATE_RULESET_VERSION);
  return abi < 0 ? 0 : static_cast<int>(abi);
}

std::string applySandbox(const SandboxPolicy& policy) {
  std::string line = "sandbox: ";
  if (::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) == 0) {
    line += "no_new_privs";
  } else {
    line += fmt::format("no_new_privs failed ({})", errorText(errno));
  }
  line += ", " + applyAddressSpaceLimit(policy.addressSpaceLimitBytes);
  line += ", " + applyLandlock(policy);
  line += ", " + applySeccomp();
  return line;
}

}  // namespace platform
