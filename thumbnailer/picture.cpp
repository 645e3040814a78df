#include "thumbnailer/picture.h"

#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <memory>
#include <string>
#include <vips/vips8>

#include "thumbnailer/samples.h"

namespace yomber::thumbnailer {
namespace {

using drawing::Form;
using drawing::Reply;
using drawing::Request;
using drawing::Status;
using vips::VImage;
using vips::VOption;
using vips::VSource;

constexpr int kQuality = 85;  // of JPEG: no difference to be seen at this size
constexpr int kCompression = 6;
constexpr double kOpaque = 255;
/// One decodes, which nothing can do in parts, while another shrinks what there is.
constexpr int kThreads = 2;

/// What libvips may read; everything else that it knows is blocked.
constexpr const char* kLoaders[] = {
    "VipsForeignLoadJpeg", "VipsForeignLoadPng",  "VipsForeignLoadNsgif", "VipsForeignLoadWebp",
    "VipsForeignLoadTiff", "VipsForeignLoadHeif", "VipsForeignLoadPdf",   "VipsForeignLoadSvg"};

struct Bytes {
  void* data = nullptr;
  std::size_t length = 0;
  Bytes() = default;
  Bytes(const Bytes&) = delete;
  Bytes& operator=(const Bytes&) = delete;
  ~Bytes() { g_free(data); }
};

/// The name of what reads it, or nothing.
std::string loaderOf(const VSource& source) {
  const char* const name = vips_foreign_find_load_source(source.get_source());
  vips_error_clear();
  return name != nullptr ? name : "";
}

/// Lines, not pixels: drawn in any size without a loss.
bool isDrawing(const std::string& loader) {
  return loader.starts_with("VipsForeignLoadSvg") || loader.starts_with("VipsForeignLoadPdf");
}

bool hasTooManyPixels(const VSource& source, std::uint64_t limit) {
  const VImage header =
      VImage::new_from_source(source, "", VImage::option()->set("access", VIPS_ACCESS_SEQUENTIAL));
  const auto width = static_cast<std::uint64_t>(header.width());
  const auto height = static_cast<std::uint64_t>(header.height());
  return width > limit / std::max<std::uint64_t>(height, 1);
}

/// What has a profile is converted; what has none is taken for sRGB.
VImage inSRGB(const VImage& image) {
  if (image.interpretation() == VIPS_INTERPRETATION_B_W) return image;
  if (image.get_typeof(VIPS_META_ICC_NAME) == 0) return image.colourspace(VIPS_INTERPRETATION_sRGB);
  try {
    return image
        .icc_transform("srgb",
                       VImage::option()->set("embedded", true)->set("intent", VIPS_INTENT_RELATIVE))
        .copy_memory();
  } catch (const vips::VError&) {
    return image.colourspace(VIPS_INTERPRETATION_sRGB);  // damaged, or of something else
  }
}

/// Upright, in sRGB, 8 bits; in memory.
VImage smallPicture(const VSource& source, bool isScalable, int side) {
  VImage image =
      VImage::thumbnail_source(source, side,
                               VImage::option()
                                   ->set("height", side)
                                   ->set("size", isScalable ? VIPS_SIZE_BOTH : VIPS_SIZE_DOWN)
                                   ->set("fail_on", VIPS_FAIL_ON_ERROR));
  // At once, so that the colours of a small picture are converted, and what is read is read once.
  image = inSRGB(image.copy_memory());
  if (image.format() != VIPS_FORMAT_UCHAR) image = image.cast(VIPS_FORMAT_UCHAR);
  return image.copy_memory();
}

/// Without an alpha channel that says nothing.
VImage withoutOpaqueAlpha(const VImage& image) {
  if (!image.has_alpha()) return image;
  const int alpha = image.bands() - 1;
  if (image.extract_band(alpha).min() < kOpaque) return image;
  return image.extract_band(0, VImage::option()->set("n", alpha)).copy_memory();
}

/// Nothing of the original's but its pixels: no place, no camera, no name.
void encode(const VImage& image, Form form, Bytes& bytes) {
  if (form == Form::Png) {
    image.write_to_buffer(".png", &bytes.data, &bytes.length,
                          VImage::option()->set("strip", true)->set("compression", kCompression));
  } else {
    image.write_to_buffer(".jpg", &bytes.data, &bytes.length,
                          VImage::option()->set("strip", true)->set("Q", kQuality));
  }
}

bool writeAll(int output, const Bytes& bytes) {
  std::size_t done = 0;
  while (done < bytes.length) {
    const ssize_t count = pwrite(output, static_cast<const char*>(bytes.data) + done,
                                 bytes.length - done, static_cast<off_t>(done));
    if (count < 0 && errno == EINTR) continue;
    if (count <= 0) return false;
    done += static_cast<std::size_t>(count);
  }
  return true;
}

Reply drawFrom(const VSource& source, const Request& request, int output) {
  Reply reply;
  const std::string loader = loaderOf(source);
  if (loader.empty()) return reply;
  if (!isDrawing(loader) && hasTooManyPixels(source, request.pixels)) {
    reply.status = Status::TooLarge;
    return reply;
  }
  VImage image =
      withoutOpaqueAlpha(smallPicture(source, isDrawing(loader), static_cast<int>(request.side)));
  reply.form = image.has_alpha() ? Form::Png : request.form;
  reply.status = Status::TooLarge;
  // What is noise at full size is small enough at half of it, or at a quarter.
  for (; image.width() > 0 && image.height() > 0; image = image.resize(0.5).copy_memory()) {
    Bytes bytes;
    encode(image, reply.form, bytes);
    if (bytes.length > request.bytes) {
      if (std::min(image.width(), image.height()) < 2) return reply;
      continue;
    }
    reply.status = writeAll(output, bytes) ? Status::Drawn : Status::NoPicture;
    reply.width = static_cast<std::uint32_t>(image.width());
    reply.height = static_cast<std::uint32_t>(image.height());
    reply.bytes = bytes.length;
    return reply;
  }
  return reply;
}

void drawSample(const void* bytes, std::size_t length) {
  VipsBlob* const blob = vips_blob_new(nullptr, bytes, length);
  try {
    const VSource source = VSource::new_from_blob(blob);
    const std::string loader = loaderOf(source);
    if (!loader.empty()) (void)smallPicture(source, isDrawing(loader), 64);
  } catch (const vips::VError&) {
    vips_error_clear();  // a kind that this machine cannot draw
  }
  vips_area_unref(VIPS_AREA(blob));
}

/// What libvips writes itself is a sample, too.
void drawWritten(const VImage& image, const char* suffix) {
  try {
    Bytes bytes;
    image.write_to_buffer(suffix, &bytes.data, &bytes.length);
    if (bytes.length > 0) drawSample(bytes.data, bytes.length);
  } catch (const vips::VError&) {
    vips_error_clear();
  }
}

}  // namespace

bool prepare() {
  if (vips_init("yomber-thumbnailer") != 0) return false;
  vips_concurrency_set(std::min(vips_concurrency_get(), kThreads));
  vips_cache_set_max(0);
  vips_operation_block_set("VipsForeignLoad", TRUE);
  for (const char* loader : kLoaders) vips_operation_block_set(loader, FALSE);
  return true;
}

void warmUp() {
  const VImage colours =
      VImage::black(96, 96, VImage::option()->set("bands", 3))
          .copy(VImage::option()->set("interpretation", VIPS_INTERPRETATION_sRGB));
  for (const char* suffix : {".jpg", ".png", ".gif", ".webp", ".tif", ".heic", ".avif"})
    drawWritten(colours, suffix);
  drawSample(kDrawingSample.data(), kDrawingSample.size());
  drawSample(kDocumentSample.data(), kDocumentSample.size());
}

Reply draw(const Request& request, int input, int output) {
  Reply reply;
  try {
    reply = drawFrom(VSource::new_from_descriptor(input), request, output);
  } catch (const vips::VError&) {
    reply = Reply();
  } catch (const std::exception&) {
    reply = Reply();
  }
  vips_error_clear();
  return reply;
}

}  // namespace yomber::thumbnailer
