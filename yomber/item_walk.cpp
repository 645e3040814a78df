#include "yomber/item_walk.h"

#include <utility>
#include <vector>

namespace yomber {

NSErrorRef walkItem(DriveClient& client, const std::string& argument,
                    const std::function<bool(const WalkedItem& found)>& visit) {
  WalkedItem first;
  NSFileProviderItemIdentifier identifier;
  NSErrorRef error = client.identifierFor(argument, identifier);
  if (!error) error = client.location(identifier, first.path);
  // What the location shows is walked, which is not what has that identifier for a bookmark.
  if (!error && identifier != NSFileProviderRootContainerItemIdentifier) {
    error = client.identifierAt(first.path, identifier);
  }
  if (!error) error = client.item(identifier, first.item);
  if (error) return error;

  std::vector<WalkedItem> folders;
  bool goesOn = visit(first);
  if (first.item.kind == ItemKind::Folder) folders.push_back(std::move(first));
  while (!folders.empty() && goesOn) {
    const WalkedItem folder = std::move(folders.back());
    folders.pop_back();
    error = client.list(folder.item.identifier, protocol::SortOrder::NAME,
                        [&](const std::vector<ItemFields>& page) {
                          for (const ItemFields& item : page) {
                            WalkedItem found{item, folder.path + "/" + item.filename,
                                             folder.relative + "/" + item.filename};
                            goesOn = goesOn && visit(found);
                            if (item.kind == ItemKind::Folder) folders.push_back(std::move(found));
                          }
                          return goesOn;
                        });
    if (error) return error;
  }
  return nullptr;
}

}  // namespace yomber
