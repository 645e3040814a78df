#include "thumbnailer/sandbox.h"

#include <fcntl.h>
#include <linux/landlock.h>
#include <sched.h>
#include <seccomp.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstring>
#include <initializer_list>

namespace yomber::thumbnailer {
namespace {

constexpr rlim_t kOpenFiles = 128;

/// Readable while libraries are made ready: modules, fonts and their settings.
constexpr std::array kReadable = {"/usr", "/lib", "/lib64", "/etc", "/var/cache/fontconfig"};

std::string failure(const char* what) { return std::string(what) + ": " + std::strerror(errno); }

bool limit(__rlimit_resource resource, rlim_t value) {
  const rlimit both{value, value};
  return setrlimit(resource, &both) == 0;
}

/// All of the kernel's first version, which later ones have too.
constexpr std::uint64_t kAllAccess =
    LANDLOCK_ACCESS_FS_EXECUTE | LANDLOCK_ACCESS_FS_WRITE_FILE | LANDLOCK_ACCESS_FS_READ_FILE |
    LANDLOCK_ACCESS_FS_READ_DIR | LANDLOCK_ACCESS_FS_REMOVE_DIR | LANDLOCK_ACCESS_FS_REMOVE_FILE |
    LANDLOCK_ACCESS_FS_MAKE_CHAR | LANDLOCK_ACCESS_FS_MAKE_DIR | LANDLOCK_ACCESS_FS_MAKE_REG |
    LANDLOCK_ACCESS_FS_MAKE_SOCK | LANDLOCK_ACCESS_FS_MAKE_FIFO | LANDLOCK_ACCESS_FS_MAKE_BLOCK |
    LANDLOCK_ACCESS_FS_MAKE_SYM;

bool allowReading(int ruleset, const char* path) {
  const int folder = open(path, O_PATH | O_CLOEXEC);
  if (folder < 0) return errno == ENOENT;
  landlock_path_beneath_attr rule{};
  rule.allowed_access = LANDLOCK_ACCESS_FS_READ_FILE | LANDLOCK_ACCESS_FS_READ_DIR;
  rule.parent_fd = folder;
  const bool isAdded =
      syscall(SYS_landlock_add_rule, ruleset, LANDLOCK_RULE_PATH_BENEATH, &rule, 0) == 0;
  close(folder);
  return isAdded;
}

/// True also on a kernel without it: the doors are closed by other means later.
bool restrictPaths() {
  landlock_ruleset_attr attributes{};
  attributes.handled_access_fs = kAllAccess;
  const int ruleset = static_cast<int>(
      syscall(SYS_landlock_create_ruleset, &attributes, sizeof attributes.handled_access_fs, 0));
  if (ruleset < 0) return errno == ENOSYS || errno == EOPNOTSUPP;
  bool isDone = true;
  for (const char* path : kReadable) isDone = isDone && allowReading(ruleset, path);
  isDone = isDone && syscall(SYS_landlock_restrict_self, ruleset, 0) == 0;
  close(ruleset);
  return isDone;
}

/// A filter while it is put together.
class Filter {
 public:
  // What is not named fails, as if it were forbidden to this user.
  Filter() : context_(seccomp_init(SCMP_ACT_ERRNO(EACCES))) {}
  Filter(const Filter&) = delete;
  Filter& operator=(const Filter&) = delete;
  ~Filter() {
    if (context_ != nullptr) seccomp_release(context_);
  }

  void add(std::uint32_t action, int call) {
    isSound_ = isSound_ && context_ != nullptr && seccomp_rule_add(context_, action, call, 0) == 0;
  }
  void allowIf(int call, const scmp_arg_cmp& condition) {
    isSound_ = isSound_ && context_ != nullptr &&
               seccomp_rule_add_array(context_, SCMP_ACT_ALLOW, call, 1, &condition) == 0;
  }
  /// For all threads that there are.
  [[nodiscard]] bool load() {
    return isSound_ && seccomp_attr_set(context_, SCMP_FLTATR_CTL_TSYNC, 1) == 0 &&
           seccomp_load(context_) == 0;
  }

 private:
  scmp_filter_ctx context_;
  bool isSound_ = true;
};

scmp_arg_cmp argument(unsigned number, scmp_compare comparison, scmp_datum_t first,
                      scmp_datum_t second = 0) {
  return {number, comparison, first, second};
}

void allowWork(Filter& filter) {
  for (const int call : {SCMP_SYS(read),
                         SCMP_SYS(readv),
                         SCMP_SYS(pread64),
                         SCMP_SYS(preadv),
                         SCMP_SYS(write),
                         SCMP_SYS(writev),
                         SCMP_SYS(pwrite64),
                         SCMP_SYS(lseek),
                         SCMP_SYS(fstat),
                         SCMP_SYS(close),
                         SCMP_SYS(dup),
                         SCMP_SYS(ftruncate),
                         SCMP_SYS(mmap),
                         SCMP_SYS(munmap),
                         SCMP_SYS(mprotect),
                         SCMP_SYS(mremap),
                         SCMP_SYS(madvise),
                         SCMP_SYS(brk),
                         SCMP_SYS(futex),
                         SCMP_SYS(recvmsg),
                         SCMP_SYS(sendmsg),
                         SCMP_SYS(sendto),
                         SCMP_SYS(poll),
                         SCMP_SYS(ppoll),
                         SCMP_SYS(getrusage),
                         SCMP_SYS(clock_gettime),
                         SCMP_SYS(clock_getres),
                         SCMP_SYS(clock_nanosleep),
                         SCMP_SYS(nanosleep),
                         SCMP_SYS(gettimeofday),
                         SCMP_SYS(time),
                         SCMP_SYS(sched_yield),
                         SCMP_SYS(sched_getaffinity),
                         SCMP_SYS(rt_sigaction),
                         SCMP_SYS(rt_sigprocmask),
                         SCMP_SYS(rt_sigreturn),
                         SCMP_SYS(sigaltstack),
                         SCMP_SYS(exit),
                         SCMP_SYS(exit_group),
                         SCMP_SYS(getpid),
                         SCMP_SYS(gettid),
                         SCMP_SYS(set_robust_list),
                         SCMP_SYS(rseq),
                         SCMP_SYS(getrandom),
                         SCMP_SYS(sysinfo),
                         SCMP_SYS(uname),
                         SCMP_SYS(getcpu),
                         SCMP_SYS(restart_syscall),
                         SCMP_SYS(set_tid_address),
                         SCMP_SYS(membarrier)})
    filter.add(SCMP_ACT_ALLOW, call);
  const auto own = static_cast<scmp_datum_t>(getpid());
  filter.allowIf(SCMP_SYS(tgkill), argument(0, SCMP_CMP_EQ, own));
  filter.allowIf(SCMP_SYS(prlimit64), argument(0, SCMP_CMP_EQ, 0));
  filter.allowIf(SCMP_SYS(prctl), argument(0, SCMP_CMP_EQ, PR_SET_NAME));
  // Others could have the kernel send signals to any process of this user.
  for (const int command : {F_GETFD, F_SETFD, F_GETFL, F_DUPFD_CLOEXEC})
    filter.allowIf(SCMP_SYS(fcntl), argument(1, SCMP_CMP_EQ, static_cast<scmp_datum_t>(command)));
  // A descriptor's status, in the form that the C library asks for it. A filter does not see names:
  // whether a file is there, its size and dates can be learned this way.
  filter.allowIf(SCMP_SYS(newfstatat),
                 argument(3, SCMP_CMP_MASKED_EQ, AT_EMPTY_PATH, AT_EMPTY_PATH));
  // Threads, but no processes. Of clone3 a filter cannot see what is asked for; without it the C
  // library does with clone.
  filter.allowIf(SCMP_SYS(clone), argument(0, SCMP_CMP_MASKED_EQ, CLONE_THREAD, CLONE_THREAD));
  filter.add(SCMP_ACT_ERRNO(ENOSYS), SCMP_SYS(clone3));
}

}  // namespace

std::string limitRights(std::uint64_t memory, std::uint64_t fileSize) {
  // What writes too much is told so, and lives.
  if (signal(SIGXFSZ, SIG_IGN) == SIG_ERR) return failure("signals");
  if (!limit(RLIMIT_AS, memory) || !limit(RLIMIT_FSIZE, fileSize) || !limit(RLIMIT_CORE, 0) ||
      !limit(RLIMIT_NOFILE, kOpenFiles))
    return failure("limits");
  if (prctl(PR_SET_DUMPABLE, 0, 0, 0, 0) != 0) return failure("dumps");
  if (prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) != 0) return failure("privileges");
  return restrictPaths() ? std::string() : failure("paths");
}

std::string closeDoors() {
  Filter filter;
  allowWork(filter);
  // Nothing here has a use for these: whoever tries is somebody else.
  for (const int call : {SCMP_SYS(execve), SCMP_SYS(execveat), SCMP_SYS(socket), SCMP_SYS(connect),
                         SCMP_SYS(ptrace), SCMP_SYS(process_vm_writev), SCMP_SYS(bpf)})
    filter.add(SCMP_ACT_KILL_PROCESS, call);
  return filter.load() ? std::string() : failure("system calls");
}

void limitProcessor(std::uint32_t seconds) {
  rusage used{};
  rlimit limits{};
  if (getrusage(RUSAGE_SELF, &used) != 0 || getrlimit(RLIMIT_CPU, &limits) != 0) return;
  const auto sofar = static_cast<rlim_t>(used.ru_utime.tv_sec + used.ru_stime.tv_sec);
  // Only the soft limit can be raised again for the next picture; its signal is not handled.
  limits.rlim_cur = sofar + 1 + seconds;
  (void)setrlimit(RLIMIT_CPU, &limits);
}

}  // namespace yomber::thumbnailer
