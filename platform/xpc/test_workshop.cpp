#include "platform/xpc/test_workshop.h"

#include <atomic>
#include <chrono>
#include <stdexcept>
#include <utility>

#include "platform/ipc/error_codec.h"
#include "platform/ipc/gate.h"
#include "platform/xpc/interface_coding.h"
#include "platform/xpc/left_out_method.h"
#include "platform/xpc/remote_object.h"
#include "platform/xpc/test_workshop.capnp.h"

namespace yomber::test {
namespace {

constexpr auto kPatience = std::chrono::seconds(30);

/// Thrown, and no std::exception.
struct OddThing {};

std::atomic<int> measuresUnderWay{0};

class WorkshopServer final : public WorkshopService::Server {
 public:
  explicit WorkshopServer(ServedObject<Workshop> object) : object_(std::move(object)) {}

 protected:
  kj::Promise<void> addOne(AddOneContext context) override {
    return object_
        .deliver<std::uint64_t>(
            context, [value = context.getParams().getValue()](
                         Workshop& object, const auto& reply) { object.addOne(value, reply); })
        .then([context](std::uint64_t value) mutable { context.getResults().setValue(value); });
  }
  kj::Promise<void> work(WorkContext context) override {
    return object_
        .deliver<NSErrorRef>(
            context, context.getParams().getCall(),
            [name = std::string(context.getParams().getName().cStr())](
                Workshop& object, const auto& reply) { return object.work(name, reply); })
        .then([context](const NSErrorRef& error) mutable {
          ipc::encodeOptional(error, context.getResults().initFailure());
        });
  }
  kj::Promise<void> note(NoteContext context) override {
    return object_.deliverOneWay(
        [value = context.getParams().getValue()](Workshop& object) { object.note(value); });
  }
  kj::Promise<void> measure(MeasureContext context) override {
    const auto data = context.getParams().getData();
    ++measuresUnderWay;
    return object_
        .deliver<std::uint64_t>(
            context, [text = std::string(reinterpret_cast<const char*>(data.begin()), data.size())](
                         Workshop& object, const auto& reply) { object.measure(text, reply); })
        .then([context](std::uint64_t size) mutable { context.getResults().setSize(size); })
        .attach(kj::defer([] { --measuresUnderWay; }));
  }
  kj::Promise<void> polish(PolishContext context) override {
    return object_
        .deliver<std::uint64_t>(
            context, [value = context.getParams().getValue()](
                         Workshop& object, const auto& reply) { object.polish(value, reply); })
        .then([context](std::uint64_t value) mutable { context.getResults().setValue(value); });
  }
  kj::Promise<void> sweep(SweepContext /*context*/) override {
    return object_.deliverOneWay([](Workshop& object) { object.sweep(); });
  }
  kj::Promise<void> break_(BreakContext context) override {
    return object_
        .deliver<std::uint64_t>(context,
                                [](Workshop& object, const auto& reply) { object.breakIt(reply); })
        .then([context](std::uint64_t value) mutable { context.getResults().setValue(value); });
  }

 private:
  const ServedObject<Workshop> object_;
};

/// The closure that hands over a number.
template <typename Results>
auto numberReply(Workshop::NumberReply reply) {
  return [reply = std::move(reply)](typename Results::Reader results) -> std::function<void()> {
    return [reply, value = results.getValue()] { reply(value); };
  };
}

class WorkshopProxy final : public Workshop {
 public:
  WorkshopProxy(NSXPCConnectionRef connection, std::function<void(NSErrorRef)> errorHandler)
      : remote_(std::move(connection), std::move(errorHandler)) {}

  void addOne(std::uint64_t value, NumberReply reply) override {
    remote_.call(
        &WorkshopService::Client::addOneRequest, [value](auto params) { params.setValue(value); },
        numberReply<WorkshopService::AddOneResults>(std::move(reply)));
  }
  NSProgressRef work(const std::string& name, ErrorReply reply) override {
    return remote_.callWithProgress(
        &WorkshopService::Client::workRequest,
        [name](WorkshopService::WorkParams::Builder params) { params.setName(name); },
        [reply = std::move(reply)](
            WorkshopService::WorkResults::Reader results) -> std::function<void()> {
          return [reply, error = ipc::decodeOptional(results.getFailure())] { reply(error); };
        });
  }
  void note(std::uint64_t value) override {
    remote_.call(
        &WorkshopService::Client::noteRequest, [value](auto params) { params.setValue(value); },
        [](const auto&) { return [] {}; });
  }
  void measure(const std::string& data, NumberReply reply) override {
    remote_.call(
        &WorkshopService::Client::measureRequest,
        [data](WorkshopService::MeasureParams::Builder params) {
          params.setData({reinterpret_cast<const kj::byte*>(data.data()), data.size()});
        },
        [reply = std::move(reply)](
            WorkshopService::MeasureResults::Reader results) -> std::function<void()> {
          return [reply, size = results.getSize()] { reply(size); };
        });
  }
  void polish(std::uint64_t value, NumberReply reply) override {
    remote_.call(
        &WorkshopService::Client::polishRequest, [value](auto params) { params.setValue(value); },
        numberReply<WorkshopService::PolishResults>(std::move(reply)));
  }
  void sweep() override {
    remote_.call(
        &WorkshopService::Client::sweepRequest, [](auto) {}, [](const auto&) { return [] {}; });
  }
  void breakIt(NumberReply reply) override {
    remote_.call(
        &WorkshopService::Client::breakRequest, [](auto) {},
        numberReply<WorkshopService::BreakResults>(std::move(reply)));
  }

 private:
  const RemoteObject<WorkshopService> remote_;
};

}  // namespace

void Workshop::polish(std::uint64_t /*value*/, NumberReply reply) {
  (void)NSXPCMethodIsLeftOut("polish");
  reply(0);
}

void Workshop::sweep() { (void)NSXPCMethodIsLeftOut("sweep"); }

int workshopMeasuresUnderWay() { return measuresUnderWay; }

// ---- Waiting -----------------------------------------------------------------------------------

bool Watched::waitFor(const std::function<bool()>& condition) {
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  LockGuard guard(mutex_);
  while (!condition()) {
    if (!changed_.waitUntil(mutex_, deadline)) return condition();
  }
  return true;
}

void Watched::change(const std::function<void()>& work) {
  LockGuard guard(mutex_);
  work();
  changed_.notifyAll();
}

void HandlerNotes::note(const std::string& what) {
  watched_.change([&] { notes_.push_back(what); });
}

std::vector<std::string> HandlerNotes::all() {
  std::vector<std::string> copy;
  watched_.change([&] { copy = notes_; });
  return copy;
}

bool HandlerNotes::waitFor(std::size_t count) {
  return watched_.waitFor([&] { return notes_.size() >= count; });
}

// ---- The object --------------------------------------------------------------------------------

void WorkshopObject::addOne(std::uint64_t value, NumberReply reply) {
  bool isHeld = false;
  watched_.change([&] {
    isHeld = holdsReplies_;
    if (isHeld) heldReplies_.emplace_back([reply, value] { reply(value + 1); });
  });
  if (!isHeld) reply(value + 1);
}

NSProgressRef WorkshopObject::work(const std::string& name, ErrorReply reply) {
  if (name == "broken late") reply(NSError::errorWithDomain("workshop", 7));
  if (name.starts_with("broken")) throw std::runtime_error("it broke");
  if (name == "odd") throw OddThing{};
  auto progress = NSProgress::progressWithTotalUnitCount(4);
  progress->setCancellationHandler(
      [this, name] { watched_.change([&] { jobs_[name].isCancelled = true; }); });
  watched_.change([&] {
    jobs_[name].progress = progress;
    jobs_[name].reply = std::move(reply);
  });
  return progress;
}

void WorkshopObject::note(std::uint64_t value) {
  watched_.change([&] { notes_.push_back(value); });
}

void WorkshopObject::measure(const std::string& data, NumberReply reply) { reply(data.size()); }

void WorkshopObject::breakIt(NumberReply /*reply*/) { throw std::runtime_error("it broke"); }

WorkshopObject::Job WorkshopObject::job(const std::string& name) {
  Job found;
  (void)watched_.waitFor([&] {
    found = jobs_[name];
    return found.progress != nullptr;
  });
  return found;
}

void WorkshopObject::finish(const std::string& name, const NSErrorRef& error) {
  const auto reply = job(name).reply;
  if (reply) reply(error);
}

bool WorkshopObject::waitForCancelled(const std::string& name) {
  return watched_.waitFor([&] { return jobs_[name].isCancelled; });
}

std::vector<std::uint64_t> WorkshopObject::notes() {
  std::vector<std::uint64_t> copy;
  watched_.change([&] { copy = notes_; });
  return copy;
}

bool WorkshopObject::waitForNotes(std::size_t count) {
  return watched_.waitFor([&] { return notes_.size() >= count; });
}

void WorkshopObject::holdReplies() {
  watched_.change([&] { holdsReplies_ = true; });
}

void WorkshopObject::releaseReplies() {
  std::vector<std::function<void()>> due;
  watched_.change([&] {
    holdsReplies_ = false;
    due.swap(heldReplies_);
  });
  for (const auto& reply : due) reply();
}

bool WorkshopObject::waitForHeldReplies(std::size_t count) {
  return watched_.waitFor([&] { return heldReplies_.size() >= count; });
}

// ---- Vendor and client -------------------------------------------------------------------------

bool WorkshopVendor::listener(const NSXPCListenerRef& /*listener*/,
                              const NSXPCConnectionRef& shouldAcceptNewConnection) {
  const auto& connection = shouldAcceptNewConnection;
  if (!accepts) return false;
  const auto object = std::make_shared<WorkshopObject>();
  connection->setExportedInterface(NSXPCInterface::interfaceWithProtocol<Workshop>());
  connection->setExportedObject<Workshop>(object);
  connection->setInterruptionHandler([notes = handlers] { notes->note("interrupted"); });
  connection->setInvalidationHandler([notes = handlers] { notes->note("invalidated"); });
  connection->resume();
  watched_.change([&] {
    objects_.push_back(object);
    connection_ = connection;
  });
  return true;
}

std::shared_ptr<WorkshopObject> WorkshopVendor::waitForObject() {
  std::shared_ptr<WorkshopObject> object;
  (void)watched_.waitFor([&] {
    if (!objects_.empty()) object = objects_.back();
    return object != nullptr;
  });
  return object;
}

std::weak_ptr<NSXPCConnection> WorkshopVendor::connection() {
  std::weak_ptr<NSXPCConnection> copy;
  watched_.change([&] { copy = connection_; });
  return copy;
}

void WorkshopVendor::forgetObjects() {
  watched_.change([&] { objects_.clear(); });
}

WorkshopConnection::WorkshopConnection() : listener(NSXPCListener::anonymousListener()) {
  listener->setDelegate(vendor);
  client = NSXPCConnection::initWithListenerEndpoint(listener->endpoint());
  listener->resume();
  client->setRemoteObjectInterface(NSXPCInterface::interfaceWithProtocol<Workshop>());
  client->setInterruptionHandler([notes = handlers] { notes->note("interrupted"); });
  client->setInvalidationHandler([notes = handlers] { notes->note("invalidated"); });
}

WorkshopConnection::~WorkshopConnection() {
  if (client != nullptr) client->invalidate();
}

std::shared_ptr<Workshop> WorkshopConnection::proxy() {
  return client->remoteObjectProxyWithErrorHandler<Workshop>(
      [notes = failures](const NSErrorRef& error) { notes->note(domainAndCode(error)); });
}

std::uint64_t WorkshopConnection::addOne(std::uint64_t value, NSErrorRef* error) {
  const auto done = std::make_shared<ipc::Gate>();
  const auto answer = std::make_shared<std::pair<std::uint64_t, NSErrorRef>>();
  client
      ->remoteObjectProxyWithErrorHandler<Workshop>([done, answer](const NSErrorRef& failure) {
        answer->second = failure;
        done->open();
      })
      ->addOne(value, [done, answer](std::uint64_t result) {
        answer->first = result;
        done->open();
      });
  done->wait();
  storeError(error, answer->second);
  return answer->first;
}

std::string domainAndCode(const NSErrorRef& error) {
  return error == nullptr ? "nil" : error->domain() + " " + std::to_string(error->code());
}

}  // namespace yomber::test

namespace yomber {

template <>
NSXPCInterfaceRef NSXPCInterface::interfaceWithProtocol<test::Workshop>() {
  return CodingOf<test::Workshop, test::WorkshopServer, test::WorkshopProxy>::makeInterface();
}

}  // namespace yomber
