#include "platform/ipc/message_stream.h"

#include <capnp/serialize.h>
#include <kj/debug.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <string>
#include <utility>

#include "platform/foundation/log.h"
#include "platform/ipc/error_codec.h"

namespace yomber::ipc {

namespace {

using capnp::word;

constexpr std::size_t kBufferBytes = 64 * 1024;
constexpr std::uint32_t kMaximumSegments = 512;
/// Larger messages are written from where they are instead of being copied to the queue.
constexpr std::size_t kCopiedBytes = 16 * 1024;
/// With so much queued, the writer is told to wait.
constexpr std::size_t kQueuedBytes = 256 * 1024;
constexpr std::size_t kMaximumPieces = 256;
constexpr std::size_t kMaximumBatches = 4;
constexpr char kPreamble = 'Y';
/// How often a full socket is tried again when there is no descriptor left to observe it with.
constexpr auto kRoomPolling = 5 * kj::MILLISECONDS;

/// After so many messages the loop gets to the end of its turn, where what was written is sent: a
/// peer that never pauses would put that off for ever, for itself and for everybody else.
constexpr std::size_t kMessagesInOneGo = 256;
/// How often a backlog is looked at.
constexpr auto kBacklogPolling = 50 * kj::MILLISECONDS;

constexpr std::size_t kDescriptorSpace = CMSG_SPACE(sizeof(int) * kMaximumDescriptors);
constexpr std::size_t kCredentialSpace = CMSG_SPACE(sizeof(ucred));

kj::Exception disconnected(const std::string& text) {
  return {kj::Exception::Type::DISCONNECTED, __FILE__, __LINE__, kj::heapString(text.c_str())};
}

/// Words of the framing before a message of so many segments.
constexpr std::size_t headerWords(std::size_t segments) { return segments / 2 + 1; }

/// The whole message's words as its first bytes say; nothing when too few are there. Throws when
/// they begin no message that we take.
std::optional<std::uint64_t> messageWords(std::span<const std::byte> bytes) {
  const auto at = [bytes](std::size_t index) {
    std::uint32_t value = 0;
    std::memcpy(&value, bytes.data() + index * sizeof value, sizeof value);
    return value;
  };
  if (bytes.size() < sizeof(std::uint32_t)) return std::nullopt;
  const std::uint64_t segments = std::uint64_t{at(0)} + 1;
  KJ_REQUIRE(segments <= kMaximumSegments, "The message has too many segments.", segments);
  const std::size_t header = headerWords(segments);
  if (bytes.size() < header * sizeof(word)) return std::nullopt;
  std::uint64_t total = header;
  for (std::size_t i = 1; i <= segments; ++i) total += at(i);
  KJ_REQUIRE(total <= kMaximumMessageWords, "The message is too large.", total);
  return total;
}

std::vector<std::uint32_t> makeHeader(kj::ArrayPtr<const kj::ArrayPtr<const word>> segments) {
  std::vector<std::uint32_t> header(headerWords(segments.size()) * 2);
  header[0] = static_cast<std::uint32_t>(segments.size() - 1);
  for (std::size_t i = 0; i < segments.size(); ++i) {
    header[i + 1] = static_cast<std::uint32_t>(segments[i].size());
  }
  return header;
}

/// The loop thread's spare receive buffer, so that connections that are idle hold none.
thread_local std::unique_ptr<std::byte[]> spareBuffer;

std::unique_ptr<std::byte[]> borrowBuffer() {
  if (spareBuffer) return std::move(spareBuffer);
  return std::make_unique_for_overwrite<std::byte[]>(kBufferBytes);
}

iovec pieceOf(const void* data, std::size_t bytes) {
  return {.iov_base = const_cast<void*>(data), .iov_len = bytes};  // NOLINT: sending only reads
}

/// Drops `bytes` that were sent from the pieces from `next` on.
void advancePieces(std::vector<iovec>& pieces, std::size_t& next, std::size_t bytes) {
  while (next < pieces.size() && bytes >= pieces[next].iov_len) bytes -= pieces[next++].iov_len;
  if (next == pieces.size()) return;
  pieces[next].iov_base = static_cast<std::byte*>(pieces[next].iov_base) + bytes;
  pieces[next].iov_len -= bytes;
}

/// What came with the message.
std::vector<kj::AutoCloseFd> descriptorsOf(msghdr& message) {
  std::vector<kj::AutoCloseFd> descriptors;
  for (cmsghdr* header = CMSG_FIRSTHDR(&message); header != nullptr;
       header = CMSG_NXTHDR(&message, header)) {
    if (header->cmsg_level != SOL_SOCKET || header->cmsg_type != SCM_RIGHTS) continue;
    const std::size_t count = (header->cmsg_len - CMSG_LEN(0)) / sizeof(int);
    for (std::size_t i = 0; i < count; ++i) {
      int descriptor = -1;
      std::memcpy(&descriptor, CMSG_DATA(header) + i * sizeof descriptor, sizeof descriptor);
      descriptors.emplace_back(descriptor);
    }
  }
  return descriptors;
}

}  // namespace

MessageStream::MessageStream(kj::UnixEventPort& port, UniqueFd socket, Handshake handshake,
                             OnEnd onEnd)
    : socket_(std::move(socket)),
      onEnd_(std::move(onEnd)),
      port_(port),
      observer_(port, socket_.get(), kj::UnixEventPort::FdObserver::OBSERVE_READ),
      verified_(handshake == Handshake::None) {}

MessageStream::~MessageStream() = default;

void MessageStream::reportEnd(std::int64_t code, std::string text) {
  if (!onEnd_) return;
  std::exchange(onEnd_, nullptr)(connectionError(code, std::move(text)));
}

// ---- The handshake ---------------------------------------------------------------------------

int MessageStream::sendCredentials(int socket) {
  const int on = 1;
  if (::setsockopt(socket, SOL_SOCKET, SO_PASSCRED, &on, sizeof on) != 0) return errno;
  char byte = kPreamble;
  iovec piece{.iov_base = &byte, .iov_len = 1};
  alignas(cmsghdr) std::array<std::byte, kCredentialSpace> control{};
  msghdr message{};
  message.msg_iov = &piece;
  message.msg_iovlen = 1;
  message.msg_control = control.data();
  message.msg_controllen = control.size();
  cmsghdr* header = CMSG_FIRSTHDR(&message);
  header->cmsg_level = SOL_SOCKET;
  header->cmsg_type = SCM_CREDENTIALS;
  header->cmsg_len = CMSG_LEN(sizeof(ucred));
  const ucred own{.pid = ::getpid(), .uid = ::geteuid(), .gid = ::getegid()};
  std::memcpy(CMSG_DATA(header), &own, sizeof own);
  return ::sendmsg(socket, &message, MSG_NOSIGNAL | MSG_DONTWAIT) == 1 ? 0 : errno;
}

void MessageStream::refusePeer(std::string text) {
  reportEnd(NSXPCConnectionInvalid, text);
  ::shutdown(socket_.get(), SHUT_RDWR);
  kj::throwFatalException(disconnected(text));
}

MessageStream::Proof MessageStream::receiveCredentials(int socket, std::string& refusal) {
  char byte = 0;
  iovec piece{.iov_base = &byte, .iov_len = 1};
  alignas(cmsghdr) std::array<std::byte, kCredentialSpace + kDescriptorSpace> control{};
  msghdr message{};
  message.msg_iov = &piece;
  message.msg_iovlen = 1;
  message.msg_control = control.data();
  message.msg_controllen = control.size();
  const ssize_t count = ::recvmsg(socket, &message, MSG_CMSG_CLOEXEC | MSG_DONTWAIT);
  if (count != 1) {
    if (count < 0 && (errno == EAGAIN || errno == EINTR)) return Proof::NotYet;
    refusal = "The peer went away before it proved its user.";
    return Proof::PeerLeft;
  }
  (void)descriptorsOf(message);  // closed unseen
  ucred peer{};
  for (cmsghdr* header = CMSG_FIRSTHDR(&message); header != nullptr;
       header = CMSG_NXTHDR(&message, header)) {
    if (header->cmsg_level != SOL_SOCKET || header->cmsg_type != SCM_CREDENTIALS) continue;
    std::memcpy(&peer, CMSG_DATA(header), sizeof peer);
  }
  // Without credentials the kernel fills in the overflow user and no process.
  if (peer.pid == 0 || byte != kPreamble) {
    refusal = "The peer did not prove its user.";
    return Proof::Refused;
  }
  if (peer.uid != ::geteuid()) {
    refusal = "The peer, process " + std::to_string(peer.pid) + ", belongs to user " +
              std::to_string(peer.uid) +
              " and was refused: only the user's own processes may connect.";
    return Proof::Refused;
  }
  const int off = 0;
  ::setsockopt(socket, SOL_SOCKET, SO_PASSCRED, &off, sizeof off);
  return Proof::Given;
}

void MessageStream::verifyPeer() {
  std::string refusal;
  const Proof proof = receiveCredentials(socket_.get(), refusal);
  if (proof == Proof::NotYet) return;
  if (proof != Proof::Given) refusePeer(std::move(refusal));
  verified_ = true;
  scheduleFlush();
}

// ---- Receiving -------------------------------------------------------------------------------

kj::Promise<kj::Maybe<capnp::MessageReaderAndFds>> MessageStream::tryReadMessage(
    kj::ArrayPtr<kj::AutoCloseFd> fdSpace, capnp::ReaderOptions options,
    kj::ArrayPtr<word> scratchSpace) {
  using Result = kj::Maybe<capnp::MessageReaderAndFds>;
  const auto again = [this, fdSpace, options, scratchSpace] {
    return tryReadMessage(fdSpace, options, scratchSpace);
  };
  for (;;) {
    if (takenInOneGo_ == kMessagesInOneGo) return afterTurn().then(kj::cp(again));
    if (hasTooMuchWaiting()) {
      return port_.getTimer().afterDelay(kBacklogPolling).then(kj::cp(again));
    }
    KJ_IF_MAYBE (words, takeMessage()) {
      ++takenInOneGo_;
      auto fds = takeDescriptors(consumedOffset_, fdSpace);
      auto reader = kj::heap<capnp::FlatArrayMessageReader>(*words, options);
      return Result(capnp::MessageReaderAndFds{reader.attach(kj::mv(*words)), fds});
    }
    const Received received = receive();
    if (received == Received::EndOfStream) {
      reportEnd(NSXPCConnectionInterrupted, "The peer went away.");
      return Result(nullptr);
    }
    if (received == Received::Some) continue;
    kj::Promise<void> ready = kj::mv(*readable_);
    readable_.reset();
    return ready.then(kj::cp(again));
  }
}

kj::Promise<void> MessageStream::afterTurn() {
  // What comes last runs before what was to come last earlier, such as the sending of others. So
  // it only steps aside, until the loop has asked the system for news.
  return kj::evalLast([this] {
    takenInOneGo_ = 0;
    return port_.getTimer().afterDelay(0 * kj::NANOSECONDS);
  });
}

std::span<const std::byte> MessageStream::buffered() const {
  return {buffer_.get() + begin_, end_ - begin_};
}

kj::Maybe<kj::Array<word>> MessageStream::takeMessage() {
  if (large_) {
    if (large_->filled < large_->words.asBytes().size()) return nullptr;
    auto words = kj::mv(large_->words);
    large_.reset();
    consumedOffset_ += words.asBytes().size();
    return words;
  }
  std::optional<std::uint64_t> size;
  KJ_IF_MAYBE (exception, kj::runCatchingExceptions([&] { size = messageWords(buffered()); })) {
    reportEnd(NSXPCConnectionInvalid,
              "The peer sent bytes that are no message, and was disconnected.");
    kj::throwFatalException(kj::mv(*exception));
  }
  if (!size) return nullptr;
  const std::size_t bytes = *size * sizeof(word);
  const std::size_t available = std::min(bytes, buffered().size());
  if (available < bytes && bytes <= kBufferBytes) return nullptr;
  auto words = kj::heapArray<word>(*size);
  std::memcpy(words.begin(), buffered().data(), available);
  begin_ += available;
  if (available < bytes) {
    large_.emplace(LargeMessage{kj::mv(words), available});
    return nullptr;
  }
  consumedOffset_ += bytes;
  return words;
}

kj::ArrayPtr<kj::AutoCloseFd> MessageStream::takeDescriptors(std::uint64_t endOffset,
                                                             kj::ArrayPtr<kj::AutoCloseFd> space) {
  std::size_t count = 0;
  while (!batches_.empty() && batches_.front().endOffset <= endOffset) {
    for (auto& descriptor : batches_.front().descriptors) {
      if (count < space.size()) space[count++] = kj::mv(descriptor);
    }
    batches_.pop_front();
  }
  return space.slice(0, count);
}

void MessageStream::makeRoom() {
  if (!buffer_) buffer_ = borrowBuffer();
  if (begin_ == end_) {
    begin_ = end_ = 0;
  } else if (begin_ > kBufferBytes / 2 || end_ == kBufferBytes) {
    std::memmove(buffer_.get(), buffer_.get() + begin_, end_ - begin_);
    end_ -= std::exchange(begin_, 0);
  }
}

void MessageStream::giveBufferBack() {
  begin_ = end_ = 0;
  spareBuffer = std::move(buffer_);
}

MessageStream::Received MessageStream::receive() {
  if (!readable_) readable_.emplace(observer_.whenBecomesReadable());
  if (!verified_) {
    verifyPeer();
    if (!verified_) return Received::Nothing;
  }
  makeRoom();
  std::array<iovec, 2> pieces{};
  std::size_t count = 0;
  if (large_) {
    const auto bytes = large_->words.asBytes();
    pieces[count++] = pieceOf(bytes.begin() + large_->filled, bytes.size() - large_->filled);
  }
  pieces[count++] = pieceOf(buffer_.get() + end_, kBufferBytes - end_);
  alignas(cmsghdr) std::array<std::byte, kDescriptorSpace> control;
  msghdr message{};
  message.msg_iov = pieces.data();
  message.msg_iovlen = count;
  message.msg_control = control.data();
  message.msg_controllen = control.size();
  const ssize_t received = ::recvmsg(socket_.get(), &message, MSG_CMSG_CLOEXEC | MSG_DONTWAIT);
  if (received > 0) {
    receivedOffset_ += static_cast<std::uint64_t>(received);
    if (message.msg_controllen > 0) keepDescriptors(message);
    advanceReceived(static_cast<std::size_t>(received));
    return Received::Some;
  }
  if (received < 0 && errno == EINTR) return Received::Some;
  if (received < 0 && errno == EAGAIN) {
    if (begin_ == end_) giveBufferBack();
    return Received::Nothing;
  }
  // Whatever else it is (reset, usually), no more will come.
  return Received::EndOfStream;
}

void MessageStream::advanceReceived(std::size_t count) {
  if (large_) {
    const std::size_t taken = std::min(count, large_->words.asBytes().size() - large_->filled);
    large_->filled += taken;
    count -= taken;
  }
  end_ += count;
}

void MessageStream::keepDescriptors(msghdr& message) {
  DescriptorBatch batch{.endOffset = receivedOffset_, .descriptors = descriptorsOf(message)};
  if (batch.descriptors.empty()) return;
  // Complete messages were taken before, so these all came with one that is not complete.
  if (batches_.size() == kMaximumBatches) refusePeer("The peer sent too many descriptors.");
  batches_.push_back(std::move(batch));
}

// ---- Sending ---------------------------------------------------------------------------------

kj::Promise<void> MessageStream::writeMessage(kj::ArrayPtr<const int> fds, Segments segments) {
  if (writingFailed_) return kj::READY_NOW;
  std::size_t words = headerWords(segments.size());
  for (const auto& segment : segments) words += segment.size();
  KJ_REQUIRE(words <= kMaximumMessageWords, "The message is too large.", words);

  if (fds.size() == 0 && words * sizeof(word) <= kCopiedBytes && !direct_) {
    append(segments);
    scheduleFlush();
    if (queued_.size() - queuedSent_ <= kQueuedBytes) return kj::READY_NOW;
  } else {
    KJ_REQUIRE(!direct_, "One message is written after the other.");
    direct_.emplace(DirectWrite{fds, makeHeader(segments), {}, 0});
    DirectWrite& write = *direct_;
    write.pieces.push_back(
        pieceOf(write.header.data(), write.header.size() * sizeof(std::uint32_t)));
    for (const auto& segment : segments) {
      if (segment.size() > 0) {
        write.pieces.push_back(pieceOf(segment.begin(), segment.size() * sizeof(word)));
      }
    }
    scheduleFlush();
  }
  auto done = kj::newPromiseAndFulfiller<void>();
  writeDone_ = kj::mv(done.fulfiller);
  return kj::mv(done.promise);
}

kj::Promise<void> MessageStream::writeMessages(
    kj::ArrayPtr<kj::ArrayPtr<const kj::ArrayPtr<const word>>> messages) {
  if (messages.size() == 0) return kj::READY_NOW;
  return writeMessage({}, messages[0]).then([this, messages]() mutable {
    return writeMessages(messages.slice(1, messages.size()));
  });
}

void MessageStream::append(Segments segments) {
  const auto add = [this](const void* data, std::size_t bytes) {
    const auto* first = static_cast<const std::byte*>(data);
    queued_.insert(queued_.end(), first, first + bytes);
  };
  const auto header = makeHeader(segments);
  add(header.data(), header.size() * sizeof(std::uint32_t));
  for (const auto& segment : segments) add(segment.begin(), segment.size() * sizeof(word));
}

void MessageStream::scheduleFlush() {
  if (flushScheduled_ || waitingForRoom_) return;
  flushScheduled_ = true;
  flushTask_ = kj::evalLast([this] {
                 flushScheduled_ = false;
                 takenInOneGo_ = 0;
                 flushOrWait();
               }).eagerlyEvaluate(nullptr);
}

void MessageStream::flushOrWait() {
  if (!verified_ || waitingForRoom_ || flush()) return;
  waitingForRoom_ = true;
  roomTask_ = waitAndFlush().eagerlyEvaluate(nullptr);
  backlogTask_ = watchBacklog(sentBytes_, port_.getTimer().now()).eagerlyEvaluate(nullptr);
}

bool MessageStream::hasTooMuchWaiting() const {
  if (!waitingForRoom_ || writingFailed_ || !measureBacklog_) return false;
  const Backlog backlog = measureBacklog_();
  return backlog.bytes > kMaximumBacklogBytes || backlog.messages > kMaximumBacklogMessages;
}

kj::Promise<void> MessageStream::watchBacklog(std::uint64_t sent, kj::TimePoint since) {
  return port_.getTimer().afterDelay(kBacklogPolling).then([this, sent, since] {
    if (!waitingForRoom_) return kj::Promise<void>(kj::READY_NOW);
    const kj::TimePoint now = port_.getTimer().now();
    if (sent != sentBytes_ || !hasTooMuchWaiting()) return watchBacklog(sentBytes_, now);
    if (now - since < kBacklogPatience) return watchBacklog(sent, since);
    giveUpPeer(measureBacklog_());
    return kj::Promise<void>(kj::READY_NOW);
  });
}

void MessageStream::giveUpPeer(const Backlog& backlog) {
  const auto peer = peerCredentials(socket_.get());
  log_error(defaultLog(),
            "[ERROR] process %d takes in nothing while %zu bytes in %zu messages wait for it; its "
            "connection is closed",
            peer ? peer->pid : 0, backlog.bytes, backlog.messages);
  failWriting(EPIPE);  // silent: the reason is ours
  reportEnd(NSXPCConnectionInvalid,
            "The peer takes in nothing of what was sent to it, and was disconnected.");
  ::shutdown(socket_.get(), SHUT_RDWR);
}

kj::Promise<void> MessageStream::waitAndFlush() {
  return whenRoom().then([this]() -> kj::Promise<void> {
    if (!flush()) return waitAndFlush();
    roomObserver_.reset();
    waitingForRoom_ = false;
    return kj::READY_NOW;
  });
}

kj::Promise<void> MessageStream::whenRoom() {
  if (!roomObserver_) {
    // A descriptor of its own, since a port observes each only once.
    UniqueFd descriptor = duplicateDescriptor(socket_.get());
    if (!descriptor) return port_.getTimer().afterDelay(kRoomPolling);
    roomObserver_.emplace(port_, std::move(descriptor));
  }
  return roomObserver_->observer.whenBecomesWritable();
}

bool MessageStream::flush() {
  if (!sendQueued() || !sendDirect()) return false;
  KJ_IF_MAYBE (done, writeDone_) {
    (*done)->fulfill();
    writeDone_ = nullptr;
  }
  return true;
}

bool MessageStream::sendQueued() {
  while (queuedSent_ < queued_.size()) {
    const ssize_t sent = ::send(socket_.get(), queued_.data() + queuedSent_,
                                queued_.size() - queuedSent_, MSG_NOSIGNAL | MSG_DONTWAIT);
    if (sent >= 0) {
      queuedSent_ += static_cast<std::size_t>(sent);
      sentBytes_ += static_cast<std::uint64_t>(sent);
    } else if (errno == EAGAIN) {
      return false;
    } else if (errno != EINTR) {
      failWriting(errno);
    }
  }
  queued_.clear();
  queuedSent_ = 0;
  return true;
}

bool MessageStream::sendDirect() {
  while (direct_ && direct_->nextPiece < direct_->pieces.size()) {
    DirectWrite& write = *direct_;
    std::vector<std::byte> control(
        write.descriptors.size() > 0 ? CMSG_SPACE(write.descriptors.size() * sizeof(int)) : 0);
    msghdr message{};
    message.msg_iov = &write.pieces[write.nextPiece];
    message.msg_iovlen = std::min(write.pieces.size() - write.nextPiece, kMaximumPieces);
    if (!control.empty()) {
      message.msg_control = control.data();
      message.msg_controllen = control.size();
      cmsghdr* header = CMSG_FIRSTHDR(&message);
      header->cmsg_level = SOL_SOCKET;
      header->cmsg_type = SCM_RIGHTS;
      header->cmsg_len = CMSG_LEN(write.descriptors.size() * sizeof(int));
      std::memcpy(CMSG_DATA(header), write.descriptors.begin(),
                  write.descriptors.size() * sizeof(int));
    }
    const ssize_t sent = ::sendmsg(socket_.get(), &message, MSG_NOSIGNAL | MSG_DONTWAIT);
    if (sent >= 0) {
      write.descriptors = nullptr;
      sentBytes_ += static_cast<std::uint64_t>(sent);
      advancePieces(write.pieces, write.nextPiece, static_cast<std::size_t>(sent));
    } else if (errno == EAGAIN) {
      return false;
    } else if (errno != EINTR) {
      failWriting(errno);
    }
  }
  direct_.reset();
  return true;
}

void MessageStream::failWriting(int number) {
  // The writers are told nothing: what the peer sent before it left is still read, and then the end
  // is seen there.
  writingFailed_ = true;
  queued_.clear();
  queuedSent_ = 0;
  direct_.reset();
  if (number == EPIPE || number == ECONNRESET) return;
  reportEnd(NSXPCConnectionInterrupted,
            std::string("Writing to the peer failed: ") + std::strerror(number) + ".");
  ::shutdown(socket_.get(), SHUT_RDWR);
}

void MessageStream::flushNow() {
  if (verified_) flush();
}

kj::Maybe<int> MessageStream::getSendBufferSize() {
  int size = 0;
  socklen_t length = sizeof size;
  if (::getsockopt(socket_.get(), SOL_SOCKET, SO_SNDBUF, &size, &length) != 0) return nullptr;
  return size;
}

kj::Promise<void> MessageStream::end() {
  // Asked for before the stream itself saw an end, this means that a message made no sense.
  reportEnd(NSXPCConnectionInvalid, "The peer broke the protocol, and was disconnected.");
  flushNow();
  ::shutdown(socket_.get(), SHUT_WR);
  return kj::READY_NOW;
}

}  // namespace yomber::ipc
