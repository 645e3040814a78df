#pragma once

#include <cstdint>

/// What is said on the socket (SOCK_SEQPACKET) between whoever wants a picture drawn and the
/// process that draws. One request at a time, each answered by one reply. Both are of one build.
namespace yomber::drawing {

/// The drawing process has its end of the socket as this descriptor.
inline constexpr int kSocket = 3;
inline constexpr std::uint32_t kMagic = 0x59445236;

enum class Form : std::uint32_t {
  Smallest,  ///< JPEG for what is opaque; PNG, which alone keeps it, for what is not
  Png,
};

enum class Status : std::uint32_t {
  Drawn,
  NoPicture,  ///< not of a kind that is drawn, or damaged
  TooLarge,   ///< more pixels than the request allows, or no form of it is small enough
};

/// Comes with two descriptors: the picture's file, open for reading, and an empty file for what is
/// drawn.
struct Request {
  std::uint32_t magic = kMagic;
  std::uint32_t side = 0;  ///< pixels that the result has at most on each side
  Form form = Form::Smallest;
  std::uint32_t processorSeconds = 0;
  std::uint64_t pixels = 0;  ///< that the picture may have
  std::uint64_t bytes = 0;   ///< that the result may have
};

struct Reply {
  std::uint32_t magic = kMagic;
  Status status = Status::NoPicture;
  Form form = Form::Smallest;  ///< Png: a PNG; Smallest: a JPEG
  std::uint32_t width = 0;
  std::uint32_t height = 0;
  std::uint32_t unused = 0;
  std::uint64_t bytes = 0;
};

}  // namespace yomber::drawing
