#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <filesystem>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "fileproviderd/control_server.h"
#include "fileproviderd/host.h"
#include "platform/fileprovider/wire_item.h"
#include "platform/foundation/descriptor_limit.h"
#include "platform/foundation/drive_paths.h"
#include "platform/foundation/ending_signals.h"
#include "platform/foundation/log.h"
#include "platform/foundation/log_sinks.h"
#include "platform/ipc/event_loop.h"
#include "platform/ipc/listener.h"
#include "platform/ipc/unix_socket.h"

namespace yomber {
namespace {

constexpr int kUsage = 64;
constexpr int kCannotStart = 1;
constexpr int kAlreadyRunning = 75;

struct Arguments {
  std::optional<std::string> home;
  std::string extension;
};

std::string besideThisProgram(const char* name) {
  std::error_code error;
  const auto self = std::filesystem::read_symlink("/proc/self/exe", error);
  return error ? std::string(name) : (self.parent_path() / name).string();
}

/// Nothing when they make no sense.
std::optional<Arguments> parse(const std::vector<std::string>& given) {
  Arguments arguments;
  arguments.extension = besideThisProgram("qs-fileprovider");
  for (std::size_t i = 1; i < given.size(); i += 2) {
    if (i + 1 == given.size()) return std::nullopt;
    if (given[i] == "--home") {
      arguments.home = given[i + 1];
    } else if (given[i] == "--extension") {
      arguments.extension = given[i + 1];
    } else {
      return std::nullopt;
    }
  }
  return arguments;
}

int fail(int code, const std::string& text) {
  (void)std::fprintf(stderr, "fileproviderd: %s\n", text.c_str());
  return code;
}

/// Held for as long as this process lives; empty with an errno value when another one holds it.
ipc::UniqueFd lockDrive(const std::string& path) {
  ipc::UniqueFd file(open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, S_IRUSR | S_IWUSR));
  if (file && flock(file.get(), LOCK_EX | LOCK_NB) != 0) {
    const int number = errno;
    file.reset();
    errno = number;
  }
  return file;
}

int serve(const DrivePaths& paths, const std::string& extension, const sigset_t& endingSignals) {
  auto& loop = ipc::EventLoop::shared();
  auto host = loop.runAndWait([&] {
    Host::Options options;
    options.paths = paths;
    options.extensionProgram = extension;
    auto made = Host::create(std::move(options));
    made->start();
    return made;
  });
  NSErrorRef error;
  auto listener = ipc::Listener::listen(
      paths.controlSocket,
      [host](const ipc::PeerCredentials& peer) {
        return makeControlServer(host, static_cast<std::uint32_t>(peer.pid));
      },
      &error);
  if (listener != nullptr) {
    log_info(defaultLog(), "[INFO] serving %s", paths.controlSocket.c_str());
    int signal = 0;
    while (sigwait(&endingSignals, &signal) != 0) {
    }
    log_info(defaultLog(), "[INFO] ending on signal %d", signal);
  }
  listener.reset();
  // On its own thread, and with it the extension process.
  loop.runAndWait([&] { host.reset(); });
  return error == nullptr ? 0 : fail(kCannotStart, error->localizedDescription());
}

int run(const std::vector<std::string>& given) {
  const auto arguments = parse(given);
  if (!arguments) return fail(kUsage, "usage: fileproviderd [--home DIR] [--extension PROGRAM]");
  const auto paths =
      arguments->home ? DrivePaths::forHome(*arguments->home) : DrivePaths::forDefaultHome();
  const auto endingSignals = blockEndingSignals();
  if (const auto error = paths.create()) return fail(kCannotStart, error->localizedDescription());
  const auto lock = lockDrive(paths.home + "/fileproviderd.lock");
  if (!lock) {
    if (errno == EWOULDBLOCK) {
      return fail(kAlreadyRunning, "another fileproviderd serves " + paths.home);
    }
    const auto error = NSError::errorWithErrno(errno, paths.home + "/fileproviderd.lock");
    return fail(kCannotStart, error->localizedDescription());
  }
  raiseDescriptorLimit();
  openLog("fileproviderd", paths);
  registerItemsInErrors();
  return serve(paths, arguments->extension, endingSignals);
}

}  // namespace
}  // namespace yomber

int main(int argc, char** argv) { return yomber::run(std::vector<std::string>(argv, argv + argc)); }
