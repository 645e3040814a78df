#pragma once

#include <memory>
#include <string>

#include <CLI/CLI.hpp>
#include <nlohmann/json_fwd.hpp>

#include "platform/foundation/drive_paths.h"
#include "platform/foundation/error.h"
#include "yomber/exit_codes.h"

namespace yomber {

/// What every command of one run shares: the options given before the command, and the exit code.
struct CommandContext {
  std::string home;  ///< as given with --home; empty: the default home
  bool json = false;
  ExitCode exitCode = ExitCode::Ok;

  [[nodiscard]] DrivePaths paths() const;
  /// Prints an answer, and ends its line: as JSON when that was asked for.
  void print(const nlohmann::ordered_json& answer, const std::string& text) const;
  /// Prints the failure to standard error (as JSON when that was asked for) and keeps its exit
  /// code.
  void fail(const NSErrorRef& error);
  void fail(ExitCode code, const std::string& message);
};

/// How an item may be named to a command.
inline constexpr const char* itemHelp =
    "A path from the drive's root, a location in its tree, or an identifier";

/// Adds a command that `run` carries out, with what its options were given by then.
template <typename Options>
CLI::App* addCommand(CLI::App& app, CommandContext& context, const char* name, const char* what,
                     void (*run)(CommandContext&, const Options&),
                     const std::shared_ptr<Options>& options) {
  CLI::App* command = app.add_subcommand(name, what);
  command->callback([&context, run, options] { run(context, *options); });
  return command;
}

// Each adds its commands to the application. The context outlives the application's run.
void addDriveCommands(CLI::App& app, CommandContext& context);    // up, down, status
void addAccountCommands(CLI::App& app, CommandContext& context);  // account …
void addListingCommands(CLI::App& app, CommandContext& context);  // ls, folders
void addItemCommands(CLI::App& app, CommandContext& context);     // stat, id, url
void addChangeCommands(CLI::App& app, CommandContext& context);  // put, mkdir, rename, mv, trash, …
void addContentCommands(CLI::App& app, CommandContext& context);   // provide, evict, pin, unpin
void addGetCommand(CLI::App& app, CommandContext& context);        // get
void addThumbnailCommand(CLI::App& app, CommandContext& context);  // thumbnail
void addMarkCommands(CLI::App& app, CommandContext& context);    // tag, favorite, used, app-folder
void addShareCommands(CLI::App& app, CommandContext& context);   // share …
void addCollabCommands(CLI::App& app, CommandContext& context);  // collab …
void addChangesCommand(CLI::App& app, CommandContext& context);  // changes
void addWatchCommands(CLI::App& app, CommandContext& context);   // watch, working-set
void addMountCommands(CLI::App& app, CommandContext& context);   // mount, unmount
void addLogCommand(CLI::App& app, CommandContext& context);      // log
void addCompletionCommand(CLI::App& app, CommandContext& context);  // completion

}  // namespace yomber
