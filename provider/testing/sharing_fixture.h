#pragma once

#include <memory>
#include <optional>
#include <string>

#include "platform/ostrell/scripted_daemon.h"
#include "platform/rozzel/errors.h"
#include "provider/services/sharing_proxy.h"
#include "provider/testing/operations_fixture.h"

namespace yomber {

struct ShareAnswer {
  RZShareRef share;
  NSErrorRef error;
};

/// A proxy for the document "d:5", as a connection to the sharing service has one.
class SharingProxyTest : public OperationsTest {
 protected:
  SharingProxyTest() { addDocument(5, "five.txt"); }

  std::shared_ptr<QSSharingProxy> proxyFor(const std::string& identifier) {
    return QSSharingProxy::initWithFileProviderExtension(extension, identifier, queue);
  }
  NSProgressRef fetch() {
    return proxy->fetchShareWithCompletion(
        [into = shares](const RZShareRef& share, const NSErrorRef& error) {
          into->add({share, error});
        });
  }
  NSProgressRef save(const RZShareRef& share) {
    return proxy->saveShare(share,
                            [into = shares](const RZShareRef& saved, const NSErrorRef& error) {
                              into->add({saved, error});
                            });
  }
  NSProgressRef unshare() { return proxy->unshareWithCompletion(into(errors)); }
  /// The answer with that number, counted from 1, once it is there.
  ShareAnswer answer(std::size_t number = 1) {
    const auto all = shares->wait(number);
    EXPECT_EQ(all.size(), number);
    return all.size() < number ? ShareAnswer{} : all[number - 1];
  }
  void waitForOperations() { queue->waitUntilAllOperationsAreFinished(); }

  /// From now on the item's share, with the location of the shared folder if that is another.
  void shareIs(const RZShareRef& share, const std::optional<std::string>& rootPath = {}) {
    daemon.scriptSharing([&](ScriptedSharingAnswers& answers) {
      answers.copyShare = [=](const std::string&) {
        return ScriptedSharingAnswers::Share{.share = share, .rootPath = rootPath};
      };
    });
  }
  void copyingFailsWith(const NSErrorRef& error) {
    daemon.scriptSharing([&](ScriptedSharingAnswers& answers) {
      answers.copyShare = [=](const std::string&) {
        return ScriptedSharingAnswers::Share{.share = {}, .error = error};
      };
    });
  }
  void expectCancelled(const NSErrorRef& error) {
    EXPECT_EQ(domainAndCode(error), "NSCocoaErrorDomain 3072");
  }
  static std::string opening(const std::string& method, const std::string& identifier = "d:5") {
    return "[INFO] ┏# <QSSharingProxy " + identifier + "> -[QSSharingProxy " + method + "] " +
           identifier;
  }
  static std::string replyLine(const std::string& values) {
    return "[DEBUG] <QSSharingProxy d:5>: reply(" + values + ")";
  }

  const std::shared_ptr<Awaited<ShareAnswer>> shares = std::make_shared<Awaited<ShareAnswer>>();
  const std::shared_ptr<NSOperationQueue> queue = std::make_shared<NSOperationQueue>();
  std::shared_ptr<QSSharingProxy> proxy = proxyFor("d:5");
  const NSErrorRef refusal = rz_error(RZErrorPermissionFailure, "no");
};

}  // namespace yomber
