// zarn, the sync daemon: keeps the drive's tree and serves it to the processes of this user.
#include <fcntl.h>
#include <malloc.h>
#include <sys/file.h>
#include <unistd.h>

#include <array>
#include <charconv>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "platform/foundation/drive_paths.h"
#include "platform/foundation/duration_setting.h"
#include "platform/foundation/ending_signals.h"
#include "platform/foundation/log.h"
#include "platform/foundation/log_sinks.h"
#include "platform/foundation/shared_heaps.h"
#include "platform/ipc/listener.h"
#include "platform/ipc/unix_socket.h"
#include "zarn/daemon_server.h"
#include "zarn/drive.h"

namespace yomber {
namespace {

constexpr int kUsage = 64;
constexpr int kCannotStart = 1;
constexpr int kAlreadyRunning = 73;
constexpr const char* kUsageText =
    "usage: zarn [--home DIR] [--watch-limit N]\n"
    "  --home DIR       the drive's home (default: $YOMBER_HOME, else ~/.local/share/yomber)\n"
    "  --watch-limit N  watch at most N folders; the others are scanned from time to time\n";

struct Arguments {
  std::optional<std::string> home;
  Drive::Options drive;
  bool wantsHelp = false;
};

bool parseNumber(std::string_view text, std::size_t& number) {
  const auto [end, failure] = std::from_chars(text.data(), text.data() + text.size(), number);
  return failure == std::errc() && end == text.data() + text.size();
}

/// Nothing when they make no sense.
std::optional<Arguments> parse(const std::vector<std::string>& given) {
  Arguments arguments;
  for (std::size_t i = 1; i < given.size(); ++i) {
    const bool hasValue = i + 1 < given.size();
    if (given[i] == "--help") {
      arguments.wantsHelp = true;
    } else if (given[i] == "--home" && hasValue && !given[i + 1].empty()) {
      arguments.home = given[++i];
    } else if (given[i] == "--watch-limit" && hasValue) {
      if (!parseNumber(given[++i], arguments.drive.observer.watchLimit)) return std::nullopt;
    } else {
      return std::nullopt;
    }
  }
  return arguments;
}

int fail(int code, const std::string& text) {
  (void)std::fprintf(stderr, "zarn: %s\n", text.c_str());
  return code;
}

/// The same once the log is open.
int failLogged(int code, const NSErrorRef& error) {
  log_error(defaultLog(), "[ERROR] cannot start: %@", error);
  return fail(code, error->localizedDescription());
}

/// Large blocks are given back as soon as they are free, however many there were.
void giveBackLargeBlocks() {
  constexpr int kLargeBlock = 128 * 1024;
  (void)mallopt(M_MMAP_THRESHOLD, kLargeBlock);
}

/// Standard input belongs to whoever started us.
void closeStandardInput() {
  const ipc::UniqueFd null(open("/dev/null", O_RDONLY | O_CLOEXEC));
  if (null) (void)dup2(null.get(), STDIN_FILENO);
}

std::string readOwner(int file) {
  std::array<char, 32> text{};
  const ssize_t length = pread(file, text.data(), text.size() - 1, 0);
  std::string owner(text.data(), length > 0 ? static_cast<std::size_t>(length) : 0);
  while (!owner.empty() && owner.back() == '\n') owner.pop_back();
  return owner.empty() ? "of unknown number" : owner;
}

/// The drive is ours for as long as `lock` is open; otherwise the exit code and why.
struct Claim {
  ipc::UniqueFd lock;
  int code = 0;
  std::string failure;
};

Claim claimDrive(const DrivePaths& paths) {
  Claim claim;
  const std::string path = paths.home + "/zarn.lock";
  ipc::UniqueFd file(open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0600));
  if (!file) {
    claim.code = kCannotStart;
    claim.failure = NSError::errorWithErrno(errno, path)->localizedDescription() + ": " + path;
  } else if (flock(file.get(), LOCK_EX | LOCK_NB) != 0) {
    claim.code = kAlreadyRunning;
    claim.failure =
        "the drive at " + paths.home + " is kept by process " + readOwner(file.get()) + " already";
  } else {
    const std::string owner = std::to_string(getpid()) + "\n";
    (void)!ftruncate(file.get(), 0);
    (void)!pwrite(file.get(), owner.data(), owner.size(), 0);
    claim.lock = std::move(file);
  }
  return claim;
}

/// A scan of a large tree cannot be stopped half way, and need not be: what is stored is right at
/// any instant, also when the process just ends.
void endSoonAnyway() {
  constexpr std::chrono::seconds kPatience{3};
  std::thread([kPatience] {
    std::this_thread::sleep_for(kPatience);
    log_default(defaultLog(), "[NOTICE] ending in the middle of a scan");
    _exit(0);
  }).detach();
}

int serve(const std::shared_ptr<Drive>& drive, const sigset_t& endingSignals) {
  NSErrorRef error;
  // First of all, so that clients need not wait for a scan to find us.
  auto listener = ipc::Listener::listen(
      drive->paths.daemonSocket,
      [drive](const ipc::PeerCredentials&) -> capnp::Capability::Client {
        return kj::heap<DaemonServer>(drive);
      },
      &error);
  if (!listener) return failLogged(kCannotStart, error);
  drive->start();
  log_default(defaultLog(), "[NOTICE] serving %@", drive->paths.daemonSocket);
  int signal = 0;
  while (sigwait(&endingSignals, &signal) != 0) {
  }
  log_default(defaultLog(), "[NOTICE] ending on signal %d", signal);
  listener.reset();
  endSoonAnyway();
  drive->stop();
  return 0;
}

int run(const std::vector<std::string>& given) {
  const auto arguments = parse(given);
  if (!arguments || arguments->wantsHelp) {
    (void)std::fputs(kUsageText, arguments ? stdout : stderr);
    return arguments ? 0 : kUsage;
  }
  shareHeaps();
  giveBackLargeBlocks();
  const auto endingSignals = blockEndingSignals();
  closeStandardInput();
  const auto paths =
      arguments->home ? DrivePaths::forHome(*arguments->home) : DrivePaths::forDefaultHome();
  if (const auto error = paths.create()) return fail(kCannotStart, error->localizedDescription());
  const Claim claim = claimDrive(paths);
  if (!claim.lock) return fail(claim.code, claim.failure);
  openLog("zarn", paths);
  Drive::Options options = arguments->drive;
  options.content.uploadPause =
      durationSetting("YOMBER_UPLOAD_PAUSE_MS", options.content.uploadPause, {});
  NSErrorRef error;
  const auto drive = Drive::open(paths, options, &error);
  if (!drive) return failLogged(kCannotStart, error);
  return serve(drive, endingSignals);
}

}  // namespace
}  // namespace yomber

int main(int argc, char** argv) { return yomber::run(std::vector<std::string>(argv, argv + argc)); }
