#include "platform/ostrell/container.h"

#include <algorithm>
#include <utility>

#include "platform/fileprovider/item_codec.h"
#include "platform/launchservices/application_icon.h"
#include "platform/ostrell/daemon_link.h"
#include "platform/ostrell/errors.h"

namespace yomber {
namespace {

using Wire = protocol::Daemon;
using Containers = std::map<std::string, QSContainerRef>;

Containers decodeContainers(capnp::List<Wire::Container>::Reader reader) {
  Containers containers;
  for (const auto each : reader) {
    QSContainer::Fields fields;
    fields.containerID = stringFromWire(each.getContainerID());
    fields.displayName = stringFromWire(each.getDisplayName());
    fields.applicationID = stringFromWire(each.getApplicationID());
    fields.iconName = stringFromWire(each.getIconName());
    fields.documentsURL = NSURL::fileURLWithPath(stringFromWire(each.getDocuments()));
    auto containerID = fields.containerID;
    containers.insert_or_assign(std::move(containerID),
                                std::make_shared<QSContainer>(std::move(fields)));
  }
  return containers;
}

/// Nil when the daemon cannot be asked.
DaemonLink::ContainerMap snapshot() {
  const auto link = DaemonLink::current();
  auto& cache = link->containerCache();
  if (const auto kept = cache.value()) return *kept;
  link->keepConnected();
  const auto generation = cache.generation();
  DaemonLink::ContainerMap containers;
  const NSErrorRef failure = link->callAndWait(
      &Wire::Client::containersRequest, [](auto) {},
      [&](const Wire::ContainersResults::Reader& results) {
        containers = std::make_shared<const Containers>(decodeContainers(results.getContainers()));
      });
  if (failure) {
    log_error(qsc_default_log(), "[ERROR] can't get the list of containers: %@", failure);
    return nullptr;
  }
  cache.store(generation, containers);
  return containers;
}

}  // namespace

NSDataRef QSContainer::bestFittingImageDataForSize(CGSize size,
                                                   bool* shouldTransformToAppIcon) const {
  if (iconName().empty()) return nullptr;
  const auto icon = bestFittingIcon(iconName(), std::min(size.width, size.height));
  if (shouldTransformToAppIcon != nullptr) *shouldTransformToAppIcon = icon && icon->isBare;
  return icon ? icon->data : nullptr;
}

std::map<std::string, QSContainerRef> QSContainer::allContainersByContainerID() {
  const auto containers = snapshot();
  return containers ? *containers : Containers();
}

std::vector<QSContainerRef> QSContainer::allContainers() {
  std::vector<QSContainerRef> list;
  if (const auto containers = snapshot()) {
    list.reserve(containers->size());
    for (const auto& [id, container] : *containers) list.push_back(container);
  }
  return list;
}

}  // namespace yomber
