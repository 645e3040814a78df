#include "platform/ostrell/account.h"

#include <optional>

#include "platform/fileprovider/item_codec.h"
#include "platform/ipc/error_codec.h"
#include "platform/ostrell/daemon_link.h"
#include "platform/ostrell/daemon_wire.h"

namespace yomber {
namespace {

using Wire = protocol::Daemon;

/// Nil without an error: nobody is signed in.
QSAccountRef decodeAccount(Wire::AccountResult::Reader result, NSErrorRef* error) {
  switch (result.which()) {
    case Wire::AccountResult::NONE:
      return nullptr;
    case Wire::AccountResult::ACCOUNT: {
      const auto account = result.getAccount();
      std::optional<std::string> perApp = stringFromWire(account.getPerAppAccountIdentifier());
      if (perApp->empty()) perApp.reset();
      return std::make_shared<QSAccount>(stringFromWire(account.getName()), std::move(perApp));
    }
    case Wire::AccountResult::ERROR:
      storeError(error, ipc::decodeError(result.getError()));
      return nullptr;
  }
  storeError(error, unintelligibleReply("an account"));
  return nullptr;
}

}  // namespace

void QSAccount::startAccountTokenChangeObserverIfNeeded() {
  DaemonLink::current()->keepConnected();
}

QSAccountRef QSAccount::currentCachedLoggedInAccountWithError(NSErrorRef* error) {
  const auto link = DaemonLink::current();
  auto& cache = link->accountCache();
  if (const auto kept = cache.value()) return *kept;
  const auto generation = cache.generation();
  QSAccountRef account;
  NSErrorRef refusal;
  const NSErrorRef failure = link->callAndWait(
      &Wire::Client::accountRequest, [](auto) {},
      [&](const Wire::AccountResults::Reader& results) {
        account = decodeAccount(results.getResult(), &refusal);
      });
  if (failure || refusal) {
    storeError(error, failure ? failure : refusal);
    return nullptr;
  }
  cache.store(generation, account);
  return account;
}

}  // namespace yomber
