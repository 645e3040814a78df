#pragma once

#include <gtest/gtest.h>

#include <functional>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "fileproviderd/host.h"
#include "platform/foundation/drive_paths.h"
#include "platform/foundation/lock.h"
#include "platform/ipc/connection.h"
#include "platform/ipc/listener.h"
#include "platform/ipc/remote.h"
#include "protocols/control.capnp.h"
#include "protocols/daemon.capnp.h"

namespace yomber {

/// What a client that watches has been told; kept by identifier, as the protocol asks.
class WatchedPicture {
 public:
  /// Waits until `condition` holds; ten seconds at most, sanitizers' slowness included.
  [[nodiscard]] bool waitFor(const std::function<bool(const WatchedPicture&)>& condition);

  std::map<std::string, std::uint64_t> versions;
  bool isListed = false;
  int pauses = 0;
  int resumes = 0;
  NSErrorRef end;

  /// Changes it on the loop thread.
  void change(const std::function<void(WatchedPicture&)>& work);

 private:
  Mutex mutex_;
  Condition changed_;
};

/// A host with a real extension process, a zarn that answers as much as the host asks of it, and a
/// client on the control socket; all in a temporary home. A test that cannot be set up ends at
/// once.
class HostTest : public testing::Test {
 protected:
  HostTest();
  ~HostTest() override;

  /// Starts the host; `change` may set its limits before.
  void startHost(const std::function<void(Host::Options&)>& change = {});
  void startZarn();
  void stopZarn();
  /// zarn raises a signal itself.
  void signalFromZarn(const std::string& container);

  // What the extension is commanded (fake_extension.cpp).
  void command(const std::string& name, const std::string& content = "") const;
  void countermand(const std::string& name) const;
  void setItems(const std::map<std::string, std::uint64_t>& items) const;
  void signalFromExtension(const std::string& container) const;

  // What a client sees. On failure the error, else nil.
  NSErrorRef item(const std::string& identifier, ItemFields* found = nullptr) const;
  NSErrorRef locate(const std::string& identifier, std::string* path = nullptr) const;
  NSErrorRef identify(const std::string& path, std::string* identifier = nullptr) const;
  [[nodiscard]] ipc::Remote<protocol::Listing> list(const std::string& container) const;
  /// One page's identifiers; `more` says whether there are others.
  static NSErrorRef next(const ipc::Remote<protocol::Listing>& listing,
                         std::vector<std::string>* identifiers = nullptr, bool* more = nullptr);
  /// Every page.
  NSErrorRef listAll(const std::string& container, std::vector<std::string>* identifiers) const;
  std::shared_ptr<WatchedPicture> watch(const std::string& container,
                                        ipc::Remote<protocol::Watch>* registration);

  struct Status {
    pid_t extension = 0;
    std::uint64_t starts = 0;
    bool daemonReachable = false;
    std::uint32_t watches = 0;
    std::uint32_t enumerators = 0;
    std::uint32_t descriptors = 0;
    NSErrorRef lastFailure;
  };
  [[nodiscard]] Status status() const;
  /// Asks again until `condition` holds, ten seconds at most.
  [[nodiscard]] bool waitForStatus(const std::function<bool(const Status&)>& condition) const;

  std::string home;
  DrivePaths paths;
  std::shared_ptr<Host> host;  ///< used on the loop thread only
  std::unique_ptr<ipc::Listener> control;
  ipc::Connection::Ref client;
  ipc::Remote<protocol::Control> remote;

  struct Zarn;
  std::shared_ptr<Zarn> zarn;
};

}  // namespace yomber
