#include "zarn/registrations.h"

#include <utility>
#include <vector>

#include "platform/fileprovider/constants.h"
#include "platform/fileprovider/item_codec.h"
#include "platform/ipc/call.h"

namespace yomber {

namespace {

/// Calls a method without results.
template <typename Interface, typename Method, typename Fill>
std::shared_ptr<CoalescedCall> makeCall(const ipc::Remote<Interface>& remote, Method method,
                                        Fill fill) {
  return std::make_shared<CoalescedCall>(
      [remote, method, fill](std::function<void(NSErrorRef)> answered) {
        (void)ipc::call(remote, method, fill,
                        [answered = std::move(answered)](NSErrorRef error, const auto*) {
                          answered(std::move(error));
                        });
      });
}

}  // namespace

Registrations::Token::~Token() {
  const auto owner = owner_.lock();
  if (!owner) return;
  Calls dropped;
  LockGuard guard(owner->mutex_);
  const auto found = owner->calls_.find(number_);
  if (found == owner->calls_.end()) return;
  dropped = std::move(found->second);
  owner->calls_.erase(found);
}

std::unique_ptr<Registrations::Token> Registrations::addObserver(
    ipc::Remote<protocol::LibraryObserver> observer) {
  using Client = protocol::LibraryObserver::Client;
  return add({.account = makeCall(observer, &Client::accountTokenDidChangeRequest, [](auto) {}),
              .containers = makeCall(observer, &Client::containerListDidChangeRequest, [](auto) {}),
              .workingSet = nullptr});
}

std::unique_ptr<Registrations::Token> Registrations::addHost(
    ipc::Remote<protocol::HostReceiver> host) {
  using Client = protocol::HostReceiver::Client;
  const auto fill = [](auto params) {
    params.setContainer(wireText(NSFileProviderWorkingSetContainerItemIdentifier));
  };
  return add({.account = nullptr,
              .containers = nullptr,
              .workingSet = makeCall(host, &Client::signalEnumeratorRequest, fill)});
}

std::unique_ptr<Registrations::Token> Registrations::add(Calls calls) {
  LockGuard guard(mutex_);
  calls_.emplace(++lastNumber_, std::move(calls));
  return std::make_unique<Token>(weak_from_this(), lastNumber_);
}

void Registrations::request(Kind kind) {
  std::vector<std::shared_ptr<CoalescedCall>> due;
  {
    LockGuard guard(mutex_);
    for (const auto& [number, calls] : calls_) {
      if (calls.*kind) due.push_back(calls.*kind);
    }
  }
  for (const auto& call : due) call->request();
}

void Registrations::accountTokenDidChange() { request(&Calls::account); }
void Registrations::containerListDidChange() { request(&Calls::containers); }
void Registrations::workingSetDidChange() { request(&Calls::workingSet); }

}  // namespace yomber
