#include <chrono>
#include <iostream>

#include <poll.h>
#include <unistd.h>

#include <nlohmann/json.hpp>

#include "platform/ipc/call.h"
#include "platform/ipc/error_codec.h"
#include "yomber/command.h"
#include "yomber/drive_client.h"
#include "yomber/drive_mount.h"
#include "yomber/drive_status.h"
#include "yomber/item_output.h"
#include "yomber/supervisor.h"
#include "yomber/supervisor_process.h"
#include "yomber/transfer_view.h"

namespace yomber {

namespace {

using std::chrono::steady_clock;

/// How long `up` and `down` wait before they say that something is wrong.
constexpr std::chrono::seconds patience{30};

std::string supervisorLock(const DrivePaths& paths) { return paths.home + "/supervisor.lock"; }

Supervision supervisionOf(const DrivePaths& paths) {
  return {.paths = paths,
          .logName = "supervisor",
          .lockPath = supervisorLock(paths),
          .programs = {{"zarn", {programPath("zarn"), "--home", paths.home}},
                       {"fileproviderd", {programPath("fileproviderd"), "--home", paths.home}}}};
}

/// Whether zarn and the host answer, and the extension knows the root.
NSErrorRef askWhetherUp(const DrivePaths& paths) {
  DriveClient client(paths);
  NSErrorRef error;
  if (!client.daemon(&error)) return error;
  if (!client.control(&error)) return error;
  std::string root;
  return client.location(NSFileProviderRootContainerItemIdentifier, root);
}

NSErrorRef waitUntilUp(const DrivePaths& paths) {
  const auto deadline = steady_clock::now() + patience;
  NSErrorRef error = askWhetherUp(paths);
  while (error && steady_clock::now() < deadline) {
    poll(nullptr, 0, 20);
    error = askWhetherUp(paths);
  }
  return error;
}

struct UpOptions {
  bool foreground = false;
  std::string store = {};
};

/// Makes the drive's places where they are missing.
NSErrorRef provideDrive(DrivePaths& paths, const std::string& store) {
  if (!store.empty()) {
    if (NSErrorRef error = paths.joinStore(store)) return error;
  }
  return paths.create();
}

void runUp(CommandContext& context, const UpOptions& options) {
  DrivePaths paths = context.paths();
  if (NSErrorRef error = provideDrive(paths, options.store)) {
    context.fail(error);
    context.exitCode = ExitCode::CannotCreate;
    return;
  }
  const bool already = Supervisor::runningPid(supervisorLock(paths)).has_value();
  if (options.foreground) {
    if (already)
      return context.fail(ExitCode::CannotCreate,
                          "the drive is up already; take it down with 'yomber down'");
    if (NSErrorRef error = superviseHere(supervisionOf(paths))) context.fail(error);
    return;
  }
  if (!already) superviseApart(supervisionOf(paths));
  if (NSErrorRef error = waitUntilUp(paths)) {
    context.fail(error);
    std::cerr << "yomber: the drive did not come up; see 'yomber log'" << std::endl;
    context.exitCode = ExitCode::Unavailable;
    return;
  }
  if (context.json) {
    std::cout << jsonLine({{"home", paths.home}, {"up", true}, {"was_up", already}}) << std::endl;
  } else {
    std::cout << (already ? "The drive is up already: " : "The drive is up: ") << paths.home
              << std::endl;
  }
}

void runDown(CommandContext& context) {
  const DrivePaths paths = context.paths();
  bool wasMounted = false;
  if (NSErrorRef error = unmountDrive(paths, MayBeInUse::Yes, wasMounted))
    return context.fail(error);
  bool wasUp = false;
  if (NSErrorRef error = endSupervision(supervisorLock(paths), wasUp)) return context.fail(error);
  if (context.json) {
    std::cout << jsonLine({{"home", paths.home}, {"up", false}, {"was_up", wasUp}}) << std::endl;
  } else {
    std::cout << (wasUp ? "The drive is down." : "The drive was not up.") << std::endl;
  }
}

/// At a terminal, transfers are shown for as long as there are any.
void showTransfers(CommandContext& context, DriveStatus& status) {
  const bool isBusy =
      status.transfers && (!status.transfers->underWay.empty() || status.transfers->waiting > 0);
  if (isBusy) status.transfers.reset();  // drawn below
  std::cout << statusText(status) << std::flush;
  if (!isBusy) return;
  DriveClient client(context.paths());
  NSErrorRef error;
  const auto daemon = client.daemon(&error);
  if (!error) error = followTransfers(daemon);
  if (error) context.fail(error);
}

void runStatus(CommandContext& context, bool once) {
  const DrivePaths paths = context.paths();
  DriveStatus status = readDriveStatus(paths, Supervisor::runningPid(supervisorLock(paths)));
  if (!status.daemon || !status.host) context.exitCode = ExitCode::Unavailable;
  if (context.json) {
    std::cout << jsonLine(statusJson(status)) << std::endl;
  } else if (once || isatty(STDOUT_FILENO) == 0) {
    std::cout << statusText(status) << std::flush;
  } else {
    showTransfers(context, status);
  }
}

}  // namespace

void addDriveCommands(CLI::App& app, CommandContext& context) {
  CLI::App* up = app.add_subcommand("up", "Start the drive and keep it running");
  auto options = std::make_shared<UpOptions>();
  up->add_flag("--foreground", options->foreground,
               "Stay, and end the drive when this command ends");
  up->add_option(
        "--store", options->store,
        "Keep the records in this folder, from now on; drives that share have one together")
      ->type_name("FOLDER");
  up->callback([&context, options] { runUp(context, *options); });

  CLI::App* down = app.add_subcommand("down", "End the drive; its files stay");
  down->callback([&context] { runDown(context); });

  CLI::App* status = app.add_subcommand("status", "Show what the drive is doing");
  auto once = std::make_shared<bool>(false);
  status->add_flag("--once", *once, "Do not wait for transfers, also at a terminal");
  status->callback([&context, once] { runStatus(context, *once); });
}

}  // namespace yomber
