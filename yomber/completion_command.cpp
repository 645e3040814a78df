#include <iostream>
#include <sstream>

#include "yomber/command.h"

namespace yomber {

namespace {

/// Every word that may follow `command`: its subcommands and its options.
std::string wordsAfter(const CLI::App& command) {
  std::string words;
  for (const CLI::App* subcommand : command.get_subcommands([](const CLI::App*) { return true; })) {
    words += subcommand->get_name() + " ";
  }
  for (const CLI::Option* option : command.get_options()) {
    for (const std::string& name : option->get_lnames()) words += "--" + name + " ";
    for (const std::string& name : option->get_snames()) words += "-" + name + " ";
  }
  if (!words.empty()) words.pop_back();
  return words;
}

/// One `case` branch for each command, nested commands as "outer inner".
void writeCases(std::ostream& out, const CLI::App& command, const std::string& path) {
  for (const CLI::App* subcommand : command.get_subcommands([](const CLI::App*) { return true; })) {
    const std::string name =
        path.empty() ? subcommand->get_name() : path + " " + subcommand->get_name();
    out << "    \"" << name << "\") words=\"" << wordsAfter(*subcommand) << "\" ;;\n";
    writeCases(out, *subcommand, name);
  }
}

std::string bashScript(const CLI::App& app) {
  std::ostringstream out;
  out << "# Completion of yomber for bash, and for zsh after: autoload -U bashcompinit; "
         "bashcompinit.\n"
         "_yomber() {\n"
         "  local current=${COMP_WORDS[COMP_CWORD]} command=\"\" words=\"\" word\n"
         "  for word in \"${COMP_WORDS[@]:1:COMP_CWORD-1}\"; do\n"
         "    case $word in -*) ;; *) command=\"${command:+$command }$word\" ;; esac\n"
         "  done\n"
         "  case $command in\n"
         "    \"\") words=\""
      << wordsAfter(app) << "\" ;;\n";
  writeCases(out, app, "");
  out << "  esac\n"
         "  mapfile -t COMPREPLY < <(compgen -W \"$words\" -- \"$current\")\n"
         "}\n"
         "complete -o default -F _yomber yomber\n";
  return out.str();
}

/// As one word of a fish script.
std::string quotedForFish(const std::string& text) {
  std::string result = "'";
  for (const char c : text) {
    if (c == '\'' || c == '\\') result += '\\';
    result += c;
  }
  return result + "'";
}

std::string fishScript(const CLI::App& app) {
  std::ostringstream out;
  out << "# Completion of yomber for fish.\n";
  for (const CLI::App* command : app.get_subcommands([](const CLI::App*) { return true; })) {
    out << "complete -c yomber -n __fish_use_subcommand -a " << command->get_name() << " -d "
        << quotedForFish(command->get_description()) << "\n";
    for (const CLI::Option* option : command->get_options()) {
      for (const std::string& name : option->get_lnames()) {
        out << "complete -c yomber -n '__fish_seen_subcommand_from " << command->get_name()
            << "' -l " << name << "\n";
      }
    }
  }
  return out.str();
}

}  // namespace

void addCompletionCommand(CLI::App& app, CommandContext& context) {
  CLI::App* completion =
      app.add_subcommand("completion", "Print a completion script for your shell");
  auto shell = std::make_shared<std::string>("bash");
  completion->add_option("shell", *shell, "The shell")
      ->check(CLI::IsMember({"bash", "zsh", "fish"}))
      ->capture_default_str();
  completion->callback([&app, &context, shell] {
    std::cout << (*shell == "fish" ? fishScript(app) : bashScript(app)) << std::flush;
    if (!std::cout) context.fail(ExitCode::Failure, "the script could not be written");
  });
}

}  // namespace yomber
