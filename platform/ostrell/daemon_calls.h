#pragma once

#include <map>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "platform/fileprovider/item_codec.h"
#include "platform/ipc/error_codec.h"
#include "platform/ostrell/daemon_connection.h"
#include "platform/ostrell/daemon_link.h"
#include "platform/ostrell/daemon_wire.h"
#include "platform/ostrell/item_update_sender.h"

namespace yomber {

/// How long a call may take.
enum class Limit {
  Links,  ///< the link's time limit
  None,   ///< as long as its work takes, while the daemon answers at all
};

/// The daemon's protocol, written once for both proxies: what each call sends and how its reply is
/// read. For this room's sources only.
///
/// `Invoker` says how a call is made. Its
///   invoke(method, fill, decode, reply, limit)
/// calls `method` with parameters from `fill`, takes the value that `decode(session, results)`
/// makes of the results on the loop thread, and calls `reply(value)` where replies belong. A
/// transport failure it keeps to itself.
template <typename Base, typename Invoker>
class DaemonCalls : public Base {
 public:
  explicit DaemonCalls(Invoker invoker) : invoker_(std::move(invoker)) {}

  void getURLForItemIdentifier(const std::string& identifier,
                               std::function<void(NSURLRef, NSErrorRef)> reply) override {
    using Result = std::pair<NSURLRef, NSErrorRef>;
    invoker_.invoke(
        &Wire::Client::urlForItemIdentifierRequest,
        [identifier](Wire::UrlForItemIdentifierParams::Builder params) {
          params.setIdentifier(wireText(identifier));
        },
        [](const DaemonSessionRef&, const auto& results) {
          Result result;
          result.first = decodeLocation(results.getResult(), &result.second);
          return result;
        },
        [reply = std::move(reply)](const Result& result) {
          if (reply) reply(result.first, result.second);
        });
  }

  void enumerateItemsInFolder(const QSFileObjectIDRef& folder, std::uint8_t sortOrder,
                              std::uint64_t offset, std::uint32_t limit,
                              QSPageHandler completion) override {
    invoker_.invoke(
        &Wire::Client::enumerateItemsInFolderRequest,
        [=](Wire::EnumerateItemsInFolderParams::Builder params) {
          if (folder) {
            encodeObjectID(*folder, params.getFolder().initObject());
          } else {
            params.getFolder().setRoot();
          }
          fillPage(params, sortOrder, offset, limit);
        },
        decodePage, deliverPage(std::move(completion)));
  }

  void enumerateAllFoldersWithSortOrder(std::uint8_t sortOrder, std::uint64_t offset,
                                        std::uint32_t limit, QSPageHandler completion) override {
    invoker_.invoke(
        &Wire::Client::enumerateAllFoldersRequest,
        [=](Wire::EnumerateAllFoldersParams::Builder params) {
          fillPage(params, sortOrder, offset, limit);
        },
        decodePage, deliverPage(std::move(completion)));
  }

  void currentNotifRankWithReply(
      std::function<void(std::uint64_t rank, NSErrorRef)> reply) override {
    using Result = std::pair<std::uint64_t, NSErrorRef>;
    invoker_.invoke(
        &Wire::Client::currentNotifRankRequest, [](auto) {},
        [](const DaemonSessionRef&, const auto& results) {
          return Result(results.getRank(), ipc::decodeOptional(results.getFailure()));
        },
        [reply = std::move(reply)](const Result& result) {
          if (reply) reply(result.first, result.second);
        });
  }

  void enumerateWorkingSetChangesFromChangeToken(
      const NSDataRef& token, std::uint32_t limit,
      std::function<void(const QSQueryItems& updated, const std::vector<QSFileObjectIDRef>& deleted,
                         NSDataRef token, NSErrorRef)>
          completion) override {
    invoker_.invoke(
        &Wire::Client::enumerateWorkingSetChangesRequest,
        [=](Wire::EnumerateWorkingSetChangesParams::Builder params) {
          if (token) params.getToken().setValue(wireData(token->bytes()));
          params.setLimit(limit);
        },
        decodeWorkingSet,
        [completion = std::move(completion)](const WorkingSet& set) {
          if (completion) completion(set.updated, set.deleted, set.token, set.error);
        });
  }

  void resolveFileObjectIDsToContentRecordIDs(
      const std::vector<QSFileObjectIDRef>& fileObjectIDs,
      std::function<void(QSContentRecordIDsRef recordIDs, NSErrorRef)> reply) override {
    using Result = std::pair<QSContentRecordIDsRef, NSErrorRef>;
    invoker_.invoke(
        &Wire::Client::contentRecordsRequest,
        [fileObjectIDs](Wire::ContentRecordsParams::Builder params) {
          auto objects = params.initObjects(static_cast<unsigned>(fileObjectIDs.size()));
          for (unsigned i = 0; i < objects.size(); ++i) {
            encodeObjectID(*fileObjectIDs[i], objects[i]);
          }
        },
        [](const DaemonSessionRef&, const auto& results) {
          Result result;
          result.first = decodeContentRecords(results.getResult(), &result.second);
          return result;
        },
        [reply = std::move(reply)](const Result& result) {
          if (reply) reply(result.first, result.second);
        });
  }

  void getItemUpdateSenderWithReceiver(
      std::shared_ptr<QSItemNotificationReceiving> receiver,
      std::function<void(QSItemUpdateSenderRef sender,
                         const std::map<std::string, std::string>& info, NSErrorRef)>
          reply) override {
    using Result = std::pair<QSItemUpdateSenderRef, NSErrorRef>;
    auto subscription = std::make_shared<ItemSubscription>(invoker_.link());
    invoker_.invoke(
        &Wire::Client::getItemUpdateSenderRequest,
        [receiver = std::weak_ptr<QSItemNotificationReceiving>(receiver),
         subscription](Wire::GetItemUpdateSenderParams::Builder params) {
          params.setReceiver(makeItemReceiver(receiver.lock(), subscription));
        },
        [subscription](const DaemonSessionRef& session, const auto& results) {
          return beginSubscription(subscription, session, results.getResult());
        },
        [reply = std::move(reply)](const Result& result) {
          if (reply) reply(result.first, {}, result.second);
        });
  }

 protected:
  Invoker& invoker() { return invoker_; }
  const Invoker& invoker() const { return invoker_; }

 private:
  using Wire = protocol::Daemon;

  struct Page {
    QSQueryItems items;
    std::uint64_t nextOffset = 0;
    NSErrorRef error;
  };
  struct WorkingSet {
    QSQueryItems updated;
    std::vector<QSFileObjectIDRef> deleted;
    NSDataRef token;
    NSErrorRef error;
  };

  template <typename Params>
  static void fillPage(Params& params, std::uint8_t sortOrder, std::uint64_t offset,
                       std::uint32_t limit) {
    params.setSortOrder(sortOrder == QSSortOrderByDate ? protocol::SortOrder::DATE
                                                       : protocol::SortOrder::NAME);
    params.setOffset(offset);
    params.setLimit(limit);
  }

  static constexpr auto decodePage = [](const DaemonSessionRef&, const auto& results) {
    Page page;
    const auto result = results.getResult();
    if (result.isPage()) {
      page.items = decodeQueryItems(result.getPage().getItems());
      page.nextOffset = result.getPage().getNextOffset();
    } else if (result.isError()) {
      page.error = ipc::decodeError(result.getError());
    } else {
      page.error = unintelligibleReply("a page");
    }
    return page;
  };

  static auto deliverPage(QSPageHandler completion) {
    return [completion = std::move(completion)](const Page& page) {
      if (completion) completion(page.items, page.nextOffset, page.error);
    };
  }

  static constexpr auto decodeWorkingSet = [](const DaemonSessionRef&, const auto& results) {
    WorkingSet set;
    const auto result = results.getResult();
    if (result.isChanges()) {
      const auto changes = result.getChanges();
      set.updated = decodeQueryItems(changes.getUpdated());
      for (const auto each : changes.getDeleted()) {
        if (auto object = decodeObjectID(each)) set.deleted.push_back(std::move(object));
      }
      set.token = NSData::dataWithString(stringFromWire(changes.getToken()));
    } else if (result.isError()) {
      set.error = ipc::decodeError(result.getError());
    } else {
      set.error = unintelligibleReply("a list of changes");
    }
    return set;
  };

  static std::pair<QSItemUpdateSenderRef, NSErrorRef> beginSubscription(
      const std::shared_ptr<ItemSubscription>& subscription, const DaemonSessionRef& session,
      Wire::SenderResult::Reader result) {
    if (result.isError()) return {nullptr, ipc::decodeError(result.getError())};
    if (!result.isSender()) return {nullptr, unintelligibleReply("a sender")};
    subscription->begin(session, ipc::Remote<protocol::ItemSender>(result.getSender()));
    session->addLossObserver(subscription);
    return {makeItemUpdateSender(subscription), nullptr};
  }

  Invoker invoker_;
};

}  // namespace yomber
