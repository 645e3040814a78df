#include "platform/ipc/test_echo_server.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <atomic>
#include <cstring>
#include <filesystem>
#include <random>
#include <thread>
#include <utility>

#include "platform/ipc/server_call.h"

namespace yomber::ipc::test {

namespace {

constexpr std::chrono::seconds kPatience{10};

class CounterServer final : public Counter::Server {
 public:
  explicit CounterServer(EchoStateRef state) : state_(std::move(state)) {}
  ~CounterServer() {
    if (!EventLoop::shared().isCurrent()) state_->destroyedOffLoop.add();
    state_->destroyed.add();
  }
  kj::Promise<void> add(AddContext context) override {
    total_ += context.getParams().getAmount();
    context.getResults().setTotal(total_);
    return kj::READY_NOW;
  }

 private:
  EchoStateRef state_;
  std::uint64_t total_ = 0;
};

class CallbackServer final : public Callback::Server {
 public:
  explicit CallbackServer(std::uint64_t factor) : factor_(factor) {}
  kj::Promise<void> next(NextContext context) override {
    context.getResults().setValue(context.getParams().getIndex() * factor_);
    return kj::READY_NOW;
  }

 private:
  const std::uint64_t factor_;
};

class DescriptorServer final : public Descriptor::Server {
 public:
  explicit DescriptorServer(UniqueFd fd) : fd_(std::move(fd)) {}
  kj::Maybe<int> getFd() override { return fd_.get(); }

 private:
  UniqueFd fd_;
};

class EchoServer final : public Echo::Server {
 public:
  explicit EchoServer(EchoStateRef state) : state_(std::move(state)) {}
  ~EchoServer() {
    if (!EventLoop::shared().isCurrent()) state_->destroyedOffLoop.add();
    state_->destroyed.add();
  }

  kj::Promise<void> echo(EchoContext context) override {
    auto results = context.getResults();
    results.setValue(context.getParams().getValue());
    results.setData(context.getParams().getData());
    return kj::READY_NOW;
  }

  kj::Promise<void> hang(HangContext context) override {
    context.allowCancellation();
    state_->hangs.add();
    return kj::Promise<void>(kj::NEVER_DONE).attach(kj::defer([state = state_] {
      state->cancelled.add();
    }));
  }

  kj::Promise<void> fail(FailContext context) override {
    const capnp::Text::Reader reason = context.getParams().getReason();
    return kj::Exception(kj::Exception::Type::FAILED, __FILE__, __LINE__, kj::str(reason));
  }

  kj::Promise<void> work(WorkContext context) override {
    context.allowCancellation();
    const std::uint64_t value = context.getParams().getValue();
    const bool hold = context.getParams().getHold();
    return onPool([state = state_, value, hold](const CancelFlag& cancelled) {
             if (hold) holdBack(*state, cancelled);
             return value + 1;
           })
        .then([context](std::uint64_t result) mutable { context.getResults().setValue(result); });
  }

  kj::Promise<void> callBack(CallBackContext context) override {
    auto callback = context.getParams().getCallback();
    return addUp(kj::mv(callback), context.getParams().getTimes(), 0)
        .then([context](std::uint64_t sum) mutable { context.getResults().setSum(sum); });
  }

  kj::Promise<void> makeCounter(MakeCounterContext context) override {
    context.getResults().setCounter(kj::heap<CounterServer>(state_));
    return kj::READY_NOW;
  }

  kj::Promise<void> openDescriptor(OpenDescriptorContext context) override {
    const auto text = context.getParams().getText();
    context.getResults().setDescriptor(makeDescriptor(pipeHolding(text.cStr())));
    return kj::READY_NOW;
  }

  kj::Promise<void> readDescriptor(ReadDescriptorContext context) override {
    auto descriptor = context.getParams().getDescriptor();
    return descriptor.getFd().then([context, descriptor](kj::Maybe<int> fd) mutable {
      KJ_IF_MAYBE (number, fd) context.getResults().setText(readAll(*number));
    });
  }

  kj::Promise<void> page(PageContext context) override {
    const auto params = context.getParams();
    auto items = context.getResults().initItems(params.getLimit());
    std::uint64_t id = params.getOffset();
    for (auto item : items) {
      item.setId(++id);
      item.setSize(id * 3);
      item.setModified(static_cast<std::int64_t>(id) * 1000);
      item.setName(kj::str("document ", id, ".txt").asBytes());
      std::memset(item.initPayload(params.getItemBytes()).begin(), 'p', params.getItemBytes());
    }
    return kj::READY_NOW;
  }

  kj::Promise<void> large(LargeContext context) override {
    context.getResults().initData(static_cast<kj::uint>(context.getParams().getBytes()));
    return kj::READY_NOW;
  }

 private:
  static void holdBack(EchoState& state, const CancelFlag& cancelled) {
    cancelled.whenSet([&state] {
      state.cancelledWorks.add();
      state.releaseWorks.add();
    });
    state.works.add();
    (void)state.releaseWorks.waitFor(1);
  }

  static kj::Promise<std::uint64_t> addUp(Callback::Client callback, std::uint32_t left,
                                          std::uint64_t sum) {
    if (left == 0) return sum;
    auto request = callback.nextRequest();
    request.setIndex(left);
    return request.send().then([callback, left, sum](auto&& response) mutable {
      return addUp(kj::mv(callback), left - 1, sum + response.getValue());
    });
  }

  EchoStateRef state_;
};

}  // namespace

void Tally::add() {
  LockGuard guard(mutex_);
  ++value_;
  condition_.notifyAll();
}

std::uint64_t Tally::value() const {
  LockGuard guard(mutex_);
  return value_;
}

bool Tally::waitFor(std::uint64_t value) const {
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  LockGuard guard(mutex_);
  while (value_ < value) {
    if (!condition_.waitUntil(mutex_, deadline)) return value_ >= value;
  }
  return true;
}

capnp::Capability::Client makeEcho(EchoStateRef state) {
  return kj::heap<EchoServer>(std::move(state));
}

Callback::Client makeCallback(std::uint64_t factor) { return kj::heap<CallbackServer>(factor); }

Descriptor::Client makeDescriptor(UniqueFd descriptor) {
  return kj::heap<DescriptorServer>(std::move(descriptor));
}

UniqueFd pipeHolding(const std::string& text) {
  std::array<int, 2> ends{};
  if (::pipe2(ends.data(), O_CLOEXEC) != 0) return {};
  const UniqueFd writer(ends[1]);
  (void)!::write(writer.get(), text.data(), text.size());
  return UniqueFd(ends[0]);
}

std::string readAll(int fd) {
  std::string text;
  std::array<char, 4096> buffer;
  for (ssize_t count = 0; (count = ::read(fd, buffer.data(), buffer.size())) > 0;) {
    text.append(buffer.data(), static_cast<std::size_t>(count));
  }
  return text;
}

std::vector<std::byte> randomBytes(std::uint64_t seed, std::size_t count) {
  std::mt19937_64 generator(seed);
  std::vector<std::byte> bytes(count);
  for (auto& byte : bytes) byte = static_cast<std::byte>(generator());
  return bytes;
}

NSErrorRef echoOnce(const Remote<Echo>& echo, CallOptions options) {
  return callAndWait(
      echo, &Echo::Client::echoRequest, [](Echo::EchoParams::Builder) {},
      [](Echo::EchoResults::Reader) {}, options);
}

bool echoes(const Remote<Echo>& echo, std::uint64_t value, CallOptions options) {
  std::uint64_t answer = value + 1;
  const NSErrorRef error = callAndWait(
      echo, &Echo::Client::echoRequest,
      [value](Echo::EchoParams::Builder params) { params.setValue(value); },
      [&](Echo::EchoResults::Reader results) { answer = results.getValue(); }, options);
  return error == nullptr && answer == value;
}

::testing::AssertionResult isCocoaError(const NSErrorRef& error, std::int64_t code) {
  if (error && error->is(NSCocoaErrorDomain, code)) return ::testing::AssertionSuccess();
  return ::testing::AssertionFailure() << (error ? error->description() : "nil");
}

TemporaryDirectory::TemporaryDirectory() {
  std::string pattern = std::filesystem::temp_directory_path() / "yomber-ipc-XXXXXX";
  path_ = ::mkdtemp(pattern.data());
}

TemporaryDirectory::~TemporaryDirectory() {
  std::error_code ignored;
  std::filesystem::remove_all(path_, ignored);
}

EchoPair::EchoPair() {
  UniqueFd first;
  UniqueFd second;
  EXPECT_TRUE(makeSocketPair(first, second));
  server = Connection::adopt(first.release(), [state = state] { return makeEcho(state); });
  client = Connection::adopt(second.release());
  echo = client->bootstrap<Echo>();
}

EchoProcess::EchoProcess(const std::string& path) {
  std::array<int, 2> ready{};
  if (::pipe2(ready.data(), O_CLOEXEC) != 0) std::abort();
  pid_ = ::fork();
  if (pid_ == 0) {
    ::dup2(ready[1], STDOUT_FILENO);
    ::execl(YOMBER_ECHO_PEER, YOMBER_ECHO_PEER, path.c_str(), nullptr);
    ::_exit(127);
  }
  ::close(ready[1]);
  const UniqueFd reader(ready[0]);
  char byte = 0;
  EXPECT_EQ(::read(reader.get(), &byte, 1), 1) << "the peer did not start";
}

EchoProcess::~EchoProcess() {
  signal(SIGKILL);
  ::waitpid(pid_, nullptr, 0);
}

void EchoProcess::signal(int number) const { ::kill(pid_, number); }

void EchoProcess::awaitStop() const {
  int status = 0;
  ::waitpid(pid_, &status, WUNTRACED);
}

}  // namespace yomber::ipc::test
