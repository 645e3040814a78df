#include "tests/harness/host_client.h"

#include <stdexcept>

#include "platform/fileprovider/item_codec.h"
#include "platform/ipc/call.h"
#include "platform/ipc/error_codec.h"

namespace yomber::testing {

namespace {

using protocol::Changes;
using protocol::Control;

void require(const NSErrorRef& error) {
  if (error) throw std::runtime_error("the host cannot be asked: " + error->description());
}

template <typename Method, typename Fill>
HostClient::Changed change(const ipc::Remote<Changes>& changes, Method method, const Fill& fill) {
  HostClient::Changed changed;
  const NSErrorRef lost = ipc::callAndWait(changes, method, fill, [&](auto results) {
    if (results.isItem()) changed.identifier = stringFromWire(results.getItem().getIdentifier());
    if (results.isError()) changed.error = ipc::decodeError(results.getError());
  });
  if (lost) changed.error = lost;
  return changed;
}

}  // namespace

HostClient::HostClient(const std::string& home) {
  NSErrorRef error;
  connection_ = ipc::Connection::connect(home + "/run/control.sock", &error);
  require(error);
  control_ = connection_->bootstrap<Control>();
  require(ipc::callAndWait(
      control_, &Control::Client::changesRequest, [](auto) {},
      [&](auto results) { changes_ = ipc::Remote<Changes>(results.getChanges()); }));
}

HostClient::Changed HostClient::importDocument(const std::string& path,
                                               const std::string& parent) const {
  return change(changes_, &Changes::Client::importDocumentRequest, [&](auto params) {
    params.setPath(wireData(path));
    params.setParent(wireText(parent));
  });
}

HostClient::Changed HostClient::createDirectory(const std::string& name,
                                                const std::string& parent) const {
  return change(changes_, &Changes::Client::createDirectoryRequest, [&](auto params) {
    params.setName(wireData(name));
    params.setParent(wireText(parent));
  });
}

HostClient::Changed HostClient::rename(const std::string& identifier,
                                       const std::string& name) const {
  return change(changes_, &Changes::Client::renameRequest, [&](auto params) {
    params.setIdentifier(wireText(identifier));
    params.setName(wireData(name));
  });
}

HostClient::Changed HostClient::reparent(const std::string& identifier,
                                         const std::string& parent) const {
  return change(changes_, &Changes::Client::reparentRequest, [&](auto params) {
    params.setIdentifier(wireText(identifier));
    params.setParent(wireText(parent));
  });
}

HostClient::Changed HostClient::trash(const std::string& identifier) const {
  return change(changes_, &Changes::Client::trashRequest,
                [&](auto params) { params.setIdentifier(wireText(identifier)); });
}

HostClient::Changed HostClient::untrash(const std::string& identifier) const {
  return change(changes_, &Changes::Client::untrashRequest,
                [&](auto params) { params.setIdentifier(wireText(identifier)); });
}

HostClient::Changed HostClient::remove(const std::string& identifier) const {
  return change(changes_, &Changes::Client::deleteRequest,
                [&](auto params) { params.setIdentifier(wireText(identifier)); });
}

NSErrorRef HostClient::provide(const std::string& path, Need& need) const {
  NSErrorRef failure;
  const NSErrorRef lost = ipc::callAndWait(
      control_, &Control::Client::startProvidingRequest,
      [&](auto params) { params.setPath(wireData(path)); },
      [&](auto results) {
        failure = ipc::decodeOptional(results.getFailure());
        if (results.hasNeed()) need = Need(results.getNeed());
      });
  return lost ? lost : failure;
}

void HostClient::provideAndForget(const std::string& path) const {
  auto handle = ipc::call(
      control_, &Control::Client::startProvidingRequest,
      [=](auto params) { params.setPath(wireData(path)); }, [](const NSErrorRef&, const auto*) {});
  handle.cancel();
}

NSErrorRef HostClient::stopProviding(const std::string& path) const {
  NSErrorRef failure;
  const NSErrorRef lost = ipc::callAndWait(
      control_, &Control::Client::stopProvidingRequest,
      [&](auto params) { params.setPath(wireData(path)); },
      [&](auto results) { failure = ipc::decodeOptional(results.getFailure()); });
  return lost ? lost : failure;
}

std::optional<std::vector<std::string>> HostClient::list(const std::string& folder) const {
  ipc::Remote<protocol::Listing> listing;
  NSErrorRef failure = ipc::callAndWait(
      control_, &Control::Client::listRequest,
      [&](auto params) { params.setContainer(wireText(folder)); },
      [&](auto results) { listing = ipc::Remote<protocol::Listing>(results.getListing()); });
  std::vector<std::string> identifiers;
  for (bool isMore = true; !failure && isMore;) {
    const NSErrorRef lost = ipc::callAndWait(
        listing, &protocol::Listing::Client::nextRequest, [](auto) {},
        [&](auto results) {
          const auto result = results.getResult();
          if (result.isError()) {
            failure = ipc::decodeError(result.getError());
            return;
          }
          for (const auto item : result.getPage().getItems()) {
            identifiers.push_back(stringFromWire(item.getIdentifier()));
          }
          isMore = result.getPage().getMore();
        });
    if (lost) failure = lost;
  }
  if (failure) return std::nullopt;
  return identifiers;
}

}  // namespace yomber::testing
