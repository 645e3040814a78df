#include <iostream>
#include <string>

#include "platform/fileprovider/constants.h"
#include "yomber/command.h"
#include "yomber/drive_client.h"
#include "yomber/item_output.h"

namespace yomber {

namespace {

struct ListingOptions {
  std::string where;
  std::string sort = "name";
  bool detailed = false;
};

void printListing(CommandContext& context, DriveClient& client,
                  const NSFileProviderItemIdentifier& container, const ListingOptions& options) {
  const OutputForm form = context.json       ? OutputForm::Json
                          : options.detailed ? OutputForm::Long
                                             : OutputForm::Short;
  const auto order = options.sort == "date" ? protocol::SortOrder::DATE : protocol::SortOrder::NAME;
  const NSErrorRef error = client.list(container, order, [&](const std::vector<ItemFields>& page) {
    std::string lines;
    for (const ItemFields& item : page) lines += itemLine(item, form) + "\n";
    std::cout << lines << std::flush;
    return static_cast<bool>(std::cout);
  });
  if (error) context.fail(error);
}

void runList(CommandContext& context, const ListingOptions& options) {
  DriveClient client(context.paths());
  NSFileProviderItemIdentifier container;
  if (NSErrorRef error = client.identifierFor(options.where, container)) return context.fail(error);
  printListing(context, client, container, options);
}

void runFolders(CommandContext& context, const ListingOptions& options) {
  DriveClient client(context.paths());
  printListing(context, client, NSFileProviderAllDirectoriesContainerItemIdentifier, options);
}

void addListingOptions(CLI::App& command, const std::shared_ptr<ListingOptions>& options) {
  command.add_option("--sort", options->sort, "By name, or by date with the newest first")
      ->check(CLI::IsMember({"name", "date"}))
      ->capture_default_str();
  command.add_flag("-l,--long", options->detailed, "Kind, size, date, identifier and tags as well");
}

}  // namespace

void addListingCommands(CLI::App& app, CommandContext& context) {
  CLI::App* list = app.add_subcommand("ls", "List a folder of the drive");
  auto listOptions = std::make_shared<ListingOptions>();
  list->add_option("item", listOptions->where, itemHelp);
  addListingOptions(*list, listOptions);
  list->callback([&context, listOptions] { runList(context, *listOptions); });

  CLI::App* folders = app.add_subcommand("folders", "List every folder of the drive");
  auto folderOptions = std::make_shared<ListingOptions>();
  addListingOptions(*folders, folderOptions);
  folders->callback([&context, folderOptions] { runFolders(context, *folderOptions); });
}

}  // namespace yomber
