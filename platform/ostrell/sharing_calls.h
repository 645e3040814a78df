#pragma once

#include <optional>
#include <string>
#include <tuple>
#include <utility>
#include <vector>

#include "platform/ostrell/content_calls.h"
#include "platform/ostrell/share_wire.h"

namespace yomber {

/// The part of the daemon's protocol that is about sharing, written once for both proxies as the
/// rest is (daemon_calls.h). For this room's sources only.
template <typename Base, typename Invoker>
class SharingCalls : public ContentCalls<Base, Invoker> {
 public:
  using ContentCalls<Base, Invoker>::ContentCalls;

  void checkIfItemIsShareableWithInode(std::uint64_t rawID,
                                       std::function<void(bool, NSErrorRef)> reply) override {
    using Result = std::pair<bool, NSErrorRef>;
    this->invoker().invoke(
        &Wire::Client::checkIfShareableRequest,
        [rawID](Wire::CheckIfShareableParams::Builder params) { params.setRawID(rawID); },
        [](const DaemonSessionRef&, const auto& results) {
          return Result(results.getShareable(), ipc::decodeOptional(results.getFailure()));
        },
        [reply = std::move(reply)](const Result& result) {
          if (reply) reply(result.first, result.second);
        });
  }

  void refreshSharingStateForItemIdentifier(const std::string& identifier,
                                            std::function<void(NSErrorRef)> reply) override {
    this->invoker().invoke(
        &Wire::Client::refreshSharingStateRequest,
        [identifier](Wire::RefreshSharingStateParams::Builder params) {
          params.setIdentifier(wireText(identifier));
        },
        [](const DaemonSessionRef&, const auto& results) {
          return ipc::decodeOptional(results.getFailure());
        },
        [reply = std::move(reply)](const NSErrorRef& failure) {
          if (reply) reply(failure);
        },
        Limit::None);
  }

  void getShareOptionsOfItemIdentifier(const std::string& identifier,
                                       QSSharingProtocol::ShareOptionsReply reply) override {
    this->invoker().invoke(
        &Wire::Client::shareOptionsRequest,
        [identifier](Wire::ShareOptionsParams::Builder params) {
          params.setIdentifier(wireText(identifier));
        },
        [](const DaemonSessionRef&, const auto& results) {
          const auto name = results.getFolderName();
          return std::tuple(
              results.getIsShared(), results.getMayWrite(), results.getIsSharedItself(),
              name.isValue() ? std::optional(stringFromWire(name.getValue())) : std::nullopt,
              ipc::decodeOptional(results.getFailure()));
        },
        [reply = std::move(reply)](const auto& result) {
          if (reply) std::apply(reply, result);
        });
  }

  void sharesWithMeWithReply(
      std::function<void(const std::vector<RZShareRef>&, NSErrorRef)> reply) override {
    using Result = std::pair<std::vector<RZShareRef>, NSErrorRef>;
    this->invoker().invoke(
        &Wire::Client::sharesWithMeRequest, [](auto) {},
        [](const DaemonSessionRef&, const auto& results) {
          Result result;
          for (const auto each : results.getShares()) {
            if (auto share = decodeShare(each)) result.first.push_back(std::move(share));
          }
          result.second = ipc::decodeOptional(results.getFailure());
          return result;
        },
        [reply = std::move(reply)](const Result& result) {
          if (reply) reply(result.first, result.second);
        });
  }

 private:
  using Wire = protocol::Sharing;
};

}  // namespace yomber
