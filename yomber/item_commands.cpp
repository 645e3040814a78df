#include <iostream>

#include <nlohmann/json.hpp>

#include "yomber/command.h"
#include "yomber/drive_client.h"
#include "yomber/item_output.h"

namespace yomber {

namespace {

void runStat(CommandContext& context, const std::string& argument) {
  DriveClient client(context.paths());
  NSFileProviderItemIdentifier identifier;
  ItemFields item;
  NSErrorRef error = client.identifierFor(argument, identifier);
  if (!error) error = client.item(identifier, item);
  if (error) return context.fail(error);
  if (context.json) {
    std::cout << itemLine(item, OutputForm::Json) << std::endl;
    return;
  }
  const auto json = itemJson(item);
  for (const auto& [key, value] : json.items()) {
    std::cout << key << std::string(key.size() < 14 ? 14 - key.size() : 1, ' ')
              << printableName(value.is_string() ? value.get<std::string>() : jsonLine(value))
              << "\n";
  }
  std::cout << std::flush;
}

void runIdentifier(CommandContext& context, const std::string& argument) {
  DriveClient client(context.paths());
  NSFileProviderItemIdentifier identifier;
  if (NSErrorRef error = client.identifierFor(argument, identifier)) return context.fail(error);
  context.print({{"id", identifier}}, identifier);
}

void runLocation(CommandContext& context, const std::string& argument) {
  DriveClient client(context.paths());
  NSFileProviderItemIdentifier identifier;
  std::string path;
  NSErrorRef error = client.identifierFor(argument, identifier);
  if (!error) error = client.location(identifier, path);
  if (error) return context.fail(error);
  context.print({{"location", path}}, path);
}

/// Adds a command that takes one item.
void addItemCommand(CLI::App& app, CommandContext& context, const char* name, const char* what,
                    void (*run)(CommandContext&, const std::string&)) {
  CLI::App* command = app.add_subcommand(name, what);
  auto argument = std::make_shared<std::string>();
  command->add_option("item", *argument, itemHelp)->required();
  command->callback([&context, argument, run] { run(context, *argument); });
}

}  // namespace

void addItemCommands(CLI::App& app, CommandContext& context) {
  addItemCommand(app, context, "stat", "Show everything about an item", runStat);
  addItemCommand(app, context, "id", "Print an item's identifier", runIdentifier);
  addItemCommand(app, context, "url",
                 "Print where an item is on disk; a bookmark's target for a bookmark", runLocation);
}

}  // namespace yomber
