#include <algorithm>
#include <cstdint>
#include <ctime>
#include <iostream>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include <nlohmann/json.hpp>

#include "platform/ostrell/constants.h"
#include "yomber/command.h"
#include "yomber/drive_changes.h"
#include "yomber/item_output.h"

namespace yomber {

namespace {

struct MarkOptions {
  std::string item;
  std::vector<std::string> labels;
  bool adds = false;
  bool removes = false;
  bool clears = false;
  std::int64_t rank = 1;
  std::string date;
};

/// Prints the item as it is after the change.
void report(CommandContext& context, const ChangeResult& result) {
  if (result.error) return context.fail(result.error);
  if (result.item) {
    std::cout << itemLine(*result.item, context.json ? OutputForm::Json : OutputForm::Long)
              << std::endl;
  }
}

/// Makes a change of the one item that the command names.
template <typename Change>
void changeItem(CommandContext& context, const MarkOptions& options, const Change& change) {
  DriveClient client(context.paths());
  NSErrorRef error;
  NSFileProviderItemIdentifier identifier;
  const auto changes = DriveChanges::open(client, &error);
  if (changes) error = client.identifierFor(options.item, identifier);
  if (error) return context.fail(error);
  report(context, change(client, *changes, identifier));
}

/// The labels that an item has after they were added to, or taken from, those that it had.
std::vector<std::string> combined(std::vector<std::string> had, const MarkOptions& options) {
  for (const std::string& label : options.labels) {
    const auto found = std::find(had.begin(), had.end(), label);
    if (options.removes && found != had.end()) had.erase(found);
    if (options.adds && found == had.end()) had.push_back(label);
  }
  return had;
}

void runTag(CommandContext& context, const MarkOptions& options) {
  changeItem(context, options,
             [&](DriveClient& client, const DriveChanges& changes, const std::string& identifier) {
               ChangeResult result;
               const bool asks = options.labels.empty() && !options.clears;
               if (asks || options.adds || options.removes) {
                 // Tags land on a bookmark's target, so its own are those that count.
                 std::string path;
                 ItemFields item;
                 std::string target = identifier;
                 result.error = client.location(identifier, path);
                 if (!result.error) result.error = client.identifierAt(path, target);
                 if (!result.error) result.error = client.item(target, item);
                 if (result.error) return result;
                 result.item = item;
                 if (asks) return result;
                 return changes.setTags(identifier, combined(item.tags, options));
               }
               return changes.setTags(identifier,
                                      options.clears ? std::vector<std::string>() : options.labels);
             });
}

void runFavorite(CommandContext& context, const MarkOptions& options) {
  changeItem(context, options,
             [&](DriveClient&, const DriveChanges& changes, const std::string& identifier) {
               return changes.setFavoriteRank(
                   identifier, options.clears ? std::nullopt : std::optional(options.rank));
             });
}

/// "2026-03-01T12:00:00Z", "2026-03-01T12:00" and "2026-03-01", in the local zone without the Z.
std::optional<NSDate> parseDate(const std::string& text) {
  for (const char* const form : {"%Y-%m-%dT%H:%M:%S", "%Y-%m-%dT%H:%M", "%Y-%m-%d"}) {
    std::tm parts{};
    parts.tm_isdst = -1;
    const char* const rest = strptime(text.c_str(), form, &parts);
    const bool isUtc = rest != nullptr && std::string(rest) == "Z";
    if (rest == nullptr || (*rest != '\0' && !isUtc)) continue;
    return NSDate::fromTimespec({.tv_sec = isUtc ? timegm(&parts) : mktime(&parts), .tv_nsec = 0});
  }
  return std::nullopt;
}

void runUsed(CommandContext& context, const MarkOptions& options) {
  std::optional<NSDate> date = NSDate::now();
  if (!options.date.empty()) date = parseDate(options.date);
  if (!date) return context.fail(ExitCode::Usage, "a date looks like 2026-03-01T12:00:00Z");
  if (options.clears) date.reset();
  changeItem(context, options,
             [&](DriveClient&, const DriveChanges& changes, const std::string& identifier) {
               return changes.setLastUsedDate(identifier, date);
             });
}

/// Why an application has no folder, in words that name it.
NSErrorRef withReason(const NSErrorRef& error, const std::string& application) {
  std::string reason;
  if (error->is(QSOstrellErrorDomain, QSOstrellErrorInvalidParameter)) {
    reason = "no application " + printableName(application) + " is installed";
  } else if (error->is(QSOstrellErrorDomain, QSOstrellErrorNotEntitled)) {
    reason =
        printableName(application) + " has no folder in the drive: its .desktop file names none";
  } else {
    return error;
  }
  auto info = error->userInfo();
  info[NSLocalizedDescriptionKey] = std::move(reason);
  return NSError::errorWithDomain(error->domain(), error->code(), std::move(info));
}

void runAppFolder(CommandContext& context, const MarkOptions& options) {
  DriveClient client(context.paths());
  NSErrorRef error;
  const auto changes = DriveChanges::open(client, &error);
  if (!changes) return context.fail(error);
  ChangeResult result = changes->defaultApplicationContainer(options.item);
  if (result.error) result.error = withReason(result.error, options.item);
  report(context, result);
}

}  // namespace

void addMarkCommands(CLI::App& app, CommandContext& context) {
  auto options = std::make_shared<MarkOptions>();
  CLI::App* tag =
      addCommand(app, context, "tag", "Set an item's tags; show them without any", runTag, options);
  tag->add_option("item", options->item, itemHelp)->required();
  tag->add_option("tags", options->labels, "They replace the tags that it has");
  auto* const add = tag->add_flag("--add", options->adds, "Add to the tags that it has");
  auto* const remove = tag->add_flag("--remove", options->removes, "Take away from them");
  auto* const clear = tag->add_flag("--clear", options->clears, "Take all of them away");
  add->excludes(remove)->excludes(clear);
  remove->excludes(clear);

  options = std::make_shared<MarkOptions>();
  CLI::App* favorite =
      addCommand(app, context, "favorite", "Make an item a favourite", runFavorite, options);
  favorite->add_option("item", options->item, itemHelp)->required();
  favorite->add_option("rank", options->rank, "Its place among the favourites")
      ->capture_default_str();
  favorite->add_flag("--clear", options->clears, "It is no favourite any more");

  options = std::make_shared<MarkOptions>();
  CLI::App* used =
      addCommand(app, context, "used", "Say that an item has been used", runUsed, options);
  used->add_option("item", options->item, itemHelp)->required();
  used->add_option("--at", options->date, "When, as 2026-03-01T12:00:00Z; now by default");
  used->add_flag("--clear", options->clears, "It has never been used");

  options = std::make_shared<MarkOptions>();
  CLI::App* folder = addCommand(app, context, "app-folder",
                                "Show the folder of an application; it is made where it is missing",
                                runAppFolder, options);
  folder->add_option("bundle", options->item,
                     "The application's identifier; without one, the drive's own folder");
}

}  // namespace yomber
