#pragma once

#include <capnp/serialize-async.h>
#include <kj/async-unix.h>
#include <sys/socket.h>
#include <sys/uio.h>

#include <cstddef>
#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <utility>
#include <vector>

#include "platform/foundation/error.h"
#include "platform/ipc/unix_socket.h"

namespace yomber::ipc {

/// What one message may hold, its framing included: 64 MiB.
inline constexpr std::uint64_t kMaximumMessageWords = 8 * 1024 * 1024;
/// What the parameters of a call may hold, so that the message around them fits too.
inline constexpr std::uint64_t kMaximumPayloadWords = kMaximumMessageWords - 1024;
/// What may wait to be sent: two of the largest replies, so that one can be made while another is
/// on its way; and so many small ones, each of which takes some 9 KiB until it is sent, and stack
/// when all are dropped at once.
inline constexpr std::size_t kMaximumBacklogBytes = 2 * kMaximumMessageWords * sizeof(capnp::word);
inline constexpr std::size_t kMaximumBacklogMessages = 4096;
/// Who reads at all takes something in much sooner.
inline constexpr auto kBacklogPatience = 2 * kj::SECONDS;
/// Descriptors that one message may bring; more are closed unseen.
inline constexpr unsigned kMaximumDescriptors = 16;

/// Cap'n Proto messages with descriptors over a Unix stream socket.
///
/// Made for many small messages: one system call takes in all that has arrived, and what is written
/// during one turn of the loop goes out in one call at its end. A message with descriptors is sent
/// by a call of its own, so that the receiver can tell whose they are: they belong to the last
/// message that begins in what one receive brought.
///
/// Bounds: at most kMaximumMessageWords and 512 segments; memory for a message grows only with what
/// arrives of it. Larger messages are refused by the layers above before they get here. While more
/// than the maximum backlog waits for the peer, nothing more is read from it, and one that takes in
/// nothing for kBacklogPatience is disconnected.
///
/// Loop thread only.
class MessageStream final : public capnp::MessageStream {
 public:
  enum class Handshake : std::uint8_t { None, Credentials };
  /// Called once, when the peer is gone, was refused, or broke the protocol, or a write failed.
  using OnEnd = std::function<void(NSErrorRef reason)>;

  /// With Handshake::Credentials, nothing is sent and nothing parsed until the peer's first byte
  /// came with credentials of our own user; see `sendCredentials`.
  MessageStream(kj::UnixEventPort& port, UniqueFd socket, Handshake handshake, OnEnd onEnd);
  ~MessageStream();

  /// What waits behind this stream to be written to it, and is in it.
  struct Backlog {
    std::size_t bytes = 0;
    std::size_t messages = 0;
  };
  /// To be called before anything is read. `measure` is called as long as this stream lives.
  void limitBacklog(std::function<Backlog()> measure) { measureBacklog_ = std::move(measure); }

  /// Sends this process's half of the handshake. 0 or an errno value.
  static int sendCredentials(int socket);
  enum class Proof : std::uint8_t { NotYet, Given, PeerLeft, Refused };
  /// Takes the peer's half, and no more, without waiting for it; the last two say why in `refusal`.
  static Proof receiveCredentials(int socket, std::string& refusal);

  /// Sends what is queued as far as the socket takes it at once.
  void flushNow();

  kj::Promise<kj::Maybe<capnp::MessageReaderAndFds>> tryReadMessage(
      kj::ArrayPtr<kj::AutoCloseFd> fdSpace, capnp::ReaderOptions options,
      kj::ArrayPtr<capnp::word> scratchSpace) override;
  kj::Promise<void> writeMessage(
      kj::ArrayPtr<const int> fds,
      kj::ArrayPtr<const kj::ArrayPtr<const capnp::word>> segments) override;
  kj::Promise<void> writeMessages(
      kj::ArrayPtr<kj::ArrayPtr<const kj::ArrayPtr<const capnp::word>>> messages) override;
  kj::Maybe<int> getSendBufferSize() override;
  kj::Promise<void> end() override;

 private:
  using Segments = kj::ArrayPtr<const kj::ArrayPtr<const capnp::word>>;
  enum class Received : std::uint8_t { Some, Nothing, EndOfStream };

  /// Descriptors that came with the bytes up to `endOffset` of the stream.
  struct DescriptorBatch {
    std::uint64_t endOffset;
    std::vector<kj::AutoCloseFd> descriptors;
  };
  /// A message too large for the buffer, read into its final place.
  struct LargeMessage {
    kj::Array<capnp::word> words;
    std::size_t filled;  ///< bytes
  };
  /// A message that is written from its own memory: it is large, or has descriptors.
  struct DirectWrite {
    kj::ArrayPtr<const int> descriptors;
    std::vector<std::uint32_t> header;
    std::vector<iovec> pieces;
    std::size_t nextPiece;
  };

  // Receiving.
  void verifyPeer();
  /// When all that the loop has to do now is done, and sent.
  kj::Promise<void> afterTurn();
  kj::Maybe<kj::Array<capnp::word>> takeMessage();
  kj::ArrayPtr<kj::AutoCloseFd> takeDescriptors(std::uint64_t endOffset,
                                                kj::ArrayPtr<kj::AutoCloseFd> space);
  Received receive();
  void keepDescriptors(msghdr& message);
  void advanceReceived(std::size_t count);
  [[nodiscard]] std::span<const std::byte> buffered() const;
  void makeRoom();
  void giveBufferBack();
  [[noreturn]] void refusePeer(std::string text);

  // Sending.
  void append(Segments segments);
  void scheduleFlush();
  /// Writes until all is out or the socket is full; false in the second case.
  bool flush();
  bool sendQueued();
  bool sendDirect();
  void flushOrWait();
  kj::Promise<void> waitAndFlush();
  kj::Promise<void> whenRoom();
  void failWriting(int number);
  [[nodiscard]] bool hasTooMuchWaiting() const;
  /// While the socket is full. `sent`: what the peer had taken in at `since`.
  kj::Promise<void> watchBacklog(std::uint64_t sent, kj::TimePoint since);
  void giveUpPeer(const Backlog& backlog);

  void reportEnd(std::int64_t code, std::string text);

  /// Observes only while the socket is full: else every message that the peer takes would wake the
  /// loop for nothing.
  struct RoomObserver {
    RoomObserver(kj::UnixEventPort& port, UniqueFd socket)
        : descriptor(std::move(socket)),
          observer(port, descriptor.get(), kj::UnixEventPort::FdObserver::OBSERVE_WRITE) {}
    const UniqueFd descriptor;
    kj::UnixEventPort::FdObserver observer;
  };

  UniqueFd socket_;
  OnEnd onEnd_;
  kj::UnixEventPort& port_;
  kj::UnixEventPort::FdObserver observer_;
  bool verified_;

  std::unique_ptr<std::byte[]> buffer_;  ///< of kBufferBytes; none while nothing is in it
  std::size_t begin_ = 0;
  std::size_t end_ = 0;
  std::optional<LargeMessage> large_;
  std::uint64_t consumedOffset_ = 0;  ///< of the stream: where the next message begins
  std::uint64_t receivedOffset_ = 0;
  std::deque<DescriptorBatch> batches_;
  /// Set while an edge of readability is awaited; armed before each receive, so that none is lost.
  std::optional<kj::Promise<void>> readable_;
  std::size_t takenInOneGo_ = 0;  ///< messages, since the last end of the loop's turn

  std::function<Backlog()> measureBacklog_;
  std::uint64_t sentBytes_ = 0;  ///< that the socket has taken
  std::vector<std::byte> queued_;
  std::size_t queuedSent_ = 0;
  std::optional<DirectWrite> direct_;
  kj::Maybe<kj::Own<kj::PromiseFulfiller<void>>> writeDone_;
  bool writingFailed_ = false;
  bool flushScheduled_ = false;
  bool waitingForRoom_ = false;
  std::optional<RoomObserver> roomObserver_;
  kj::Promise<void> flushTask_ = nullptr;
  kj::Promise<void> roomTask_ = nullptr;
  kj::Promise<void> backlogTask_ = nullptr;
};

}  // namespace yomber::ipc
