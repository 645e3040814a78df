#pragma once

#include <atomic>
#include <chrono>
#include <deque>
#include <map>
#include <memory>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "platform/foundation/drive_paths.h"
#include "platform/foundation/lock.h"
#include "platform/ipc/connection.h"
#include "platform/ipc/event_loop.h"
#include "platform/ostrell/locations.h"
#include "platform/ostrell/scripted_daemon.h"
#include "protocols/daemon.capnp.h"

namespace yomber {

/// What the scripted daemon's control and its servers share.
struct ScriptedDaemon::State : std::enable_shared_from_this<ScriptedDaemon::State> {
  explicit State(const std::string& home);

  const DrivePaths paths;
  const DriveLocations locations;

  Mutex mutex;
  Condition condition;
  std::uint64_t events GUARDED_BY(mutex) = 0;
  Answers answers GUARDED_BY(mutex);
  ScriptedContentAnswers contentAnswers GUARDED_BY(mutex);
  ScriptedSharingAnswers sharingAnswers GUARDED_BY(mutex);
  std::vector<Call> calls GUARDED_BY(mutex);
  std::set<std::string> held GUARDED_BY(mutex);
  std::map<std::string, std::pair<ItemFields, std::string>> items GUARDED_BY(mutex);
  std::vector<Container> containers GUARDED_BY(mutex);
  std::vector<bool> isSubscribed GUARDED_BY(mutex);
  std::size_t observerCount GUARDED_BY(mutex) = 0;
  std::map<std::uint64_t, ipc::Connection::Ref> connections GUARDED_BY(mutex);
  std::uint64_t nextConnection GUARDED_BY(mutex) = 0;
  int listener GUARDED_BY(mutex) = -1;

  // Loop thread only.
  std::map<std::string, std::vector<kj::Own<kj::PromiseFulfiller<void>>>> waiting;
  std::deque<kj::Maybe<protocol::ItemReceiver::Client>> receivers;
  std::map<const void*, protocol::LibraryObserver::Client> observers;

  // Of the thread that controls.
  std::thread acceptor;

  /// Wakes those who wait for something to happen.
  void didHappen() REQUIRES(mutex) {
    ++events;
    condition.notifyAll();
  }
  /// Records a call whose answer is made; done when the answer may be sent. Loop thread.
  kj::Promise<void> answered(const std::string& method, std::vector<std::string> arguments);
  /// The same; records "….dropped" besides when the call was given up before its answer was sent.
  kj::Promise<void> answeredUnlessDropped(const std::string& method,
                                          std::vector<std::string> arguments);
  [[nodiscard]] Answers currentAnswers();
  [[nodiscard]] ScriptedContentAnswers currentContentAnswers();
  [[nodiscard]] ScriptedSharingAnswers currentSharingAnswers();

  // What is answered where the test gave no answer.
  Location locationOf(const std::string& identifier);
  Item itemAt(const std::string& path);
  Item containerItem(const std::string& containerID);
  Page page(const std::function<bool(const ItemFields&)>& belongs, std::uint8_t sortOrder,
            std::uint64_t offset, std::uint32_t limit);
};

/// The daemon's side of one connection. Loop thread.
[[nodiscard]] protocol::Daemon::Client makeScriptedServer(
    std::shared_ptr<ScriptedDaemon::State> state);
[[nodiscard]] protocol::Content::Client makeScriptedContent(
    std::shared_ptr<ScriptedDaemon::State> state);
[[nodiscard]] protocol::Sharing::Client makeScriptedSharing(
    std::shared_ptr<ScriptedDaemon::State> state);

}  // namespace yomber
