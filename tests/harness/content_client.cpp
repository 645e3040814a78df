#include "tests/harness/content_client.h"

#include <stdexcept>

#include "platform/fileprovider/item_codec.h"
#include "platform/ipc/call.h"
#include "platform/ipc/error_codec.h"

namespace yomber::testing {

namespace {

using protocol::Content;
using protocol::Daemon;

void require(const NSErrorRef& error) {
  if (error) throw std::runtime_error("zarn cannot be asked: " + error->description());
}

/// For calls that answer a failure.
template <typename Method, typename Fill>
NSErrorRef askFailure(const ipc::Remote<Content>& content, Method method, const std::string& path,
                      Fill fill) {
  NSErrorRef failure;
  const auto lost = ipc::callAndWait(
      content, method,
      [&](auto params) {
        params.setPath(wireData(path));
        fill(params);
      },
      [&](auto results) { failure = ipc::decodeOptional(results.getFailure()); });
  return lost ? lost : failure;
}

template <typename Method>
ContentClient::Location askLocation(const ipc::Remote<Content>& content, Method method,
                                    const std::string& path) {
  ContentClient::Location location;
  const auto lost = ipc::callAndWait(
      content, method, [&](auto params) { params.setPath(wireData(path)); },
      [&](auto results) {
        const auto result = results.getResult();
        if (result.isPath()) location.path = stringFromWire(result.getPath());
        if (result.isError()) location.error = ipc::decodeError(result.getError());
      });
  if (lost) location.error = lost;
  return location;
}

void fillNothing(auto) {}

}  // namespace

ContentClient::ContentClient(const std::string& home) {
  NSErrorRef error;
  connection_ = ipc::Connection::connect(home + "/run/zarn.sock", &error);
  require(error);
  daemon_ = connection_->bootstrap<Daemon>();
  require(ipc::callAndWait(
      daemon_, &Daemon::Client::contentRequest, [](auto) {},
      [&](auto results) { content_ = ipc::Remote<Content>(results.getContent()); }));
}

ContentClient::State ContentClient::state(const std::string& path) const {
  State state;
  const auto lost = ipc::callAndWait(
      content_, &Content::Client::contentStateRequest,
      [&](auto params) { params.setPath(wireData(path)); },
      [&](auto results) {
        const auto wire = results.getState();
        state = {.local = wire.getLocal(),
                 .upload = wire.getUpload(),
                 .isPinned = wire.getPinned(),
                 .size = wire.getSize(),
                 .localBytes = wire.getLocalBytes(),
                 .lastFailure = ipc::decodeOptional(wire.getLastFailure()),
                 .error = ipc::decodeOptional(results.getFailure())};
      });
  if (lost) state.error = lost;
  return state;
}

NSErrorRef ContentClient::provide(const std::string& path, std::uint64_t options) const {
  return askFailure(content_, &Content::Client::startProvidingRequest, path,
                    [&](auto params) { params.setOptions(options); });
}

void ContentClient::provideAndForget(const std::string& path) const {
  auto handle = ipc::call(
      content_, &Content::Client::startProvidingRequest,
      [=](auto params) { params.setPath(wireData(path)); }, [](const NSErrorRef&, const auto*) {});
  handle.cancel();
}

NSErrorRef ContentClient::evict(const std::string& path) const {
  return askFailure(content_, &Content::Client::evictRequest, path,
                    [](auto params) { fillNothing(params); });
}

NSErrorRef ContentClient::setPinned(const std::string& path, bool isPinned) const {
  return askFailure(content_, &Content::Client::setPinnedRequest, path,
                    [&](auto params) { params.setPinned(isPinned); });
}

ContentClient::Location ContentClient::trash(const std::string& path) const {
  return askLocation(content_, &Content::Client::trashRequest, path);
}

ContentClient::Location ContentClient::putBackLocation(const std::string& path) const {
  return askLocation(content_, &Content::Client::putBackLocationRequest, path);
}

ContentClient::Emptied ContentClient::emptyTrash() const {
  Emptied emptied;
  const auto lost = ipc::callAndWait(
      content_, &Content::Client::emptyTrashRequest, [](auto) {},
      [&](auto results) {
        emptied = {.count = results.getRemoved(),
                   .error = ipc::decodeOptional(results.getFailure())};
      });
  if (lost) emptied.error = lost;
  return emptied;
}

NSErrorRef ContentClient::setTagNames(const std::string& path,
                                      const std::vector<std::string>& names) const {
  return askFailure(content_, &Content::Client::setTagNamesRequest, path, [&](auto params) {
    auto list = params.initNames(static_cast<unsigned>(names.size()));
    for (unsigned i = 0; i < list.size(); ++i) list.set(i, wireText(names[i]));
  });
}

std::string ContentClient::identifierAt(const std::string& path) const {
  std::string identifier;
  require(ipc::callAndWait(
      daemon_, &Daemon::Client::itemAtLocationRequest,
      [&](auto params) {
        params.setPath(wireData(path));
        params.setFakeFSEvent(true);
      },
      [&](auto results) {
        const auto result = results.getResult();
        if (result.isItem()) identifier = stringFromWire(result.getItem().getIdentifier());
      }));
  return identifier;
}

std::string ContentClient::locationOf(const std::string& identifier) const {
  std::string path;
  require(ipc::callAndWait(
      daemon_, &Daemon::Client::urlForItemIdentifierRequest,
      [&](auto params) { params.setIdentifier(wireText(identifier)); },
      [&](auto results) {
        const auto result = results.getResult();
        if (result.isPath()) path = stringFromWire(result.getPath());
      }));
  return path;
}

}  // namespace yomber::testing
