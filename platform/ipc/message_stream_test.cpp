#include "platform/ipc/message_stream.h"

#include <capnp/message.h>
#include <capnp/serialize.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstring>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "platform/foundation/sanitized.h"
#include "platform/ipc/test_echo_server.h"

namespace yomber::ipc {
namespace {

using test::Row;

/// A stream on the loop thread, driven over the raw other end of a socket pair.
class MessageStreamTest : public ::testing::Test {
 protected:
  MessageStreamTest() {
    UniqueFd inner;
    EXPECT_TRUE(makeSocketPair(inner, raw));
    EventLoop::shared().runAndWait([&] {
      stream = std::make_unique<MessageStream>(EventLoop::shared().port(), std::move(inner),
                                               MessageStream::Handshake::None,
                                               [this](NSErrorRef reason) {
                                                 endReason = std::move(reason);
                                                 ended.add();
                                               });
    });
  }
  ~MessageStreamTest() noexcept override = default;

  void TearDown() override {
    EventLoop::shared().runAndWait([&] {
      reading.reset();
      stream = nullptr;
    });
  }

  static kj::Array<capnp::word> rowMessage(std::uint64_t id, std::size_t payload = 10) {
    capnp::MallocMessageBuilder builder;
    auto row = builder.initRoot<Row>();
    row.setId(id);
    std::memset(row.initPayload(static_cast<kj::uint>(payload)).begin(), 'x', payload);
    return capnp::messageToFlatArray(builder);
  }

  void sendRaw(kj::ArrayPtr<const kj::byte> bytes) const {
    while (bytes.size() > 0) {
      const ssize_t sent = ::send(raw.get(), bytes.begin(), bytes.size(), MSG_NOSIGNAL);
      if (sent <= 0) return;
      bytes = bytes.slice(static_cast<std::size_t>(sent), bytes.size());
    }
  }

  /// Reads messages until the stream ends or fails; their ids, with the text of what their
  /// descriptors hold.
  void startReading() {
    EventLoop::shared().runAndWait([&] {
      reading = readOn().eagerlyEvaluate([this](kj::Exception&& exception) {
        failure = exception.getDescription().cStr();
        finished.add();
      });
    });
  }

  kj::Promise<void> readOn() {
    descriptors = kj::heapArray<kj::AutoCloseFd>(kMaximumDescriptors);
    return stream->tryReadMessage(descriptors, {}, nullptr)
        .then([this](kj::Maybe<capnp::MessageReaderAndFds>&& message) -> kj::Promise<void> {
          KJ_IF_MAYBE (received, message) {
            const auto row = received->reader->getRoot<Row>();
            std::string text = std::to_string(row.getId());
            for (auto& fd : received->fds) text += ":" + test::readAll(fd.get());
            seen.push_back(std::move(text));
            payloads.push_back(row.getPayload().size());
            messages.add();
            return readOn();
          }
          finished.add();
          return kj::READY_NOW;
        });
  }

  UniqueFd raw;
  std::unique_ptr<MessageStream> stream;
  std::optional<kj::Promise<void>> reading;
  kj::Array<kj::AutoCloseFd> descriptors;
  std::vector<std::string> seen;
  std::vector<std::size_t> payloads;
  std::string failure;
  NSErrorRef endReason;
  test::Tally messages;
  test::Tally finished;
  test::Tally ended;
};

TEST_F(MessageStreamTest, MessagesArriveHoweverTheBytesAreCut) {
  startReading();
  std::vector<kj::byte> all;
  for (std::uint64_t id = 0; id < 40; ++id) {
    const auto message = rowMessage(id, id * 7);
    all.insert(all.end(), message.asBytes().begin(), message.asBytes().end());
  }
  std::size_t at = 0;
  for (std::size_t cut = 1; at < all.size(); cut = cut % 61 + 1) {
    const std::size_t count = std::min(cut, all.size() - at);
    sendRaw({all.data() + at, count});
    at += count;
  }
  ASSERT_TRUE(messages.waitFor(40));
  for (std::size_t id = 0; id < 40; ++id) EXPECT_EQ(seen[id], std::to_string(id));
}

TEST_F(MessageStreamTest, LargeMessagesAreReadInPlaceAmongSmallOnes) {
  startReading();
  const std::size_t sizes[] = {10, 65'000, 65'536, 70'000, 3, 1'000'000, 20, 40'000, 40'000, 5};
  std::uint64_t id = 0;
  for (const std::size_t size : sizes) sendRaw(rowMessage(id++, size).asBytes());
  ASSERT_TRUE(messages.waitFor(std::size(sizes)));
  for (std::size_t i = 0; i < std::size(sizes); ++i) EXPECT_EQ(payloads[i], sizes[i]);
}

TEST_F(MessageStreamTest, DescriptorsBelongToTheirMessage) {
  UniqueFd peerEnd = std::move(raw);
  std::unique_ptr<MessageStream> sender;
  std::vector<kj::Array<capnp::word>> kept;
  std::vector<UniqueFd> pipes;
  // All at once, so that the receiver finds many in one go.
  EventLoop::shared().runAndWait([&] {
    sender = std::make_unique<MessageStream>(EventLoop::shared().port(), std::move(peerEnd),
                                             MessageStream::Handshake::None, nullptr);
    kj::Promise<void> sent = kj::READY_NOW;
    for (std::uint64_t id = 0; id < 60; ++id) {
      sent = sent.then([&, id]() -> kj::Promise<void> {
        auto builder = kj::heap<capnp::MallocMessageBuilder>();
        auto row = builder->initRoot<Row>();
        row.setId(id);
        if (id % 7 == 3) row.initPayload(30'000);
        std::vector<int> fds;
        for (std::uint64_t i = 0; id % 3 == 0 && i <= id % 2; ++i) {
          pipes.push_back(test::pipeHolding("p" + std::to_string(id)));
          fds.push_back(pipes.back().get());
        }
        auto owned = kj::heapArray<int>(fds.data(), fds.size());
        auto promise = sender->writeMessage(owned, builder->getSegmentsForOutput());
        return promise.attach(kj::mv(builder), kj::mv(owned));
      });
    }
    EventLoop::shared().detach(kj::mv(sent));
  });
  startReading();
  EXPECT_TRUE(messages.waitFor(60));
  EventLoop::shared().runAndWait([&] { sender = nullptr; });
  ASSERT_EQ(seen.size(), 60U);
  for (std::uint64_t id = 0; id < 60; ++id) {
    std::string expected = std::to_string(id);
    const std::string pipe = "p" + std::to_string(id);
    if (id % 3 == 0) expected += ":" + pipe;
    if (id % 3 == 0 && id % 2 == 1) expected += ":" + pipe;
    EXPECT_EQ(seen[id], expected);
  }
}

TEST_F(MessageStreamTest, AWriterOfMuchWaitsForASlowReader) {
  constexpr std::uint64_t kMessages = 2000;
  std::uint64_t written = 0;
  auto message = rowMessage(5, 2000);
  EventLoop::shared().runAndWait([&] {
    auto body = kj::heapArray<kj::ArrayPtr<const capnp::word>>(1);
    body[0] = message.slice(1, message.size());
    kj::Promise<void> all = kj::READY_NOW;
    for (std::uint64_t i = 0; i < kMessages; ++i) {
      all = all.then([this, segments = body.asPtr()] { return stream->writeMessage({}, segments); })
                .then([&written] { ++written; });
    }
    EventLoop::shared().detach(all.attach(kj::mv(body)));
  });
  const auto before = EventLoop::shared().runAndWait([&] { return written; });
  EXPECT_LT(before, kMessages) << "the socket and the queue cannot hold all";
  std::size_t total = 0;
  std::vector<char> buffer(1 << 16);
  while (total < kMessages * message.asBytes().size()) {
    const ssize_t count = ::recv(raw.get(), buffer.data(), buffer.size(), 0);
    ASSERT_GT(count, 0);
    total += static_cast<std::size_t>(count);
  }
  EXPECT_EQ(total, kMessages * message.asBytes().size());
}

TEST_F(MessageStreamTest, TheEndOfTheStreamIsAnInterruption) {
  startReading();
  sendRaw(rowMessage(1).asBytes());
  raw.reset();
  ASSERT_TRUE(finished.waitFor(1));
  EXPECT_EQ(seen, std::vector<std::string>{"1"});
  EXPECT_EQ(failure, "");
  EXPECT_TRUE(test::isCocoaError(endReason, NSXPCConnectionInterrupted));
}

TEST_F(MessageStreamTest, ATruncatedMessageIsTheEnd) {
  const auto message = rowMessage(1, 100'000);
  startReading();
  sendRaw(message.asBytes().slice(0, 70'001));
  raw.reset();
  ASSERT_TRUE(finished.waitFor(1));
  EXPECT_TRUE(seen.empty());
  EXPECT_TRUE(test::isCocoaError(endReason, NSXPCConnectionInterrupted));
}

TEST_F(MessageStreamTest, TooManySegmentsAreRefused) {
  const std::uint32_t header[] = {512, 1};
  startReading();
  sendRaw(kj::arrayPtr(reinterpret_cast<const kj::byte*>(header), sizeof header));
  ASSERT_TRUE(finished.waitFor(1));
  EXPECT_NE(failure.find("too many segments"), std::string::npos);
  EXPECT_TRUE(test::isCocoaError(endReason, NSXPCConnectionInvalid));
}

TEST_F(MessageStreamTest, TooLargeMessagesAreRefusedByTheirHeader) {
  const std::uint32_t header[] = {1, 0xFFFFFFFF, 0xFFFFFFFF, 0};
  startReading();
  sendRaw(kj::arrayPtr(reinterpret_cast<const kj::byte*>(header), sizeof header));
  ASSERT_TRUE(finished.waitFor(1));
  EXPECT_NE(failure.find("too large"), std::string::npos);
  EXPECT_TRUE(test::isCocoaError(endReason, NSXPCConnectionInvalid));
}

TEST_F(MessageStreamTest, AnAnnouncedMessageCostsOnlyWhatArrives) {
  if (kIsSanitized) GTEST_SKIP() << "the sanitizers' own memory would be measured";
  const auto residentKiB = [] {
    rusage usage{};
    ::getrusage(RUSAGE_SELF, &usage);
    return usage.ru_maxrss;
  };
  const std::uint32_t header[] = {0, static_cast<std::uint32_t>(kMaximumMessageWords - 1)};
  std::vector<kj::byte> bytes(70'000);
  std::memcpy(bytes.data(), header, sizeof header);
  const long before = residentKiB();
  startReading();
  sendRaw({bytes.data(), bytes.size()});
  raw.reset();
  ASSERT_TRUE(finished.waitFor(1));
  EXPECT_LT(residentKiB() - before, 8 * 1024);
}

}  // namespace
}  // namespace yomber::ipc
