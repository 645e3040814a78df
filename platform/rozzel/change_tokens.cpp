#include "platform/rozzel/change_tokens.h"

#include "platform/rozzel/byte_stream.h"

namespace yomber {

namespace {

constexpr std::uint8_t kTokenForm = 1;
constexpr std::uint8_t kCursorForm = 1;

/// FNV-1a: tells a damaged token from a sound one.
std::uint64_t checksum(std::string_view bytes) {
  std::uint64_t sum = 14695981039346656037U;
  for (const char byte : bytes) sum = (sum ^ static_cast<std::uint8_t>(byte)) * 1099511628211U;
  return sum;
}

constexpr std::size_t kChecksumBytes = 8;

}  // namespace

RZChangeToken encodeChangeToken(const ChangePosition& position) {
  ByteSink sink;
  sink.addByte(kTokenForm);
  sink.addFixed(static_cast<std::uint64_t>(position.store));
  sink.addNumber(static_cast<std::uint64_t>(position.zone));
  sink.addNumber(static_cast<std::uint64_t>(position.sequence));
  sink.addNumber(static_cast<std::uint64_t>(position.beginning));
  std::string token = sink.take();
  ByteSink end;
  end.addFixed(checksum(token));
  return token + end.take();
}

std::optional<ChangePosition> decodeChangeToken(const RZChangeToken& token) {
  if (token.size() < kChecksumBytes) return std::nullopt;
  const std::string_view body = std::string_view(token).substr(0, token.size() - kChecksumBytes);
  if (ByteSource(std::string_view(token).substr(body.size())).fixed() != checksum(body)) {
    return std::nullopt;
  }
  ByteSource source(body);
  if (source.byte() != kTokenForm) return std::nullopt;
  ChangePosition position;
  position.store = static_cast<std::int64_t>(source.fixed());
  position.zone = static_cast<std::int64_t>(source.number());
  position.sequence = static_cast<std::int64_t>(source.number());
  position.beginning = static_cast<std::int64_t>(source.number());
  const bool sound = source.finished() && position.sequence >= 0 && position.beginning >= 0;
  return sound ? std::optional(position) : std::nullopt;
}

std::string encodeQueryCursor(std::int64_t zone, std::string_view lastName) {
  ByteSink sink;
  sink.addByte(kCursorForm);
  sink.addNumber(static_cast<std::uint64_t>(zone));
  sink.addText(lastName);
  return sink.take();
}

std::optional<std::string> decodeQueryCursor(std::int64_t zone, std::string_view cursor) {
  ByteSource source(cursor);
  if (source.byte() != kCursorForm) return std::nullopt;
  const auto cursorZone = static_cast<std::int64_t>(source.number());
  std::string name(source.text());
  if (!source.finished() || cursorZone != zone) return std::nullopt;
  return name;
}

}  // namespace yomber
