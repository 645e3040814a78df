#include <iostream>
#include <optional>

#include <nlohmann/json.hpp>

#include "platform/ipc/call.h"
#include "platform/ipc/error_codec.h"
#include "yomber/command.h"
#include "yomber/drive_client.h"
#include "yomber/item_output.h"

namespace yomber {

namespace {

NSErrorRef signIn(DriveClient& client, const std::string& name) {
  NSErrorRef failure;
  const auto daemon = client.daemon(&failure);
  if (failure) return failure;
  const NSErrorRef transport = ipc::callAndWait(
      daemon, &protocol::Daemon::Client::signInRequest, [&](auto params) { params.setName(name); },
      [&](auto results) { failure = ipc::decodeOptional(results.getFailure()); });
  return transport ? transport : failure;
}

NSErrorRef signOut(DriveClient& client) {
  NSErrorRef failure;
  const auto daemon = client.daemon(&failure);
  if (failure) return failure;
  const NSErrorRef transport = ipc::callAndWait(
      daemon, &protocol::Daemon::Client::signOutRequest, [](auto) {},
      [&](auto results) { failure = ipc::decodeOptional(results.getFailure()); });
  return transport ? transport : failure;
}

NSErrorRef currentAccount(DriveClient& client, std::optional<std::string>& name) {
  NSErrorRef failure;
  const auto daemon = client.daemon(&failure);
  if (failure) return failure;
  const NSErrorRef transport = ipc::callAndWait(
      daemon, &protocol::Daemon::Client::accountRequest, [](auto) {},
      [&](auto results) {
        const auto result = results.getResult();
        if (result.isError()) failure = ipc::decodeError(result.getError());
        if (result.isAccount()) name = result.getAccount().getName().cStr();
      });
  return transport ? transport : failure;
}

void showAccount(CommandContext& context, DriveClient& client) {
  std::optional<std::string> name;
  if (NSErrorRef error = currentAccount(client, name)) return context.fail(error);
  if (context.json) {
    nlohmann::ordered_json json{{"account", nullptr}};
    if (name) json["account"] = *name;
    std::cout << jsonLine(json) << std::endl;
  } else {
    std::cout << (name ? printableName(*name) : "Nobody is signed in.") << std::endl;
  }
  if (!name) context.exitCode = ExitCode::NotSignedIn;
}

void runSignIn(CommandContext& context, const std::string& name) {
  DriveClient client(context.paths());
  if (NSErrorRef error = signIn(client, name)) return context.fail(error);
  showAccount(context, client);
}

void runSignOut(CommandContext& context) {
  DriveClient client(context.paths());
  if (NSErrorRef error = signOut(client)) return context.fail(error);
  if (!context.json) std::cout << "Signed out. The drive's files stay where they are." << std::endl;
}

}  // namespace

void addAccountCommands(CLI::App& app, CommandContext& context) {
  CLI::App* account = app.add_subcommand("account", "Show the account, sign in, sign out");
  account->require_subcommand(0, 1);

  CLI::App* in = account->add_subcommand("sign-in", "Sign in to the drive");
  auto* name = in->add_option("name", "The account's name")->required();
  in->callback([&context, name] { runSignIn(context, name->as<std::string>()); });

  CLI::App* out = account->add_subcommand("sign-out", "Sign out; local files stay readable");
  out->callback([&context] { runSignOut(context); });

  account->callback([&context, account] {
    if (!account->get_subcommands().empty()) return;
    DriveClient client(context.paths());
    showAccount(context, client);
  });
}

}  // namespace yomber
