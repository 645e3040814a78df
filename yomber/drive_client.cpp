#include "yomber/drive_client.h"

#include "platform/fileprovider/constants.h"
#include "platform/fileprovider/item_codec.h"
#include "platform/foundation/data.h"
#include "platform/foundation/url.h"
#include "platform/ipc/call.h"
#include "platform/ipc/error_codec.h"
#include "platform/ostrell/file_object_id.h"
#include "yomber/failure_text.h"

namespace yomber {

namespace {

std::string stringOf(capnp::Data::Reader data) {
  return {reinterpret_cast<const char*>(data.begin()), data.size()};
}

capnp::Data::Reader dataOf(const std::string& bytes) {
  return {reinterpret_cast<const kj::byte*>(bytes.data()), bytes.size()};
}

/// Connects once, and again when the peer has been started afresh meanwhile.
std::shared_ptr<ipc::Connection> connected(std::shared_ptr<ipc::Connection>& connection,
                                           const std::string& socket, NSErrorRef* error) {
  if (connection && connection->isConnected()) return connection;
  NSErrorRef failure;
  connection = ipc::Connection::connect(socket, &failure);
  if (!connection) {
    // Whatever the system's reason is, to the caller the drive is not there.
    storeError(error, NSError::errorWithDomain(NSCocoaErrorDomain, NSXPCConnectionInvalid,
                                               {{NSLocalizedDescriptionKey, failureText(failure)},
                                                {NSUnderlyingErrorKey, failure}}));
  }
  return connection;
}

}  // namespace

ipc::Remote<protocol::Control> DriveClient::control(NSErrorRef* error) {
  const auto connection = connected(controlConnection_, paths_.controlSocket, error);
  return connection ? connection->bootstrap<protocol::Control>() : ipc::Remote<protocol::Control>();
}

ipc::Remote<protocol::Daemon> DriveClient::daemon(NSErrorRef* error) {
  const auto connection = connected(daemonConnection_, paths_.daemonSocket, error);
  return connection ? connection->bootstrap<protocol::Daemon>() : ipc::Remote<protocol::Daemon>();
}

template <typename Method, typename Fill, typename Take>
NSErrorRef DriveClient::ask(Method method, const Fill& fill, const Take& take) {
  NSErrorRef failure;
  const auto remote = control(&failure);
  if (failure) return failure;
  const NSErrorRef transport = ipc::callAndWait(remote, method, fill, [&](auto results) {
    const auto result = results.getResult();
    if (result.isError()) {
      failure = ipc::decodeError(result.getError());
    } else {
      take(result);
    }
  });
  return transport ? transport : failure;
}

NSErrorRef DriveClient::item(const NSFileProviderItemIdentifier& identifier, ItemFields& item) {
  return ask(
      &protocol::Control::Client::itemRequest,
      [&](auto params) { params.setIdentifier(identifier); },
      [&](auto result) { item = decodeItem(result.getItem()); });
}

NSErrorRef DriveClient::location(const NSFileProviderItemIdentifier& identifier,
                                 std::string& path) {
  return ask(
      &protocol::Control::Client::locateRequest,
      [&](auto params) { params.setIdentifier(identifier); },
      [&](auto result) { path = stringOf(result.getPath()); });
}

NSErrorRef DriveClient::identifierAt(const std::string& path,
                                     NSFileProviderItemIdentifier& identifier) {
  return ask(
      &protocol::Control::Client::identifyRequest,
      [&](auto params) { params.setPath(dataOf(path)); },
      [&](auto result) { identifier = result.getIdentifier().cStr(); });
}

NSErrorRef DriveClient::identifierFor(const std::string& argument,
                                      NSFileProviderItemIdentifier& identifier) {
  if (argument.empty() || argument == "/" ||
      argument == NSFileProviderRootContainerItemIdentifier) {
    identifier = NSFileProviderRootContainerItemIdentifier;
    return nullptr;
  }
  if (QSFileObjectID::fileObjectIDWithString(argument)) {
    identifier = argument;
    return nullptr;
  }
  const NSURLRef absolute = NSURL::fileURLWithPath(argument);
  if (absolute && isPathBelow(absolute->path(), paths_.tree))
    return identifierAt(absolute->path(), identifier);

  std::string root;
  if (NSErrorRef error = location(NSFileProviderRootContainerItemIdentifier, root)) return error;
  const NSURLRef fromRoot = NSURL::fileURLWithPath(root + "/" + argument);
  if (!fromRoot) return NSError::errorWithErrno(EINVAL, argument);
  if (fromRoot->path() == root) {
    identifier = NSFileProviderRootContainerItemIdentifier;
    return nullptr;
  }
  return identifierAt(fromRoot->path(), identifier);
}

NSErrorRef DriveClient::list(
    const NSFileProviderItemIdentifier& container, protocol::SortOrder order,
    const std::function<bool(const std::vector<ItemFields>& page)>& onPage) {
  NSErrorRef failure;
  const auto remote = control(&failure);
  if (failure) return failure;
  ipc::Remote<protocol::Listing> listing;
  NSErrorRef transport = ipc::callAndWait(
      remote, &protocol::Control::Client::listRequest,
      [&](auto params) {
        params.setContainer(container);
        params.setSortOrder(order);
      },
      [&](auto results) { listing = ipc::Remote<protocol::Listing>(results.getListing()); });
  bool more = true;
  while (!transport && !failure && more) {
    std::vector<ItemFields> page;
    transport = ipc::callAndWait(
        listing, &protocol::Listing::Client::nextRequest, [](auto) {},
        [&](auto results) {
          const auto result = results.getResult();
          if (result.isError()) {
            failure = ipc::decodeError(result.getError());
            return;
          }
          page.reserve(result.getPage().getItems().size());
          for (const auto item : result.getPage().getItems()) page.push_back(decodeItem(item));
          more = result.getPage().getMore();
        });
    if (!transport && !failure && !onPage(page)) return nullptr;
  }
  return transport ? transport : failure;
}

}  // namespace yomber
