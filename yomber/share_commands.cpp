#include <algorithm>
#include <memory>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "yomber/command.h"
#include "yomber/drive_sharing.h"
#include "yomber/item_output.h"
#include "yomber/share_output.h"

namespace yomber {

namespace {

struct ShareOptions {
  std::string item;
  std::string name;
  std::string role = "viewer";
  std::string url;
};

/// One command's drive, and the item that it names.
struct ShareRun {
  ShareRun(CommandContext& given, const std::string& argument)
      : context(given), client(given.paths()), sharing(client) {
    error = client.identifierFor(argument, identifier);
  }

  void print(const RZShare& share) const { context.print(shareJson(share), shareText(share)); }

  /// Saves the item's share as `change` makes it, and prints it.
  void save(const std::function<void(RZShare& share)>& change) {
    RZShareRef saved;
    if (!error) error = sharing.change(identifier, change, saved);
    if (error) return context.fail(error);
    print(*saved);
  }

  CommandContext& context;
  DriveClient client;
  DriveSharing sharing;
  NSFileProviderItemIdentifier identifier;
  NSErrorRef error;
};

void runInfo(CommandContext& context, const ShareOptions& options) {
  ShareRun run(context, options.item);
  RZShareRef share;
  if (!run.error) run.error = run.sharing.share(run.identifier, share);
  if (run.error) return context.fail(run.error);
  run.print(*share);
}

void runParticipants(CommandContext& context, const ShareOptions& options) {
  ShareRun run(context, options.item);
  std::vector<RZShareParticipant> participants;
  if (!run.error) run.error = run.sharing.participants(run.identifier, participants);
  if (run.error) return context.fail(run.error);
  for (const RZShareParticipant& each : participants)
    context.print(participantJson(each), participantLine(each));
}

/// Shares the item when it is not shared yet: otherwise there is no link.
void runLink(CommandContext& context, const ShareOptions& options) {
  ShareRun run(context, options.item);
  RZShareRef share;
  std::string url;
  if (!run.error) run.error = run.sharing.share(run.identifier, share);
  if (!run.error && !share->isKnownToServer())
    run.error = run.sharing.change(run.identifier, [](RZShare&) {}, share);
  if (!run.error) run.error = run.sharing.link(run.identifier, url);
  if (run.error) return context.fail(run.error);
  context.print({{"url", url}}, printableName(url));
}

void runAdd(CommandContext& context, const ShareOptions& options) {
  ShareRun run(context, options.item);
  run.save([&](RZShare& share) {
    auto people = share.participants();
    const auto known = std::ranges::find(people, options.name, &RZShareParticipant::userName);
    RZShareParticipant& person =
        known != people.end() ? *known : people.emplace_back(RZShareParticipant{options.name});
    person.permission = *permissionForRole(options.role);
    if (person.acceptanceStatus == RZShareParticipantAcceptanceStatus::Removed)
      person.acceptanceStatus = RZShareParticipantAcceptanceStatus::Pending;
    share.setParticipants(people);
  });
}

void runRemove(CommandContext& context, const ShareOptions& options) {
  ShareRun run(context, options.item);
  RZShareRef share;
  if (!run.error) run.error = run.sharing.share(run.identifier, share);
  if (run.error) return context.fail(run.error);
  const auto people = share->participants();
  if (std::ranges::find(people, options.name, &RZShareParticipant::userName) == people.end()) {
    return context.fail(ExitCode::NoSuchItem,
                        "nobody of the name \"" + printableName(options.name) +
                            "\" takes part; \"yomber share participants\" shows who does");
  }
  run.save([&](RZShare& changed) {
    auto left = changed.participants();
    std::erase_if(left, [&](const auto& each) { return each.userName == options.name; });
    changed.setParticipants(left);
  });
}

void runPermission(CommandContext& context, const ShareOptions& options) {
  ShareRun run(context, options.item);
  run.save([&](RZShare& share) { share.setPublicPermission(*permissionForRole(options.role)); });
}

void runStop(CommandContext& context, const ShareOptions& options) {
  ShareRun run(context, options.item);
  if (!run.error) run.error = run.sharing.stop(run.identifier);
  if (run.error) return context.fail(run.error);
  context.print({{"done", true}}, "not shared any more");
}

void runAccept(CommandContext& context, const ShareOptions& options) {
  ShareRun run(context, "");
  ItemFields item;
  run.error = run.sharing.accept(options.url, run.identifier);
  if (!run.error) run.error = run.client.item(run.identifier, item);
  if (run.error) return context.fail(run.error);
  context.print(itemJson(item), itemLine(item, OutputForm::Long));
}

void runList(CommandContext& context, const ShareOptions&) {
  ShareRun run(context, "");
  std::vector<RZShareRef> shares;
  run.error = run.sharing.sharedWithMe(shares);
  if (run.error) return context.fail(run.error);
  for (const RZShareRef& share : shares) run.print(*share);
}

}  // namespace

void addShareCommands(CLI::App& app, CommandContext& context) {
  CLI::App* share = app.add_subcommand("share", "Share items with other people");
  share->require_subcommand(1);
  const auto ofItem = [&](const char* name, const char* what,
                          void (*run)(CommandContext&, const ShareOptions&)) {
    auto options = std::make_shared<ShareOptions>();
    CLI::App* command = addCommand(*share, context, name, what, run, options);
    command->add_option("item", options->item, itemHelp)->required();
    return std::pair(command, options);
  };

  ofItem("info", "Show who has an item", runInfo);
  ofItem("participants", "List the people whom it is shared with", runParticipants);
  ofItem("link", "Print the link by which others get it; shares it if it is not yet", runLink);
  const auto [add, added] =
      ofItem("add", "Share it with somebody, or change what he may do", runAdd);
  add->add_option("name", added->name, "The name of the account")->required();
  add->add_option("--role", added->role, "What he may do")
      ->check(CLI::IsMember({"viewer", "editor"}))
      ->capture_default_str();
  const auto [remove, removed] = ofItem("remove", "Share it with somebody no more", runRemove);
  remove->add_option("name", removed->name, "The name of the account")->required();
  const auto [permission, permitted] =
      ofItem("permission", "Set what everybody may do who has the link", runPermission);
  permission->add_option("role", permitted->role)
      ->required()
      ->check(CLI::IsMember({"none", "viewer", "editor"}));
  ofItem("stop", "Share it no more, or leave what others share", runStop);

  auto options = std::make_shared<ShareOptions>();
  addCommand(*share, context, "accept", "Get an item that somebody shares, by its link", runAccept,
             options)
      ->add_option("url", options->url, "The link")
      ->required();
  addCommand(*share, context, "list", "List what others share with you", runList,
             std::make_shared<ShareOptions>());
}

}  // namespace yomber
