#include <iostream>
#include <memory>
#include <span>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "platform/fileprovider/item_codec.h"
#include "platform/foundation/hexadecimal.h"
#include "platform/ipc/call.h"
#include "platform/ipc/error_codec.h"
#include "yomber/command.h"
#include "yomber/drive_client.h"
#include "yomber/item_output.h"

namespace yomber {

namespace {

using protocol::Daemon;

/// One batch of changes, and where the next one begins.
struct Batch {
  std::vector<ItemFields> updated;
  std::vector<std::string> deleted;
  std::string token;
};

constexpr std::uint32_t batchSize = 500;

std::string identifierOf(Daemon::ObjectID::Reader object) {
  const char kind = object.getKind() == Daemon::ObjectKind::FOLDER  ? 'i'
                    : object.getKind() == Daemon::ObjectKind::ALIAS ? 'a'
                                                                    : 'd';
  return std::string(1, kind) + ":" + std::to_string(object.getRawID());
}

NSErrorRef nextBatch(const ipc::Remote<Daemon>& daemon, const std::string& since, Batch& batch) {
  NSErrorRef failure;
  NSErrorRef transport = ipc::callAndWait(
      daemon, &Daemon::Client::enumerateWorkingSetChangesRequest,
      [&](auto params) {
        if (!since.empty()) params.initToken().setValue(wireData(since));
        params.setLimit(batchSize);
      },
      [&](auto results) {
        const auto result = results.getResult();
        if (result.isError()) {
          failure = ipc::decodeError(result.getError());
          return;
        }
        const auto changes = result.getChanges();
        for (const auto item : changes.getUpdated()) batch.updated.push_back(decodeItem(item));
        for (const auto gone : changes.getDeleted()) batch.deleted.push_back(identifierOf(gone));
        batch.token = stringFromWire(changes.getToken());
      });
  return transport ? transport : failure;
}

/// Nothing for what is no token's text.
std::optional<std::string> bytesOf(const std::string& text) {
  constexpr std::string_view digits = "0123456789abcdef";
  std::string bytes;
  if (text.size() % 2 != 0) return std::nullopt;
  for (std::size_t at = 0; at < text.size(); at += 2) {
    const std::size_t high = digits.find(text[at]);
    const std::size_t low = digits.find(text[at + 1]);
    if (high == std::string_view::npos || low == std::string_view::npos) return std::nullopt;
    bytes += static_cast<char>(high * 16 + low);
  }
  return bytes;
}

void printBatch(bool json, const Batch& batch) {
  for (const ItemFields& item : batch.updated) {
    if (json) {
      std::cout << jsonLine({{"event", "changed"}, {"item", itemJson(item)}});
    } else {
      std::cout << "changed  " << itemLine(item, OutputForm::Long);
    }
    std::cout << "\n";
  }
  for (const std::string& identifier : batch.deleted) {
    if (json) {
      std::cout << jsonLine({{"event", "removed"}, {"id", identifier}});
    } else {
      std::cout << "removed  " << identifier;
    }
    std::cout << "\n";
  }
}

void runChanges(CommandContext& context, const std::string& since) {
  auto token = bytesOf(since);
  if (!token) return context.fail(ExitCode::Usage, "--since takes what 'yomber changes' printed");
  DriveClient client(context.paths());
  NSErrorRef error;
  const auto daemon = client.daemon(&error);
  while (!error) {
    Batch batch;
    error = nextBatch(daemon, *token, batch);
    if (error || batch.token == *token) break;
    printBatch(context.json, batch);
    token = batch.token;
  }
  if (error) return context.fail(error);
  const std::string text = hexadecimal(std::as_bytes(std::span(*token)));
  context.print({{"token", text}}, "token    " + text);
}

}  // namespace

void addChangesCommand(CLI::App& app, CommandContext& context) {
  CLI::App* command = app.add_subcommand(
      "changes", "Show what has changed among favourite, tagged, shared and recently used items");
  auto since = std::make_shared<std::string>();
  command->add_option("--since", *since,
                      "The token that the last run ended with; without it, everything is shown");
  command->callback([&context, since] { runChanges(context, *since); });
}

}  // namespace yomber
