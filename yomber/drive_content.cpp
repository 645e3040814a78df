#include "yomber/drive_content.h"

#include <utility>

#include "platform/fileprovider/item_codec.h"
#include "platform/ipc/call.h"
#include "platform/ipc/error_codec.h"
#include "platform/ostrell/daemon_question.h"
#include "yomber/patient_call.h"

namespace yomber {

namespace {

using protocol::Content;
using protocol::Control;

ipc::Remote<Content> contentOf(const ipc::Remote<protocol::Daemon>& daemon, NSErrorRef* error) {
  ipc::Remote<Content> content;
  NSErrorRef failure = ipc::callAndWait(
      daemon, &protocol::Daemon::Client::contentRequest, [](auto) {},
      [&](auto results) { content = ipc::Remote<Content>(results.getContent()); },
      {.timeout = daemonTimeLimit()});
  if (failure) storeError(error, std::move(failure));
  return content;
}

/// A call whose results are a failure or nothing.
template <typename Interface, typename Method, typename Fill>
NSErrorRef attempt(const ipc::Remote<Interface>& remote, Method method, const Fill& fill,
                   ipc::Patience::Question question) {
  NSErrorRef failure;
  NSErrorRef transport = callPatiently(
      remote, method, fill,
      [&](auto results) { failure = ipc::decodeOptional(results.getFailure()); },
      std::move(question));
  return transport ? transport : failure;
}

Transfer decodeTransfer(Content::Transfer::Reader reader) {
  Transfer transfer;
  transfer.path = stringFromWire(reader.getPath());
  transfer.kind = reader.getKind();
  transfer.total = reader.getTotal();
  transfer.done = reader.getDone();
  transfer.attempts = reader.getAttempts();
  transfer.failure = ipc::decodeOptional(reader.getFailure());
  if (reader.getNextAttempt().isValue()) {
    transfer.nextAttempt = NSDate::fromNanoseconds(reader.getNextAttempt().getValue());
  }
  return transfer;
}

}  // namespace

std::optional<DriveContent> DriveContent::open(DriveClient& client, NSErrorRef* error) {
  auto control = client.control(error);
  if (!control) return std::nullopt;
  const auto daemon = client.daemon(error);
  if (!daemon) return std::nullopt;
  auto content = contentOf(daemon, error);
  if (!content) return std::nullopt;
  return DriveContent(std::move(control), daemon, std::move(content));
}

NSErrorRef DriveContent::transfers(const ipc::Remote<protocol::Daemon>& daemon,
                                   Transfers& transfers) {
  NSErrorRef error;
  const auto content = contentOf(daemon, &error);
  if (!content) return error;
  return ipc::callAndWait(
      content, &Content::Client::transfersRequest, [](auto) {},
      [&](auto results) {
        for (const auto transfer : results.getTransfers()) {
          transfers.underWay.push_back(decodeTransfer(transfer));
        }
        transfers.waiting = results.getWaiting();
        transfers.finished = results.getFinished();
      });
}

NSErrorRef DriveContent::provide(const std::string& path, ipc::Remote<protocol::Need>* need) const {
  NSErrorRef failure;
  NSErrorRef transport = callPatiently(
      control_, &Control::Client::startProvidingRequest,
      [&](auto params) { params.setPath(wireData(path)); },
      [&](auto results) {
        failure = ipc::decodeOptional(results.getFailure());
        if (need != nullptr && results.hasNeed()) {
          *need = ipc::Remote<protocol::Need>(results.getNeed());
        }
      },
      questionForHost(control_));
  return transport ? transport : failure;
}

NSErrorRef DriveContent::stopProviding(const std::string& path) const {
  return attempt(
      control_, &Control::Client::stopProvidingRequest,
      [&](auto params) { params.setPath(wireData(path)); }, questionForHost(control_));
}

NSErrorRef DriveContent::state(const std::string& path, ContentState& state) const {
  NSErrorRef failure;
  NSErrorRef transport = ipc::callAndWait(
      content_, &Content::Client::contentStateRequest,
      [&](auto params) { params.setPath(wireData(path)); },
      [&](auto results) {
        failure = ipc::decodeOptional(results.getFailure());
        const auto found = results.getState();
        state.local = found.getLocal();
        state.upload = found.getUpload();
        state.isPinned = found.getPinned();
        state.size = found.getSize();
        state.localBytes = found.getLocalBytes();
        state.lastFailure = ipc::decodeOptional(found.getLastFailure());
      });
  return transport ? transport : failure;
}

NSErrorRef DriveContent::evict(const std::string& path) const {
  return attempt(
      content_, &Content::Client::evictRequest,
      [&](auto params) { params.setPath(wireData(path)); }, questionForDaemon(daemon_));
}

NSErrorRef DriveContent::setPinned(const std::string& path, bool pinned) const {
  return attempt(
      content_, &Content::Client::setPinnedRequest,
      [&](auto params) {
        params.setPath(wireData(path));
        params.setPinned(pinned);
      },
      questionForDaemon(daemon_));
}

NSErrorRef DriveContent::emptyTrash(std::uint64_t& removed) const {
  NSErrorRef failure;
  NSErrorRef transport = callPatiently(
      content_, &Content::Client::emptyTrashRequest, [](auto) {},
      [&](auto results) {
        removed = results.getRemoved();
        failure = ipc::decodeOptional(results.getFailure());
      },
      questionForDaemon(daemon_));
  return transport ? transport : failure;
}

NSErrorRef DriveContent::physicalLocation(const std::string& path, std::string& physical) const {
  NSErrorRef failure;
  NSErrorRef transport = ipc::callAndWait(
      content_, &Content::Client::physicalLocationRequest,
      [&](auto params) { params.setPath(wireData(path)); },
      [&](auto results) {
        const auto result = results.getResult();
        if (result.isError()) {
          failure = ipc::decodeError(result.getError());
        } else {
          physical = stringFromWire(result.getPath());
        }
      });
  return transport ? transport : failure;
}

}  // namespace yomber
