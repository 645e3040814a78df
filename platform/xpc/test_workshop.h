#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "platform/foundation/lock.h"
#include "platform/foundation/progress.h"
#include "platform/foundation/serial_queue.h"
#include "platform/xpc/connection.h"
#include "platform/xpc/interface.h"
#include "platform/xpc/listener.h"

namespace yomber::test {

/// What the tests of connections call.
class Workshop {
 public:
  using NumberReply = std::function<void(std::uint64_t)>;
  using ErrorReply = std::function<void(NSErrorRef)>;

  virtual ~Workshop() = default;
  virtual void addOne(std::uint64_t value, NumberReply reply) = 0;
  /// Answers when the test says so, or when its progress is cancelled. Throws for the name
  /// "broken", after having answered for "broken late", and no std::exception for "odd".
  virtual NSProgressRef work(const std::string& name, ErrorReply reply) = 0;
  virtual void note(std::uint64_t value) = 0;
  virtual void measure(const std::string& data, NumberReply reply) = 0;
  /// Optional ones, left out here.
  virtual void polish(std::uint64_t value, NumberReply reply);
  virtual void sweep();
  /// Throws.
  virtual void breakIt(NumberReply reply) = 0;
};

/// A condition that threads wait for, ten seconds and more at most, sanitizers' slowness included.
class Watched {
 public:
  [[nodiscard]] bool waitFor(const std::function<bool()>& condition);
  /// Changes what the conditions look at.
  void change(const std::function<void()>& work);

 private:
  Mutex mutex_;
  Condition changed_;
};

/// An object as an extension exports it; the test holds it and looks at what came.
class WorkshopObject final : public Workshop {
 public:
  struct Job {
    NSProgressRef progress;
    ErrorReply reply;
    bool isCancelled = false;
  };

  void addOne(std::uint64_t value, NumberReply reply) override;
  NSProgressRef work(const std::string& name, ErrorReply reply) override;
  void note(std::uint64_t value) override;
  void measure(const std::string& data, NumberReply reply) override;
  void breakIt(NumberReply reply) override;

  /// The job of that name, once it has come.
  [[nodiscard]] Job job(const std::string& name);
  void finish(const std::string& name, const NSErrorRef& error);
  [[nodiscard]] bool waitForCancelled(const std::string& name);
  [[nodiscard]] std::vector<std::uint64_t> notes();
  [[nodiscard]] bool waitForNotes(std::size_t count);
  /// While it is set, replies of `addOne` are kept for `releaseReplies`.
  void holdReplies();
  void releaseReplies();
  [[nodiscard]] bool waitForHeldReplies(std::size_t count);

 private:
  Watched watched_;
  std::map<std::string, Job> jobs_;
  std::vector<std::uint64_t> notes_;
  bool holdsReplies_ = false;
  std::vector<std::function<void()>> heldReplies_;
};

/// What a connection's handlers say, in order.
class HandlerNotes {
 public:
  void note(const std::string& what);
  [[nodiscard]] std::vector<std::string> all();
  [[nodiscard]] bool waitFor(std::size_t count);

 private:
  Watched watched_;
  std::vector<std::string> notes_;
};

/// Accepts (or not) with a WorkshopObject of its own for each connection.
class WorkshopVendor final : public NSXPCListenerDelegate {
 public:
  bool listener(const NSXPCListenerRef& listener,
                const NSXPCConnectionRef& shouldAcceptNewConnection) override;

  [[nodiscard]] std::shared_ptr<WorkshopObject> waitForObject();
  [[nodiscard]] std::weak_ptr<NSXPCConnection> connection();
  /// Lets go of the objects that were exported.
  void forgetObjects();

  bool accepts = true;  ///< set before the client connects
  const std::shared_ptr<HandlerNotes> handlers = std::make_shared<HandlerNotes>();

 private:
  Watched watched_;
  std::vector<std::shared_ptr<WorkshopObject>> objects_;
  std::weak_ptr<NSXPCConnection> connection_;
};

/// A vendor with one listener, and a client's connection to it that is not resumed yet.
struct WorkshopConnection {
  WorkshopConnection();
  ~WorkshopConnection();
  WorkshopConnection(const WorkshopConnection&) = delete;
  WorkshopConnection& operator=(const WorkshopConnection&) = delete;

  /// Calls whose replies the test waits for; a failure is the answer of `failure`.
  [[nodiscard]] std::shared_ptr<Workshop> proxy();
  /// The answer, or 0 after a failure, which is stored.
  std::uint64_t addOne(std::uint64_t value, NSErrorRef* error = nullptr);

  std::shared_ptr<WorkshopVendor> vendor = std::make_shared<WorkshopVendor>();
  NSXPCListenerRef listener;
  NSXPCConnectionRef client;
  /// Of the client's connection.
  const std::shared_ptr<HandlerNotes> handlers = std::make_shared<HandlerNotes>();
  /// What `proxy`'s error handler got.
  const std::shared_ptr<HandlerNotes> failures = std::make_shared<HandlerNotes>();
};

/// The calls of `measure` in this process that came in and were not let go of.
[[nodiscard]] int workshopMeasuresUnderWay();

/// "domain code" of an error, "nil" without.
[[nodiscard]] std::string domainAndCode(const NSErrorRef& error);

}  // namespace yomber::test

namespace yomber {

template <>
NSXPCInterfaceRef NSXPCInterface::interfaceWithProtocol<test::Workshop>();

}  // namespace yomber
