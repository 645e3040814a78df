#include "zarn/sharing_server.h"

#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/fileprovider/item_codec.h"
#include "platform/ipc/error_codec.h"
#include "platform/ipc/server_call.h"
#include "platform/ostrell/share_wire.h"
#include "zarn/daemon_errors.h"

namespace yomber {
namespace {

struct Nothing {};

void encodeShareResult(const RZShareRef& share, const NSErrorRef& error,
                       protocol::ShareResult::Builder result) {
  if (error) {
    ipc::encodeError(error, result.initError());
  } else {
    encodeShare(*share, result.initShare());
  }
}

void encodeText(const std::optional<std::string>& text, protocol::OptionalData::Builder builder) {
  if (text) builder.setValue(wireData(*text));
}

}  // namespace

template <typename Value, typename Context, typename Work, typename Answer>
kj::Promise<void> SharingServer::run(Context context, Work work, Answer answer) {
  struct Outcome {
    Value value{};
    NSErrorRef error;
  };
  context.releaseParams();
  context.allowCancellation();
  auto ready = drive_->firstScan->isOpen() ? kj::Promise<NSErrorRef>(NSErrorRef())
                                           : drive_->firstScan->wait();
  return ready
      .then([drive = drive_,
             work = std::move(work)](NSErrorRef failure) mutable -> kj::Promise<Outcome> {
        if (!failure) failure = drive->accountError();
        const auto shares = drive->engine->shares();
        if (!failure && !shares) {
          failure = rz_error(RZErrorNetworkUnavailable, "This drive has no record store.");
        }
        if (failure) {
          Outcome outcome;
          outcome.error = std::move(failure);
          return kj::mv(outcome);
        }
        return ipc::onPool([drive, shares, work = std::move(work)](const ipc::CancelFlag&) mutable {
          Outcome outcome;
          outcome.error = work(*shares, outcome.value);
          return outcome;
        });
      })
      .then([context, answer = std::move(answer)](Outcome outcome) mutable {
        answer(context.getResults(), outcome.value, outcome.error);
      });
}

kj::Promise<void> SharingServer::checkIfShareable(CheckIfShareableContext context) {
  return run<Nothing>(
      context,
      [id = context.getParams().getRawID()](Shares& shares, Nothing&) {
        return shares.checkShareable(id);
      },
      [](auto results, const Nothing&, const NSErrorRef& error) {
        results.setShareable(!error);
        ipc::encodeOptional(error, results.initFailure());
      });
}

kj::Promise<void> SharingServer::copyShare(CopyShareContext context) {
  return run<Shares::Copied>(
      context,
      [path = stringFromWire(context.getParams().getPath())](
          Shares& shares, Shares::Copied& copied) { return shares.copyShare(path, copied); },
      [](auto results, const Shares::Copied& copied, const NSErrorRef& error) {
        encodeShareResult(copied.share, error, results.initResult());
        encodeText(error ? std::nullopt : copied.rootPath, results.initRootPath());
      });
}

kj::Promise<void> SharingServer::newShare(NewShareContext context) {
  return run<RZShareRef>(
      context,
      [path = stringFromWire(context.getParams().getPath())](Shares& shares, RZShareRef& share) {
        return shares.newShare(path, share);
      },
      [](auto results, const RZShareRef& share, const NSErrorRef& error) {
        encodeShareResult(share, error, results.initResult());
      });
}

kj::Promise<void> SharingServer::saveShare(SaveShareContext context) {
  return run<RZShareRef>(
      context,
      [share = decodeShare(context.getParams().getShare())](Shares& shares, RZShareRef& saved) {
        return share ? shares.save(*share, saved) : invalidParameterError("share", "");
      },
      [](auto results, const RZShareRef& saved, const NSErrorRef& error) {
        encodeShareResult(saved, error, results.initResult());
      });
}

kj::Promise<void> SharingServer::destroyShare(DestroyShareContext context) {
  return run<Nothing>(
      context,
      [share = decodeShare(context.getParams().getShare())](Shares& shares, Nothing&) {
        return share ? shares.destroy(*share) : invalidParameterError("share", "");
      },
      [](auto results, const Nothing&, const NSErrorRef& error) {
        ipc::encodeOptional(error, results.initFailure());
      });
}

kj::Promise<void> SharingServer::copyShareURL(CopyShareURLContext context) {
  return run<Shares::Copied>(
      context,
      [path = stringFromWire(context.getParams().getPath())](
          Shares& shares, Shares::Copied& copied) { return shares.copyShare(path, copied); },
      [](auto results, const Shares::Copied& copied, const NSErrorRef& error) {
        encodeText(error ? std::nullopt : copied.share->URL(), results.initUrl());
        ipc::encodeOptional(error, results.initFailure());
      });
}

kj::Promise<void> SharingServer::copyShareToken(CopyShareTokenContext context) {
  return run<Shares::Tokens>(
      context,
      [path = stringFromWire(context.getParams().getPath())](
          Shares& shares, Shares::Tokens& tokens) { return shares.copyTokens(path, tokens); },
      [](auto results, const Shares::Tokens& tokens, const NSErrorRef& error) {
        results.setShareToken(wireText(tokens.share));
        results.setBaseToken(wireText(tokens.base));
        ipc::encodeOptional(error, results.initFailure());
      });
}

kj::Promise<void> SharingServer::refreshSharingState(RefreshSharingStateContext context) {
  return run<Nothing>(
      context,
      [identifier = stringFromWire(context.getParams().getIdentifier())](Shares& shares, Nothing&) {
        return shares.refresh(identifier);
      },
      [](auto results, const Nothing&, const NSErrorRef& error) {
        ipc::encodeOptional(error, results.initFailure());
      });
}

kj::Promise<void> SharingServer::shareOptions(ShareOptionsContext context) {
  return run<Shares::ItemOptions>(
      context,
      [identifier = stringFromWire(context.getParams().getIdentifier())](
          Shares& shares, Shares::ItemOptions& options) {
        return shares.options(identifier, options);
      },
      [](auto results, const Shares::ItemOptions& options, const NSErrorRef& error) {
        results.setIsShared(options.isShared);
        results.setMayWrite(options.mayWrite);
        results.setIsSharedItself(options.isSharedItself);
        encodeText(options.folderName, results.initFolderName());
        ipc::encodeOptional(error, results.initFailure());
      });
}

kj::Promise<void> SharingServer::acceptShare(AcceptShareContext context) {
  return run<std::string>(
      context,
      [url = stringFromWire(context.getParams().getUrl())](
          Shares& shares, std::string& identifier) { return shares.accept(url, identifier); },
      [](auto results, const std::string& identifier, const NSErrorRef& error) {
        if (!error) results.setIdentifier(wireText(identifier));
        ipc::encodeOptional(error, results.initFailure());
      });
}

kj::Promise<void> SharingServer::sharesWithMe(SharesWithMeContext context) {
  return run<std::vector<RZShareRef>>(
      context,
      [](Shares& shares, std::vector<RZShareRef>& found) { return shares.sharesWithMe(found); },
      [](auto results, const std::vector<RZShareRef>& found, const NSErrorRef& error) {
        auto shares = results.initShares(static_cast<unsigned>(found.size()));
        for (unsigned i = 0; i < shares.size(); ++i) encodeShare(*found[i], shares[i]);
        ipc::encodeOptional(error, results.initFailure());
      });
}

}  // namespace yomber
