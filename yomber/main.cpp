#include <clocale>
#include <csignal>
#include <iostream>
#include <sstream>
#include <string>

#include <CLI/CLI.hpp>

#include "yomber/command.h"
#include "yomber/item_output.h"

namespace {

/// Prints the help that was asked for, or what is wrong with the arguments.
int answerParseError(const CLI::App& app, const CLI::ParseError& error) {
  std::ostringstream complaint;
  if (app.exit(error, std::cout, complaint) == 0) return 0;
  // It cites the arguments.
  std::istringstream lines(complaint.str());
  for (std::string line; std::getline(lines, line);)
    std::cerr << yomber::printableName(line) << "\n";
  return static_cast<int>(yomber::ExitCode::Usage);
}

}  // namespace

int main(int argc, char** argv) {
  using namespace yomber;
  std::setlocale(LC_TIME, "");
  std::signal(SIGPIPE, SIG_DFL);

  CLI::App app("Yomber Drive: files on demand");
  app.name("yomber");
  app.set_help_all_flag("--help-all", "Show the help of every command");
  app.require_subcommand(1);
  app.fallthrough();

  CommandContext context;
  app.add_option("--home", context.home,
                 "The drive's home; YOMBER_HOME or ~/.local/share/yomber by default");
  app.add_flag("--json", context.json, "Print JSON: one object a line");

  addDriveCommands(app, context);
  addAccountCommands(app, context);
  addListingCommands(app, context);
  addItemCommands(app, context);
  addChangeCommands(app, context);
  addGetCommand(app, context);
  addContentCommands(app, context);
  addThumbnailCommand(app, context);
  addMarkCommands(app, context);
  addShareCommands(app, context);
  addCollabCommands(app, context);
  addChangesCommand(app, context);
  addWatchCommands(app, context);
  addMountCommands(app, context);
  addLogCommand(app, context);
  addCompletionCommand(app, context);

  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& error) {
    return answerParseError(app, error);
  }
  return static_cast<int>(context.exitCode);
}
