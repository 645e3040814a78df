#include "platform/ipc/connection.h"

#include <capnp/message.h>
#include <capnp/rpc.capnp.h>
#include <capnp/serialize.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "platform/foundation/sanitized.h"
#include "platform/ipc/call.h"
#include "platform/ipc/listener.h"
#include "platform/ipc/message_stream.h"
#include "platform/ipc/test_echo_server.h"

namespace yomber::ipc {
namespace {

using test::Echo;
using test::EchoPair;

constexpr uid_t kNobody = 65534;

/// The reason that a connection ends for.
class EndWatch {
 public:
  explicit EndWatch(const Connection::Ref& connection) {
    connection->onDisconnect([this](NSErrorRef error) {
      reason_ = std::move(error);
      ends_.add();
    });
  }
  NSErrorRef reason() {
    EXPECT_TRUE(ends_.waitFor(1)) << "the connection did not end";
    return reason_;
  }
  [[nodiscard]] std::uint64_t count() const { return ends_.value(); }

 private:
  test::Tally ends_;
  NSErrorRef reason_;
};

Connection::Bootstrap echoes(const test::EchoStateRef& state) {
  return [state] { return test::makeEcho(state); };
}

TEST(Connection, ConnectingToNothingNamesThePathAndSaysWhatToDo) {
  test::TemporaryDirectory directory;
  ASSERT_TRUE(UniqueFd(::creat(directory.file("file").c_str(), 0600)));
  for (const std::string& path :
       {directory.file("nothing"), directory.file("no/directory"), directory.file("file/s")}) {
    NSErrorRef error;
    EXPECT_EQ(Connection::connect(path, &error), nullptr);
    ASSERT_NE(error, nullptr);
    EXPECT_NE(error->localizedDescription().find(path), std::string::npos);
    EXPECT_NE(error->localizedDescription().find("yomber up"), std::string::npos);
  }
}

/// This process opens nothing more for so long.
class NoMoreDescriptors {
 public:
  NoMoreDescriptors() {
    EXPECT_EQ(::getrlimit(RLIMIT_NOFILE, &before_), 0);
    const UniqueFd lowestFree = duplicateDescriptor(STDERR_FILENO);
    EXPECT_TRUE(lowestFree);
    rlimit lowered = before_;
    lowered.rlim_cur = static_cast<rlim_t>(lowestFree.get());
    EXPECT_EQ(::setrlimit(RLIMIT_NOFILE, &lowered), 0);
  }
  ~NoMoreDescriptors() { EXPECT_EQ(::setrlimit(RLIMIT_NOFILE, &before_), 0); }
  NoMoreDescriptors(const NoMoreDescriptors&) = delete;
  NoMoreDescriptors& operator=(const NoMoreDescriptors&) = delete;

 private:
  rlimit before_{};
};

TEST(Connection, WhoHasNoDescriptorLeftIsNotToldThatNothingListens) {
  if (kIsSanitized) GTEST_SKIP() << "the sanitizers need descriptors to look at memory";
  test::TemporaryDirectory directory;
  const auto state = std::make_shared<test::EchoState>();
  const auto listener = Listener::listen(
      directory.file("s"), [&](const PeerCredentials&) { return test::makeEcho(state); });
  ASSERT_NE(listener, nullptr);
  NSErrorRef error;
  {
    const NoMoreDescriptors shortage;
    EXPECT_EQ(Connection::connect(directory.file("s"), &error), nullptr);
  }
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(NSPOSIXErrorDomain, EMFILE)) << error->description();
  EXPECT_NE(error->localizedDescription().find("open files"), std::string::npos)
      << error->localizedDescription();
  EXPECT_NE(Connection::connect(directory.file("s"), &error), nullptr);
}

TEST(Connection, ConnectAsyncAnswersOnAnotherThread) {
  test::TemporaryDirectory directory;
  const auto state = std::make_shared<test::EchoState>();
  const auto listener = Listener::listen(
      directory.file("s"), [&](const PeerCredentials&) { return test::makeEcho(state); });
  ASSERT_NE(listener, nullptr);
  for (const bool good : {true, false}) {
    Gate done;
    Connection::Ref connection;
    NSErrorRef error;
    Connection::connectAsync(directory.file(good ? "s" : "t"), [&](auto made, auto failure) {
      connection = std::move(made);
      error = std::move(failure);
      done.open();
    });
    done.wait();
    EXPECT_EQ(connection != nullptr, good);
    EXPECT_EQ(error == nullptr, good);
    if (good) {
      EXPECT_TRUE(test::echoes(connection->bootstrap<Echo>(), 1));
    }
  }
}

TEST(Connection, BothEndsOfAPairMayExport) {
  const auto left = std::make_shared<test::EchoState>();
  const auto right = std::make_shared<test::EchoState>();
  UniqueFd first;
  UniqueFd second;
  ASSERT_TRUE(makeSocketPair(first, second));
  const auto one = Connection::adopt(first.release(), echoes(left));
  const auto two = Connection::adopt(second.release(), echoes(right));
  ASSERT_NE(one, nullptr);
  ASSERT_NE(two, nullptr);
  std::thread other([&] {
    for (std::uint64_t i = 0; i < 50; ++i) EXPECT_TRUE(test::echoes(two->bootstrap<Echo>(), i));
  });
  for (std::uint64_t i = 0; i < 50; ++i) EXPECT_TRUE(test::echoes(one->bootstrap<Echo>(), i));
  other.join();
}

TEST(Connection, AnEndThatExportsNothingFailsCallsOnly) {
  EchoPair pair;
  EXPECT_NE(test::echoOnce(pair.server->bootstrap<Echo>()), nullptr);
  EXPECT_TRUE(test::echoes(pair.echo, 1));
}

TEST(Connection, AdoptTakesOnlyUnixSockets) {
  UniqueFd pipe = test::pipeHolding("");
  NSErrorRef error;
  EXPECT_EQ(Connection::adopt(pipe.release(), {}, &error), nullptr);
  EXPECT_NE(error, nullptr);
}

TEST(Connection, AdoptingAnAbandonedEndIsAnError) {
  UniqueFd first;
  UniqueFd second;
  ASSERT_TRUE(makeSocketPair(first, second));
  second.reset();
  NSErrorRef error;
  EXPECT_EQ(Connection::adopt(first.release(), {}, &error), nullptr);
  EXPECT_TRUE(test::isCocoaError(error, NSXPCConnectionInterrupted));
}

TEST(Connection, TheEndIsToldOnceAndToLateComersToo) {
  EchoPair pair;
  EndWatch early(pair.client);
  ASSERT_TRUE(test::echoes(pair.echo, 1));
  pair.server = nullptr;
  EXPECT_TRUE(test::isCocoaError(early.reason(), NSXPCConnectionInterrupted));
  EXPECT_FALSE(pair.client->isConnected());
  EndWatch late(pair.client);
  EXPECT_EQ(late.reason(), early.reason());
  EXPECT_EQ(early.count(), 1U);
}

TEST(Connection, ClosingHereIsInvalidation) {
  EchoPair pair;
  EndWatch watch(pair.client);
  EXPECT_TRUE(pair.client->isConnected());
  pair.client->close();
  EXPECT_FALSE(pair.client->isConnected());
  EXPECT_TRUE(test::isCocoaError(watch.reason(), NSXPCConnectionInvalid));
  pair.client->close();
  EXPECT_TRUE(test::isCocoaError(test::echoOnce(pair.echo), NSXPCConnectionInterrupted));
}

TEST(Connection, WhatWasAnsweredBeforeClosingStillArrives) {
  for (int round = 0; round < 20; ++round) {
    EchoPair pair;
    test::Tally replies;
    bool answered = false;
    EventLoop::shared().runAndWait([&] {
      call(
          pair.echo, &Echo::Client::echoRequest, [](auto) {},
          [&](const NSErrorRef& error, const Echo::EchoResults::Reader*) {
            answered = error == nullptr;
            replies.add();
          });
    });
    ASSERT_TRUE(replies.waitFor(1));
    pair.server->close();
    EXPECT_TRUE(answered);
  }
}

/// Runs `child` in a process of another user; answers what it exits with.
template <typename Child>
int asNobody(Child child) {
  const pid_t pid = ::fork();
  if (pid == 0) {
    if (::setgid(kNobody) != 0 || ::setuid(kNobody) != 0) ::_exit(99);
    ::_exit(child());
  }
  int status = 0;
  ::waitpid(pid, &status, 0);
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

TEST(Connection, AnotherUsersEndIsRefusedBeforeAnythingIsParsed) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root to become another user";
  UniqueFd ours;
  UniqueFd theirs;
  ASSERT_TRUE(makeSocketPair(ours, theirs));
  const auto state = std::make_shared<test::EchoState>();
  const auto connection = Connection::adopt(ours.release(), echoes(state));
  ASSERT_NE(connection, nullptr);
  EndWatch watch(connection);
  const auto echo = connection->bootstrap<Echo>();
  test::Tally replies;
  NSErrorRef callError;
  call(
      echo, &Echo::Client::echoRequest, [](auto) {},
      [&](NSErrorRef error, const Echo::EchoResults::Reader*) {
        callError = std::move(error);
        replies.add();
      });
  EXPECT_EQ(asNobody([&] {
              if (MessageStream::sendCredentials(theirs.get()) != 0) return 1;
              // Our half of the handshake is all that it may ever read.
              char bytes[64];
              ssize_t total = 0;
              for (ssize_t n = 0; (n = ::read(theirs.get(), bytes, sizeof bytes)) > 0;) total += n;
              return total == 1 ? 0 : 2;
            }),
            0);
  const NSErrorRef reason = watch.reason();
  EXPECT_TRUE(test::isCocoaError(reason, NSXPCConnectionInvalid));
  EXPECT_NE(reason->localizedDescription().find("65534"), std::string::npos);
  ASSERT_TRUE(replies.waitFor(1));
  EXPECT_TRUE(test::isCocoaError(callError, NSXPCConnectionInterrupted));
}

TEST(Connection, APeerThatProvesNothingIsRefused) {
  UniqueFd ours;
  UniqueFd theirs;
  ASSERT_TRUE(makeSocketPair(ours, theirs));
  // Written before our end asks for credentials, so that the kernel adds none.
  ASSERT_EQ(::write(theirs.get(), "Y", 1), 1);
  const auto connection = Connection::adopt(ours.release());
  ASSERT_NE(connection, nullptr);
  EndWatch watch(connection);
  EXPECT_TRUE(test::isCocoaError(watch.reason(), NSXPCConnectionInvalid));
}

TEST(Connection, NothingIsSentBeforeThePeerProvedItsUser) {
  UniqueFd ours;
  UniqueFd theirs;
  ASSERT_TRUE(makeSocketPair(ours, theirs));
  const auto connection = Connection::adopt(ours.release());
  ASSERT_NE(connection, nullptr);
  const auto echo = connection->bootstrap<Echo>();
  test::Tally replies;
  call(
      echo, &Echo::Client::echoRequest, [](auto) {},
      [&](const NSErrorRef&, const Echo::EchoResults::Reader*) { replies.add(); });
  for (int i = 0; i < 3; ++i) EventLoop::shared().runAndWait([] {});
  char bytes[64];
  EXPECT_EQ(::recv(theirs.get(), bytes, sizeof bytes, MSG_DONTWAIT), 1);
  EXPECT_EQ(::recv(theirs.get(), bytes, sizeof bytes, MSG_DONTWAIT), -1);
  ASSERT_EQ(MessageStream::sendCredentials(theirs.get()), 0);
  EXPECT_GT(::recv(theirs.get(), bytes, sizeof bytes, 0), 1) << "now the call comes";
  theirs.reset();
  EXPECT_TRUE(replies.waitFor(1));
}

TEST(Connection, AnotherUsersListenerIsRefused) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root to become another user";
  test::TemporaryDirectory directory;
  ASSERT_EQ(::chmod(directory.path().c_str(), 0777), 0);
  const std::string path = directory.file("theirs");
  UniqueFd release;
  UniqueFd held;
  ASSERT_TRUE(makeSocketPair(release, held));
  std::thread server([&] {
    EXPECT_EQ(asNobody([&] {
                NSErrorRef error;
                const UniqueFd socket = listenUnixSocket(path, &error);
                char byte = 'l';
                (void)!::write(held.get(), &byte, 1);
                return ::read(held.get(), &byte, 1) == 1 && socket ? 0 : 1;
              }),
              0);
  });
  char byte = 0;
  ASSERT_EQ(::read(release.get(), &byte, 1), 1);
  NSErrorRef error;
  EXPECT_EQ(Connection::connect(path, &error), nullptr);
  ASSERT_NE(error, nullptr);
  EXPECT_NE(error->localizedDescription().find("another user"), std::string::npos);
  ASSERT_EQ(::write(release.get(), "x", 1), 1);
  server.join();
}

/// The other end of a connection that serves echoes, which sends calls by hand and reads replies
/// only when it is told to.
class DeafPeer {
 public:
  DeafPeer() {
    UniqueFd theirs;
    EXPECT_TRUE(makeSocketPair(socket_, theirs));
    EXPECT_EQ(MessageStream::sendCredentials(socket_.get()), 0);
    connection = Connection::adopt(theirs.release(), echoes(state_));
    send([](capnp::rpc::Message::Builder message) { message.initBootstrap().setQuestionId(0); });
  }
  /// False when the connection has ended.
  template <typename Params, typename Fill>
  bool call(std::uint16_t method, Fill fill) {
    return send([&](capnp::rpc::Message::Builder message) {
      auto request = message.initCall();
      request.setQuestionId(++lastQuestion_);
      request.initTarget().initPromisedAnswer().setQuestionId(0);
      request.setInterfaceId(capnp::typeId<Echo>());
      request.setMethodId(method);
      fill(request.initParams().getContent().initAs<Params>());
    });
  }
  void askForLarge(std::uint64_t bytes) {
    constexpr std::uint16_t kLarge = 9;
    EXPECT_TRUE(call<Echo::LargeParams>(kLarge, [&](auto params) { params.setBytes(bytes); }));
  }
  /// How many bytes have come when there are so many, or no more do.
  [[nodiscard]] std::uint64_t read(std::uint64_t wanted) const {
    std::vector<char> buffer(1 << 20);
    std::uint64_t total = 0;
    while (total < wanted) {
      const ssize_t count = ::recv(socket_.get(), buffer.data(), buffer.size(), 0);
      if (count <= 0) break;
      total += static_cast<std::uint64_t>(count);
    }
    return total;
  }

  Connection::Ref connection;

 private:
  template <typename Fill>
  bool send(Fill fill) {
    capnp::MallocMessageBuilder builder;
    fill(builder.initRoot<capnp::rpc::Message>());
    const auto words = capnp::messageToFlatArray(builder);
    auto bytes = words.asBytes();
    while (bytes.size() > 0) {
      const ssize_t sent = ::send(socket_.get(), bytes.begin(), bytes.size(), MSG_NOSIGNAL);
      if (sent <= 0) return false;
      bytes = bytes.slice(static_cast<std::size_t>(sent), bytes.size());
    }
    return true;
  }

  const test::EchoStateRef state_ = std::make_shared<test::EchoState>();
  UniqueFd socket_;
  std::uint32_t lastQuestion_ = 0;
};

constexpr std::uint64_t kLargeReply = 60 << 20;

TEST(Connection, APeerThatReadsNoLargeRepliesIsDisconnected) {
  DeafPeer peer;
  EndWatch watch(peer.connection);
  for (std::uint64_t bytes = 0; bytes <= kMaximumBacklogBytes; bytes += kLargeReply)
    peer.askForLarge(kLargeReply);
  const NSErrorRef reason = watch.reason();
  EXPECT_TRUE(test::isCocoaError(reason, NSXPCConnectionInvalid));
  EXPECT_NE(reason->localizedDescription().find("takes in nothing"), std::string::npos);
}

TEST(Connection, APeerThatReadsNoSmallRepliesIsReadNoFurtherAndDisconnected) {
  DeafPeer peer;
  EndWatch watch(peer.connection);
  constexpr std::size_t kCalls = 20 * kMaximumBacklogMessages;
  std::size_t calls = 0;
  const auto fill = [](auto params) { params.setValue(7); };
  while (calls < kCalls && peer.call<Echo::EchoParams>(0, fill)) ++calls;
  EXPECT_TRUE(test::isCocoaError(watch.reason(), NSXPCConnectionInvalid));
  EXPECT_LT(calls, kCalls / 4) << "what waits is bounded, here and in the sockets";
}

TEST(Connection, APeerThatReadsLateGetsEverything) {
  DeafPeer peer;
  std::uint64_t bytes = 0;
  for (; bytes <= kMaximumBacklogBytes; bytes += kLargeReply) peer.askForLarge(kLargeReply);
  EXPECT_GE(peer.read(bytes), bytes);
  EXPECT_TRUE(peer.connection->isConnected());
}

/// A peer that makes one call after the other without waiting for replies, which it takes in as
/// they come. It ends by itself after very many calls.
class FloodingPeer {
 public:
  FloodingPeer() {
    UniqueFd theirs;
    EXPECT_TRUE(makeSocketPair(socket_, theirs));
    EXPECT_EQ(MessageStream::sendCredentials(socket_.get()), 0);
    connection_ = Connection::adopt(theirs.release(), echoes(state_));
    reader_ = std::thread([this] { readReplies(); });
    writer_ = std::thread([this] { writeCalls(); });
  }
  ~FloodingPeer() {
    ::shutdown(socket_.get(), SHUT_RDWR);
    writer_.join();
    reader_.join();
  }
  FloodingPeer(const FloodingPeer&) = delete;
  FloodingPeer& operator=(const FloodingPeer&) = delete;

  void awaitReplies() { replies_.wait(); }
  [[nodiscard]] bool hasEnded() const { return hasEnded_; }

 private:
  static constexpr std::uint32_t kCalls = 100'000;
  static constexpr std::uint32_t kCallsInOneGo = 500;
  static constexpr std::size_t kManyBytes = 1 << 17;

  void readReplies() {
    std::vector<char> buffer(1 << 16);
    std::size_t total = 0;
    for (ssize_t count = 0; (count = ::recv(socket_.get(), buffer.data(), buffer.size(), 0)) > 0;) {
      const bool wereFew = total < kManyBytes;
      total += static_cast<std::size_t>(count);
      if (wereFew && total >= kManyBytes) replies_.open();
    }
    if (total < kManyBytes) replies_.open();
  }

  void writeCalls() {
    std::string bytes;
    append(bytes, [](auto message) { message.initBootstrap().setQuestionId(0); });
    for (std::uint32_t call = 1; call <= kCalls; ++call) {
      append(bytes, [call](auto message) {
        auto request = message.initCall();
        request.setQuestionId(call);
        request.initTarget().initPromisedAnswer().setQuestionId(0);
        request.setInterfaceId(capnp::typeId<Echo>());
        request.initParams().getContent().template initAs<Echo::EchoParams>().setValue(call);
      });
      append(bytes, [call](auto message) { message.initFinish().setQuestionId(call); });
      if (call % kCallsInOneGo == 0 && !send(std::exchange(bytes, {}))) return;
    }
    hasEnded_ = true;
  }

  template <typename Fill>
  static void append(std::string& bytes, Fill fill) {
    capnp::MallocMessageBuilder builder;
    fill(builder.initRoot<capnp::rpc::Message>());
    const auto words = capnp::messageToFlatArray(builder);
    bytes.append(words.asChars().begin(), words.asChars().size());
  }

  [[nodiscard]] bool send(const std::string& bytes) const {
    for (std::size_t done = 0; done < bytes.size();) {
      const ssize_t sent =
          ::send(socket_.get(), bytes.data() + done, bytes.size() - done, MSG_NOSIGNAL);
      if (sent <= 0) return false;
      done += static_cast<std::size_t>(sent);
    }
    return true;
  }

  const test::EchoStateRef state_ = std::make_shared<test::EchoState>();
  UniqueFd socket_;
  Connection::Ref connection_;
  Gate replies_;
  std::atomic<bool> hasEnded_{false};
  std::thread reader_;
  std::thread writer_;
};

TEST(Connection, APeerThatNeverPausesHoldsUpNobody) {
  const CallOptions patient{.timeout = std::chrono::milliseconds::zero()};
  EchoPair pair;
  ASSERT_TRUE(test::echoes(pair.echo, 1));
  // Together they leave the loop without work at no time, however the machine shares its cores.
  std::array<FloodingPeer, 6> flood;
  const auto hasEnded = [&] { return std::ranges::any_of(flood, &FloodingPeer::hasEnded); };
  for (FloodingPeer& peer : flood) peer.awaitReplies();
  EventLoop::shared().runAndWait([] {});
  EXPECT_FALSE(hasEnded()) << "the mailbox waited for the flood's end";
  for (std::uint64_t i = 0; i < 10; ++i) EXPECT_TRUE(test::echoes(pair.echo, i, patient));
  EXPECT_FALSE(hasEnded()) << "calls of others waited for the flood's end";
  const NSErrorRef error = callAndWait(
      pair.echo, &Echo::Client::hangRequest, [](auto) {}, [](auto) {},
      {.timeout = std::chrono::milliseconds(1)});
  EXPECT_TRUE(test::isCocoaError(error, NSXPCConnectionTimedOut));
  EXPECT_FALSE(hasEnded()) << "a timer waited for the flood's end";
}

TEST(Connection, PathsOfAnyLengthWork) {
  test::TemporaryDirectory directory;
  const std::string deep = directory.file(std::string(120, 'd'));
  ASSERT_EQ(::mkdir(deep.c_str(), 0700), 0);
  const std::string path = deep + "/socket";
  const auto state = std::make_shared<test::EchoState>();
  NSErrorRef error;
  const auto listener =
      Listener::listen(path, [&](const PeerCredentials&) { return test::makeEcho(state); }, &error);
  ASSERT_NE(listener, nullptr) << error->description();
  const auto connection = Connection::connect(path, &error);
  ASSERT_NE(connection, nullptr) << error->description();
  EXPECT_TRUE(test::echoes(connection->bootstrap<Echo>(), 1));
}

}  // namespace
}  // namespace yomber::ipc
