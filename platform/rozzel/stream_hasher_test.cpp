#include "platform/rozzel/stream_hasher.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstddef>
#include <cstring>
#include <string>

#include "platform/rozzel/sha256.h"

namespace yomber {
namespace {

std::string contentOfSize(std::size_t size) {
  std::string content(size, '\0');
  std::uint32_t state = 7;
  for (char& byte : content) {
    state = state * 1664525 + 1013904223;
    byte = static_cast<char>(state >> 24U);
  }
  return content;
}

RZAsset hashOf(const std::string& content) {
  Sha256 hash;
  hash.update(std::as_bytes(std::span(content)));
  return hash.finish();
}

void passThrough(StreamHasher& hasher, std::string_view content) {
  while (!content.empty()) {
    const auto buffer = hasher.buffer();
    const std::size_t count = std::min(buffer.size(), content.size());
    std::memcpy(buffer.data(), content.data(), count);
    hasher.submit(count);
    content.remove_prefix(count);
  }
}

TEST(StreamHasherTest, HashesStreamsOfEveryLengthAsTheyAre) {
  constexpr std::size_t kBuffer = StreamHasher::kBufferBytes;
  for (const std::size_t size : {std::size_t{0}, std::size_t{1}, kBuffer - 1, kBuffer, kBuffer + 1,
                                 2 * kBuffer, 9 * kBuffer + 5}) {
    const std::string content = contentOfSize(size);
    StreamHasher hasher;
    passThrough(hasher, content);
    EXPECT_EQ(hasher.finish(), hashOf(content)) << size;
  }
}

TEST(StreamHasherTest, KeepsZerosInTheirPlace) {
  const std::string large = contentOfSize(3'000'000);
  for (const std::string& content : {std::string("short"), large}) {
    StreamHasher hasher;
    hasher.submitZeros(70'000);
    passThrough(hasher, content);
    hasher.submitZeros(1);
    passThrough(hasher, content);
    hasher.submitZeros(0);
    const std::string whole = std::string(70'000, '\0') + content + std::string(1, '\0') + content;
    EXPECT_EQ(hasher.finish(), hashOf(whole));
  }
}

TEST(StreamHasherTest, GivesNoBufferAwayThatIsStillToBeHashed) {
  // Overwriting each buffer as soon as it is handed out again must change nothing.
  const std::string content = contentOfSize(40 * StreamHasher::kBufferBytes);
  StreamHasher hasher;
  std::string_view rest = content;
  while (!rest.empty()) {
    const auto buffer = hasher.buffer();
    std::fill(buffer.begin(), buffer.end(), std::byte{0xee});
    std::memcpy(buffer.data(), rest.data(), buffer.size());
    hasher.submit(buffer.size());
    rest.remove_prefix(buffer.size());
  }
  EXPECT_EQ(hasher.finish(), hashOf(content));
}

TEST(StreamHasherTest, CanBeDroppedAtAnyTime) {
  for (std::size_t count = 0; count < 6; ++count) {
    StreamHasher hasher;
    passThrough(hasher, contentOfSize(count * StreamHasher::kBufferBytes));
  }
}

}  // namespace
}  // namespace yomber
