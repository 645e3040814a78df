#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include <nlohmann/json.hpp>

#include "yomber/command.h"
#include "yomber/drive_collaboration.h"
#include "yomber/item_output.h"

namespace yomber {

namespace {

constexpr const char* documentHelp =
    "A document: a path from the drive's root, a location in its tree, or an identifier";

/// The service of the document that the command names; null after the failure was printed.
std::unique_ptr<CollaborationClient> open(CommandContext& context, DriveClient& client,
                                          const std::string& argument) {
  NSFileProviderItemIdentifier identifier;
  NSErrorRef error = client.identifierFor(argument, identifier);
  auto service = error ? nullptr : openCollaboration(client, identifier, &error);
  if (error) context.fail(error);
  return service;
}

void runCapabilities(CommandContext& context, CollaborationClient& service) {
  std::uint64_t version = 0;
  std::uint64_t capabilities = 0;
  const NSErrorRef error = service.call([&](auto& document, const auto& done) {
    document.fetchVersionAndCapabilitiesWithCompletionHandler(
        [&, done](std::uint64_t first, std::uint64_t second, NSErrorRef failure) {
          version = first;
          capabilities = second;
          done(std::move(failure));
        });
  });
  if (error) return context.fail(error);
  context.print(
      {{"version", version}, {"capabilities", capabilities}},
      "version " + std::to_string(version) + ", capabilities " + std::to_string(capabilities));
}

void runToken(CommandContext& context, CollaborationClient& service) {
  std::string provider;
  std::string base;
  std::string share;
  const NSErrorRef error = service.call([&](auto& document, const auto& done) {
    (void)document.fetchCollaborationTokenWithCompletionHandler(
        [&, done](const std::optional<std::string>& identifier,
                  const std::optional<std::string>& baseToken,
                  const std::optional<std::string>& shareToken, const std::optional<NSDate>&,
                  NSErrorRef failure) {
          provider = identifier.value_or("");
          base = baseToken.value_or("");
          share = shareToken.value_or("");
          done(std::move(failure));
        });
  });
  if (error) return context.fail(error);
  context.print({{"provider", provider}, {"base_token", base}, {"share_token", share}},
                "provider     " + printableName(provider) + "\nbase token   " +
                    printableName(base) + "\nshare token  " + printableName(share));
}

/// What others have saved is known here only after a look at the store.
void runLatest(CommandContext& context, CollaborationClient& service) {
  NSErrorRef error = service.call([](auto& document, const auto& done) {
    (void)document.refreshSharingStateWithCompletionHandler(done);
  });
  if (!error) {
    error = service.call([](auto& document, const auto& done) {
      (void)document.fetchLatestRevisionWithCompletionHandler(done);
    });
  }
  if (error) return context.fail(error);
  context.print({{"done", true}}, "the latest version is here");
}

/// What the store knows now, not what was known last.
void runState(CommandContext& context, CollaborationClient& service) {
  NSErrorRef error = service.call([](auto& document, const auto& done) {
    (void)document.refreshSharingStateWithCompletionHandler(done);
  });
  bool isInSharedFolder = false;
  std::optional<std::string> name;
  if (!error) {
    error = service.call([&](auto& document, const auto& done) {
      (void)document.fetchSharedFolderInfoWithCompletionHandler(
          [&, done](bool state, const std::optional<std::string>& folder, NSErrorRef failure) {
            isInSharedFolder = state;
            name = folder;
            done(std::move(failure));
          });
    });
  }
  if (error) return context.fail(error);
  nlohmann::ordered_json json{{"in_shared_folder", isInSharedFolder}};
  if (isInSharedFolder && name) json["folder"] = *name;
  const std::string folder = name ? " \"" + printableName(*name) + "\"" : std::string();
  context.print(json, isInSharedFolder ? "in the shared folder" + folder : "in no shared folder");
}

}  // namespace

void addCollabCommands(CLI::App& app, CommandContext& context) {
  CLI::App* collab = app.add_subcommand("collab", "What editing a document together needs");
  collab->require_subcommand(1);
  const auto add = [&](const char* name, const char* what,
                       void (*run)(CommandContext&, CollaborationClient&)) {
    const auto item = std::make_shared<std::string>();
    CLI::App* command = collab->add_subcommand(name, what);
    command->add_option("item", *item, documentHelp)->required();
    command->callback([&context, run, item] {
      DriveClient client(context.paths());
      if (const auto service = open(context, client, *item)) run(context, *service);
    });
  };
  add("capabilities", "Show what the service can do", runCapabilities);
  add("token", "Show the tokens by which programs find each other", runToken);
  add("latest", "Bring the latest version here", runLatest);
  add("state", "Show whether it lies in a shared folder", runState);
}

}  // namespace yomber
