#include "yomber/drive_changes.h"

#include <memory>
#include <utility>

#include "platform/fileprovider/constants.h"
#include "platform/fileprovider/item_codec.h"
#include "platform/fileprovider/wire_item.h"
#include "platform/ipc/call.h"
#include "platform/ipc/error_codec.h"
#include "yomber/patient_call.h"

namespace yomber {

namespace {

using protocol::Changes;

}  // namespace

std::optional<DriveChanges> DriveChanges::open(DriveClient& client, NSErrorRef* error) {
  registerItemsInErrors();
  const auto control = client.control(error);
  if (!control) return std::nullopt;
  ipc::Remote<Changes> changes;
  NSErrorRef failure = ipc::callAndWait(
      control, &protocol::Control::Client::changesRequest, [](auto) {},
      [&](auto results) { changes = ipc::Remote<Changes>(results.getChanges()); });
  if (failure) {
    storeError(error, std::move(failure));
    return std::nullopt;
  }
  return DriveChanges(control, std::move(changes));
}

template <typename Method, typename Fill>
ChangeResult DriveChanges::change(Method method, const Fill& fill) const {
  ChangeResult result;
  NSErrorRef transport = callPatiently(
      remote_, method, fill,
      [&](auto changed) {
        if (changed.isItem()) result.item = decodeItem(changed.getItem());
        if (changed.isError()) result.error = ipc::decodeError(changed.getError());
      },
      questionForHost(control_));
  if (transport) result.error = std::move(transport);
  return result;
}

ChangeResult DriveChanges::importDocument(const std::string& path,
                                          const std::string& parent) const {
  return change(&Changes::Client::importDocumentRequest, [&](auto params) {
    params.setPath(wireData(path));
    params.setParent(wireText(parent));
  });
}

ChangeResult DriveChanges::createDirectory(const std::string& name,
                                           const std::string& parent) const {
  return change(&Changes::Client::createDirectoryRequest, [&](auto params) {
    params.setName(wireData(name));
    params.setParent(wireText(parent));
  });
}

ChangeResult DriveChanges::rename(const std::string& identifier, const std::string& name) const {
  return change(&Changes::Client::renameRequest, [&](auto params) {
    params.setIdentifier(wireText(identifier));
    params.setName(wireData(name));
  });
}

ChangeResult DriveChanges::reparent(const std::string& identifier, const std::string& parent,
                                    const std::optional<std::string>& newName) const {
  return change(&Changes::Client::reparentRequest, [&](auto params) {
    params.setIdentifier(wireText(identifier));
    params.setParent(wireText(parent));
    if (newName) params.initNewName().setValue(wireData(*newName));
  });
}

ChangeResult DriveChanges::trash(const std::string& identifier) const {
  return change(&Changes::Client::trashRequest,
                [&](auto params) { params.setIdentifier(wireText(identifier)); });
}

ChangeResult DriveChanges::untrash(const std::string& identifier, const std::string& parent) const {
  return change(&Changes::Client::untrashRequest, [&](auto params) {
    params.setIdentifier(wireText(identifier));
    params.setParent(wireText(parent));
  });
}

ChangeResult DriveChanges::remove(const std::string& identifier) const {
  return change(&Changes::Client::deleteRequest,
                [&](auto params) { params.setIdentifier(wireText(identifier)); });
}

ChangeResult DriveChanges::setLastUsedDate(const std::string& identifier,
                                           std::optional<NSDate> date) const {
  return change(&Changes::Client::setLastUsedDateRequest, [&](auto params) {
    params.setIdentifier(wireText(identifier));
    if (date) params.initDate().setValue(date->nanoseconds());
  });
}

ChangeResult DriveChanges::setTags(const std::string& identifier,
                                   const std::vector<std::string>& labels) const {
  return change(&Changes::Client::setTagsRequest, [&](auto params) {
    params.setIdentifier(wireText(identifier));
    auto list = params.initLabels(static_cast<unsigned>(labels.size()));
    for (unsigned i = 0; i < list.size(); ++i) list.set(i, wireText(labels[i]));
  });
}

ChangeResult DriveChanges::setFavoriteRank(const std::string& identifier,
                                           std::optional<std::int64_t> rank) const {
  return change(&Changes::Client::setFavoriteRankRequest, [&](auto params) {
    params.setIdentifier(wireText(identifier));
    if (rank) params.initRank().setValue(*rank);
  });
}

ChangeResult DriveChanges::defaultApplicationContainer(const std::string& bundle) const {
  return change(&Changes::Client::defaultApplicationContainerRequest,
                [&](auto params) { params.setBundleIdentifier(wireText(bundle)); });
}

Clash clashIn(const NSErrorRef& error) {
  Clash clash;
  if (!error) return clash;
  if (error->is(NSFileProviderErrorDomain, NSFileProviderErrorFilenameCollision)) {
    clash.isClash = true;
    const auto found = error->userInfo().find(NSFileProviderErrorItemKey);
    if (found == error->userInfo().end()) return clash;
    const auto* const object = std::get_if<NSObjectRef>(&found->second);
    const auto item =
        object ? std::dynamic_pointer_cast<const NSFileProviderItem>(*object) : nullptr;
    if (item) clash.item = item->fields();
  } else {
    clash.isClash = error->is(NSCocoaErrorDomain, NSFileWriteFileExistsError);
  }
  return clash;
}

}  // namespace yomber
