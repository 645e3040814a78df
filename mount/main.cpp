// yomber-mount, the drive as a folder: every application's way in.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <charconv>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <memory>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "mount/content_requests.h"
#include "mount/desktop_thumbnails.h"
#include "mount/file_system.h"
#include "mount/kernel_session.h"
#include "mount/local_space.h"
#include "mount/tree_changes.h"
#include "platform/foundation/data_directories.h"
#include "platform/foundation/descriptor_limit.h"
#include "platform/foundation/drive_paths.h"
#include "platform/foundation/ending_signals.h"
#include "platform/foundation/log.h"
#include "platform/foundation/log_sinks.h"
#include "platform/foundation/shared_heaps.h"
#include "platform/ostrell/constants.h"
#include "platform/ostrell/daemon_connection.h"
#include "platform/ostrell/daemon_question.h"

namespace yomber {
namespace {

constexpr int kUsage = 64;
constexpr int kCannotStart = 1;
constexpr const char* kUsageText =
    "usage: yomber-mount [--home DIR] [--allow-other] [--keep BYTES] [--no-pass-through] FOLDER\n"
    "  --home DIR         the drive's home (default: $YOMBER_HOME, else ~/.local/share/yomber)\n"
    "  --allow-other      other users may use the mount (always so for root's)\n"
    "  --keep BYTES       give content up again that takes more, the longest unused first\n"
    "  --no-pass-through  the kernel reads no file by itself\n";

struct Arguments {
  std::optional<std::string> home;
  std::string mountPoint;
  bool allowOthers = false;
  std::optional<std::uint64_t> keep;  ///< bytes
  bool mayPassThrough = true;
  bool wantsHelp = false;
};

std::optional<std::uint64_t> bytesFrom(const std::string& text) {
  std::uint64_t bytes = 0;
  const char* const last = text.data() + text.size();
  const auto [end, failure] = std::from_chars(text.data(), last, bytes);
  if (failure != std::errc() || end != last) return std::nullopt;
  return bytes;
}

/// Nothing when they make no sense.
std::optional<Arguments> parse(const std::vector<std::string>& given) {
  Arguments arguments;
  for (std::size_t i = 1; i < given.size(); ++i) {
    if (given[i] == "--help") {
      arguments.wantsHelp = true;
    } else if (given[i] == "--home" && i + 1 < given.size()) {
      arguments.home = given[++i];
    } else if (given[i] == "--allow-other") {
      arguments.allowOthers = true;
    } else if (given[i] == "--keep" && i + 1 < given.size()) {
      arguments.keep = bytesFrom(given[++i]);
      if (!arguments.keep) return std::nullopt;
    } else if (given[i] == "--no-pass-through") {
      arguments.mayPassThrough = false;
    } else if (given[i].starts_with("-") || !arguments.mountPoint.empty()) {
      return std::nullopt;
    } else {
      arguments.mountPoint = given[i];
    }
  }
  if (arguments.mountPoint.empty() && !arguments.wantsHelp) return std::nullopt;
  return arguments;
}

int fail(const std::string& text) {
  (void)std::fprintf(stderr, "yomber-mount: %s\n", text.c_str());
  return kCannotStart;
}

bool isBelow(const std::string& path, const std::string& folder) {
  return path == folder || path.starts_with(folder + "/");
}

/// The mount point with symbolic links resolved. One that a dead mount occupies cannot be looked
/// at; the folder that it is in can.
std::string resolved(const std::string& path) {
  char* const real = realpath(path.c_str(), nullptr);
  if (real == nullptr) return path;
  std::string result(real);
  std::free(real);
  return result;
}

/// Files that are still open keep a mount that was taken away in use. What was written to them is
/// in the tree; there is nothing to wait for.
void endSoonAnyway() {
  constexpr std::chrono::milliseconds kPatience{500};
  std::thread([kPatience] {
    std::this_thread::sleep_for(kPatience);
    _exit(0);
  }).detach();
}

int serve(const DrivePaths& paths, const Arguments& arguments, const sigset_t& endingSignals) {
  NSErrorRef error;
  const std::string root = paths.tree + "/" + QSUbiquitousDefaultContainerID + "/Documents";
  auto places = Places::open(root, paths.tree + "/.Trash", &error);
  if (!places) return fail("there is no drive at " + paths.home + "; start it with 'yomber up'");
  // A daemon that is stuck is noticed after two such limits.
  auto watch = DownloadWatch::create(paths.daemonSocket, 2 * daemonTimeLimit());
  auto requests = ContentRequests::create(paths.controlSocket, std::move(watch));
  FileSystem files(std::move(places), requests);
  const bool isRoot = geteuid() == 0;
  const KernelSession::Options options{.mountPoint = resolved(arguments.mountPoint),
                                       .allowOthers = arguments.allowOthers || isRoot,
                                       .isPrivileged = isRoot,
                                       .mayPassThrough = arguments.mayPassThrough};
  if (isBelow(options.mountPoint, paths.home) || isBelow(paths.home, options.mountPoint)) {
    return fail("the drive at " + paths.home + " cannot be mounted inside or around itself");
  }
  const auto session = KernelSession::mount(files, options, &error);
  if (!session) return fail(error->localizedDescription());
  files.setSession(session.get());
  std::optional<LocalSpace> space;
  if (arguments.keep) {
    const auto giveUp = [requests](const std::string& location) {
      return requests->stopProviding(location);
    };
    files.setLocalSpace(&space.emplace(files.places(), giveUp, *arguments.keep));
  }
  std::optional<DesktopThumbnails> thumbnails;
  // Without a home of its user there is no desktop.
  if (!cacheDirectory().empty())
    files.setThumbnails(&thumbnails.emplace(files.places(), options.mountPoint, paths.controlSocket,
                                            ThumbnailCache::system()));
  const TreeChanges changes(paths.daemonSocket, files, *session);
  std::thread([&session, endingSignals] {
    int signal = 0;
    while (sigwait(&endingSignals, &signal) != 0) {
    }
    session->end();
    endSoonAnyway();
  }).detach();
  log_default(defaultLog(), "[NOTICE] mounted at %@", options.mountPoint);
  const int failure = session->run();
  if (failure != 0) log_error(defaultLog(), "[ERROR] the mount ended: errno %d", failure);
  log_default(defaultLog(), "[NOTICE] not mounted any more");
  // Others may still be about to answer requests that nobody waits for.
  _exit(failure == 0 ? 0 : kCannotStart);
}

int run(const std::vector<std::string>& given) {
  const auto arguments = parse(given);
  if (!arguments || arguments->wantsHelp) {
    (void)std::fputs(kUsageText, arguments ? stdout : stderr);
    return arguments ? 0 : kUsage;
  }
  const auto endingSignals = blockEndingSignals();
  umask(0);
  raiseDescriptorLimit();  // every file that an application has open is one of ours too
  shareHeaps();
  const auto paths =
      arguments->home ? DrivePaths::forHome(*arguments->home) : DrivePaths::forDefaultHome();
  if (const auto error = paths.check()) return fail(error->localizedDescription());
  QSDaemonConnection::setDefaultHome(paths.home);
  openLog("yomber-mount", paths);
  return serve(paths, *arguments, endingSignals);
}

}  // namespace
}  // namespace yomber

int main(int argc, char** argv) { return yomber::run(std::vector<std::string>(argv, argv + argc)); }
