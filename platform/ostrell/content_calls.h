#pragma once

#include <string>
#include <utility>
#include <vector>

#include "platform/ostrell/content_protocol.h"
#include "platform/ostrell/content_wire.h"
#include "platform/ostrell/daemon_calls.h"

namespace yomber {

/// The part of the daemon's protocol that is about content, written once for both proxies as the
/// rest is (daemon_calls.h). For this room's sources only.
template <typename Base, typename Invoker>
class ContentCalls : public DaemonCalls<Base, Invoker> {
 public:
  using DaemonCalls<Base, Invoker>::DaemonCalls;

  void startDownloadingItemsAtURLs(const std::vector<NSURLRef>& urls, std::uint64_t options,
                                   QSErrorReply reply) override {
    std::vector<std::string> paths;
    for (const NSURLRef& url : urls) paths.push_back(pathOf(url));
    callForFailure(
        &Wire::Client::startDownloadingRequest,
        [paths = std::move(paths), options](Wire::StartDownloadingParams::Builder params) {
          auto list = params.initPaths(static_cast<unsigned>(paths.size()));
          for (unsigned i = 0; i < list.size(); ++i) list.set(i, wireData(paths[i]));
          params.setOptions(options);
        },
        std::move(reply));
  }

  void evictItemAtURL(const NSURLRef& url, QSErrorReply reply) override {
    callForFailure(
        &Wire::Client::evictRequest,
        [path = pathOf(url)](Wire::EvictParams::Builder params) { params.setPath(wireData(path)); },
        std::move(reply), Limit::None);
  }

  void setPinned(bool pinned, const NSURLRef& onItemAtURL, QSErrorReply reply) override {
    callForFailure(
        &Wire::Client::setPinnedRequest,
        [path = pathOf(onItemAtURL), pinned](Wire::SetPinnedParams::Builder params) {
          params.setPath(wireData(path));
          params.setPinned(pinned);
        },
        std::move(reply));
  }

  void contentStateOfItemAtURL(
      const NSURLRef& url,
      std::function<void(const QSContentState& state, NSErrorRef)> reply) override {
    using Result = std::pair<QSContentState, NSErrorRef>;
    this->invoker().invoke(
        &Wire::Client::contentStateRequest,
        [path = pathOf(url)](Wire::ContentStateParams::Builder params) {
          params.setPath(wireData(path));
        },
        [](const DaemonSessionRef&, const auto& results) {
          return Result(decodeContentState(results.getState()),
                        ipc::decodeOptional(results.getFailure()));
        },
        [reply = std::move(reply)](const Result& result) {
          if (reply) reply(result.first, result.second);
        });
  }

  void transfersWithReply(std::function<void(const QSTransfers& transfers)> reply) override {
    this->invoker().invoke(
        &Wire::Client::transfersRequest, [](auto) {},
        [](const DaemonSessionRef&, const auto& results) { return decodeTransfers(results); },
        [reply = std::move(reply)](const QSTransfers& transfers) {
          if (reply) reply(transfers);
        });
  }

  void capabilityToMoveItemAtURL(
      const NSURLRef& url, const NSURLRef& toURL,
      std::function<void(std::uint32_t capability, NSErrorRef)> reply) override {
    using Result = std::pair<std::uint32_t, NSErrorRef>;
    this->invoker().invoke(
        &Wire::Client::capabilityToMoveRequest,
        [source = pathOf(url),
         destination = pathOf(toURL)](Wire::CapabilityToMoveParams::Builder params) {
          params.setSource(wireData(source));
          params.setDestination(wireData(destination));
        },
        [](const DaemonSessionRef&, const auto& results) {
          return Result(results.getCapability(), ipc::decodeOptional(results.getFailure()));
        },
        [reply = std::move(reply)](const Result& result) {
          if (reply) reply(result.first, result.second);
        });
  }

  void trashItemAtURL(const NSURLRef& url, QSURLReply reply) override {
    callForLocation(
        &Wire::Client::trashRequest,
        [path = pathOf(url)](Wire::TrashParams::Builder params) { params.setPath(wireData(path)); },
        std::move(reply), Limit::None);
  }

  void putBackURLForTrashedItemAtURL(const NSURLRef& url, QSURLReply reply) override {
    callForLocation(
        &Wire::Client::putBackLocationRequest,
        [path = pathOf(url)](Wire::PutBackLocationParams::Builder params) {
          params.setPath(wireData(path));
        },
        std::move(reply));
  }

  void emptyTrashWithReply(std::function<void(std::uint64_t removed, NSErrorRef)> reply) override {
    using Result = std::pair<std::uint64_t, NSErrorRef>;
    this->invoker().invoke(
        &Wire::Client::emptyTrashRequest, [](auto) {},
        [](const DaemonSessionRef&, const auto& results) {
          return Result(results.getRemoved(), ipc::decodeOptional(results.getFailure()));
        },
        [reply = std::move(reply)](const Result& result) {
          if (reply) reply(result.first, result.second);
        },
        Limit::None);
  }

  void physicalURLForItemAtURL(const NSURLRef& url, QSURLReply reply) override {
    callForLocation(
        &Wire::Client::physicalLocationRequest,
        [path = pathOf(url)](Wire::PhysicalLocationParams::Builder params) {
          params.setPath(wireData(path));
        },
        std::move(reply));
  }

  void getContainerURLForID(const std::string& containerID,
                            RecreateDocuments recreateDocumentsIfNeeded,
                            std::function<void(NSURLRef url, const std::string& displayName,
                                               std::uint64_t generation, NSErrorRef error)>
                                reply) override {
    this->invoker().invoke(
        &Wire::Client::containerLocationRequest,
        [containerID, recreateDocumentsIfNeeded](Wire::ContainerLocationParams::Builder params) {
          params.setContainerID(wireText(containerID));
          params.setRecreateDocuments(recreateDocumentsIfNeeded == RecreateDocuments::Yes);
        },
        [](const DaemonSessionRef&, const auto& results) {
          return decodeContainerLocation(results);
        },
        [reply = std::move(reply)](const ContainerLocation& location) {
          if (reply) reply(location.url, location.displayName, location.generation, location.error);
        });
  }

  void setLastUsedDate(const std::optional<NSDate>& date, const NSURLRef& onItemAtURL,
                       QSErrorReply reply) override {
    callForFailure(
        &Wire::Client::setLastUsedDateRequest,
        [path = pathOf(onItemAtURL), date](Wire::SetLastUsedDateParams::Builder params) {
          params.setPath(wireData(path));
          if (date) params.getDate().setValue(date->nanoseconds());
        },
        std::move(reply));
  }

  void setFavoriteRank(const std::optional<std::int64_t>& rank, const NSURLRef& onItemAtURL,
                       QSErrorReply reply) override {
    callForFailure(
        &Wire::Client::setFavoriteRankRequest,
        [path = pathOf(onItemAtURL), rank](Wire::SetFavoriteRankParams::Builder params) {
          params.setPath(wireData(path));
          if (rank) params.getRank().setValue(*rank);
        },
        std::move(reply));
  }

  void setTagNames(const std::vector<std::string>& names, const NSURLRef& onItemAtURL,
                   QSErrorReply reply) override {
    callForFailure(
        &Wire::Client::setTagNamesRequest,
        [path = pathOf(onItemAtURL), names](Wire::SetTagNamesParams::Builder params) {
          params.setPath(wireData(path));
          auto list = params.initNames(static_cast<unsigned>(names.size()));
          for (unsigned i = 0; i < names.size(); ++i) list.set(i, wireText(names[i]));
        },
        std::move(reply));
  }

 private:
  using Wire = protocol::Content;

  static std::string pathOf(const NSURLRef& url) { return url ? url->path() : std::string(); }

  /// A call whose results are a failure or nothing.
  template <typename Method, typename Fill>
  void callForFailure(Method method, Fill fill, QSErrorReply reply, Limit limit = Limit::Links) {
    this->invoker().invoke(
        method, std::move(fill),
        [](const DaemonSessionRef&, const auto& results) {
          return ipc::decodeOptional(results.getFailure());
        },
        [reply = std::move(reply)](const NSErrorRef& failure) {
          if (reply) reply(failure);
        },
        limit);
  }

  /// A call whose results are a location or a failure.
  template <typename Method, typename Fill>
  void callForLocation(Method method, Fill fill, QSURLReply reply, Limit limit = Limit::Links) {
    using Result = std::pair<NSURLRef, NSErrorRef>;
    this->invoker().invoke(
        method, std::move(fill),
        [](const DaemonSessionRef&, const auto& results) {
          Result result;
          result.first = decodeLocation(results.getResult(), &result.second);
          return result;
        },
        [reply = std::move(reply)](const Result& result) {
          if (reply) reply(result.first, result.second);
        },
        limit);
  }
};

}  // namespace yomber
