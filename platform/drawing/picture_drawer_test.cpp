#include "platform/drawing/picture_drawer.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <png.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <map>
#include <random>
#include <sstream>
#include <thread>

#include "platform/drawing/drawable_types.h"
#include "platform/foundation/fault_points.h"
#include "platform/foundation/sanitized.h"
#include "platform/foundation/temporary_directory.h"

namespace yomber {
namespace {

using drawing::Form;

std::string sample(const std::string& name) {
  std::ifstream file(YOMBER_PICTURES "/" + name, std::ios::binary);
  std::ostringstream text;
  text << file.rdbuf();
  EXPECT_FALSE(text.str().empty()) << name;
  return text.str();
}

FileDescriptor fileOf(const std::string& bytes) {
  FileDescriptor file(memfd_create("picture", MFD_CLOEXEC));
  EXPECT_EQ(write(file.get(), bytes.data(), bytes.size()), static_cast<ssize_t>(bytes.size()));
  return file;
}

std::string contentOf(const DrawnPicture& picture) {
  std::string bytes(picture.length, '\0');
  EXPECT_EQ(pread(picture.file.get(), bytes.data(), bytes.size(), 0),
            static_cast<ssize_t>(bytes.size()));
  return bytes;
}

void appendNumber(std::string& to, std::uint32_t number) {
  for (const int shift : {24, 16, 8, 0}) to += static_cast<char>(number >> shift & 0xff);
}

void appendChunk(std::string& png, const std::string& type, const std::string& data) {
  appendNumber(png, static_cast<std::uint32_t>(data.size()));
  png += type + data;
  std::uint32_t sum = 0xffffffff;
  for (const char each : type + data) {
    sum ^= static_cast<unsigned char>(each);
    for (int bit = 0; bit < 8; ++bit) sum = sum >> 1 ^ (0xedb88320U & (0U - (sum & 1U)));
  }
  appendNumber(png, ~sum);
}

/// Its header promises so many pixels; there are but a few kilobytes of them.
std::string promisingPNG(std::uint32_t side, bool isInterlaced) {
  std::string header;
  appendNumber(header, side);
  appendNumber(header, side);
  header += std::string("\x08\x02\x00\x00", 4) + (isInterlaced ? '\1' : '\0');
  std::string png = "\x89PNG\r\n\x1a\n";
  appendChunk(png, "IHDR", header);
  // One stored block of zeros.
  std::string data("\x78\x01\x01\xa0\x0f\x5f\xf0", 7);
  appendChunk(png, "IDAT", data + std::string(4000, '\0') + std::string("\0\0\0\1", 4));
  appendChunk(png, "IEND", "");
  return png;
}

void appendLittle(std::string& to, std::uint32_t number, int bytes) {
  for (int i = 0; i < bytes; ++i) to += static_cast<char>(number >> (8 * i) & 0xff);
}

/// A part of a RIFF file, padded to an even length.
std::string riffPart(const std::string& type, const std::string& data) {
  std::string part = type;
  appendLittle(part, static_cast<std::uint32_t>(data.size()), 4);
  part += data;
  if (data.size() % 2 != 0) part += '\0';
  return part;
}

constexpr std::uint32_t kWidth = 48;
constexpr std::uint32_t kHeight = 32;

/// A frame of one colour: every code has one symbol, so no pixel takes a bit.
std::string magentaFrame() {
  std::string data = "\x2f";
  appendLittle(data, (kWidth - 1) | (kHeight - 1) << 14, 4);
  const std::string zero = "1000";         // a simple code of one symbol, of one bit: 0
  const std::string full = "10111111111";  // the same of eight bits: 255
  const std::string bits = "000" + zero + full + full + full + zero + "0000";
  for (std::size_t i = 0; i < bits.size(); i += 8) {
    unsigned byte = 0;
    for (std::size_t bit = 0; bit < 8; ++bit) byte |= (bits[i + bit] == '1' ? 1U : 0U) << bit;
    data += static_cast<char>(byte);
  }
  return riffPart("VP8L", data);
}

std::string animationFrame(const std::string& picture) {
  std::string data;
  for (const std::uint32_t number : {0U, 0U, kWidth - 1, kHeight - 1, 100U})
    appendLittle(data, number, 3);
  return riffPart("ANMF", data + '\0' + picture);
}

/// The quarters, then magenta.
std::string animatedWebP() {
  const std::string still = sample("quarters.webp");
  const std::size_t begin = still.find("VP8L");
  std::uint32_t length = 0;
  for (std::size_t i = 4; i > 0; --i)
    length = length << 8 | static_cast<unsigned char>(still.at(begin + 3 + i));
  std::string header("\x02\0\0\0", 4);
  appendLittle(header, kWidth - 1, 3);
  appendLittle(header, kHeight - 1, 3);
  return riffPart("RIFF", "WEBP" + riffPart("VP8X", header) +
                              riffPart("ANIM", std::string(6, '\0')) +
                              animationFrame(riffPart("VP8L", still.substr(begin + 8, length))) +
                              animationFrame(magentaFrame()));
}

/// The quarters' second page is empty; here it is magenta.
std::string twoPagesPDF() {
  std::string pdf = sample("quarters.pdf");
  const std::size_t begin = pdf.find(">>", pdf.find("5 0 obj") + 10);
  pdf.insert(begin, "/Contents 6 0 R ");
  const std::string drawing = "1 0 1 rg 0 0 48 32 re f";
  pdf.insert(pdf.find("trailer"), "6 0 obj\n<< /Length " + std::to_string(drawing.size()) +
                                      " >>\nstream\n" + drawing + "\nendstream\nendobj\n");
  return pdf;
}

using Colour = std::array<int, 4>;

/// The pixels of a PNG.
struct Pixels {
  explicit Pixels(const std::string& bytes) {
    png_image image{};
    image.version = PNG_IMAGE_VERSION;
    EXPECT_NE(png_image_begin_read_from_memory(&image, bytes.data(), bytes.size()), 0);
    image.format = PNG_FORMAT_RGBA;
    data.resize(PNG_IMAGE_SIZE(image));
    EXPECT_NE(png_image_finish_read(&image, nullptr, data.data(), 0, nullptr), 0);
    width = image.width;
    height = image.height;
  }

  /// At these parts of the whole.
  [[nodiscard]] Colour at(double x, double y) const {
    const auto column = static_cast<std::size_t>(x * static_cast<double>(width));
    const auto row = static_cast<std::size_t>(y * static_cast<double>(height));
    Colour colour{};
    for (std::size_t i = 0; i < 4; ++i) colour[i] = data[(row * width + column) * 4 + i];
    return colour;
  }

  std::vector<unsigned char> data;
  std::size_t width = 0;
  std::size_t height = 0;
};

int difference(const Colour& one, const Colour& other) {
  int result = 0;
  for (std::size_t i = 0; i < 4; ++i) result = std::max(result, std::abs(one[i] - other[i]));
  return result;
}

constexpr Colour kRed{255, 0, 0, 255};
constexpr Colour kGreen{0, 255, 0, 255};
constexpr Colour kBlue{0, 0, 255, 255};
constexpr Colour kWhite{255, 255, 255, 255};

class PictureDrawerTest : public testing::Test {
 protected:
  void TearDown() override { FaultPoint::disarmAll(); }

  std::optional<DrawnPicture> draw(const std::string& bytes, std::uint32_t side = 1024,
                                   Form form = Form::Smallest) {
    error_ = nullptr;
    return drawer_.draw(fileOf(bytes).get(), side, form, &error_);
  }

  /// Red, green; blue, white.
  void expectQuarters(const std::string& name, int tolerance) {
    expectQuarters(name, sample(name), tolerance);
  }
  void expectQuarters(const std::string& name, const std::string& bytes, int tolerance) {
    const auto picture = draw(bytes, 1024, Form::Png);
    ASSERT_TRUE(picture) << name << error_->description();
    ASSERT_TRUE(picture->isPNG);
    const Pixels pixels(contentOf(*picture));
    EXPECT_EQ(pixels.width, picture->width);
    EXPECT_EQ(pixels.height, picture->height);
    EXPECT_LE(difference(pixels.at(0.2, 0.2), kRed), tolerance) << name;
    EXPECT_LE(difference(pixels.at(0.8, 0.2), kGreen), tolerance) << name;
    EXPECT_LE(difference(pixels.at(0.2, 0.8), kBlue), tolerance) << name;
    EXPECT_LE(difference(pixels.at(0.8, 0.8), kWhite), tolerance) << name;
  }

  void expectDrawsStill() {
    EXPECT_TRUE(draw(sample("quarters.png"))) << (error_ ? error_->description() : "");
  }

  static PictureDrawer::Options options() {
    PictureDrawer::Options options;
    options.patience = std::chrono::seconds(60);  // under sanitizers, on a busy machine
    return options;
  }

  PictureDrawer drawer_{options()};
  NSErrorRef error_;
};

TEST_F(PictureDrawerTest, EveryKindIsDrawnInItsColours) {
  expectQuarters("quarters.png", 2);
  expectQuarters("quarters.jpg", 8);
  expectQuarters("quarters.webp", 2);
  expectQuarters("quarters.heic", 12);
  expectQuarters("quarters.avif", 12);
  expectQuarters("quarters.svg", 2);
  expectQuarters("quarters.pdf", 2);
}

TEST_F(PictureDrawerTest, TheLibraryThatDrawsIsKnownByItsVersion) {
  EXPECT_NE(PictureDrawer::libraries().find("libvips.so."), std::string::npos)
      << PictureDrawer::libraries();
}

TEST_F(PictureDrawerTest, ACameraHeldUprightDrawsUpright) { expectQuarters("turned.jpg", 8); }

TEST_F(PictureDrawerTest, OfSeveralPagesTheFirstIsDrawn) {
  expectQuarters("two-pages.gif", 8);
  expectQuarters("two-pages.tif", 2);
  expectQuarters("a WebP of two frames", animatedWebP(), 2);
  expectQuarters("a PDF of two pages", twoPagesPDF(), 2);
  const auto picture = draw(sample("two-pages.tif"));
  ASSERT_TRUE(picture);
  EXPECT_EQ(picture->height, 32U);
  const auto frame = draw(animatedWebP());
  ASSERT_TRUE(frame);
  EXPECT_EQ(frame->height, 32U);
}

TEST_F(PictureDrawerTest, ColoursOfAWiderGamutAreBroughtToSRGB) {
  expectQuarters("wide-gamut.png", 6);
  expectQuarters("wide-gamut.jpg", 10);
}

TEST_F(PictureDrawerTest, APrintersPictureIsDrawnOnAScreen) {
  const auto picture = draw(sample("press.jpg"), 64, Form::Png);
  ASSERT_TRUE(picture) << error_->description();
  const Colour red = Pixels(contentOf(*picture)).at(0.2, 0.2);
  EXPECT_GT(red[0], red[1] + 100);
  EXPECT_GT(red[0], red[2] + 100);
}

TEST_F(PictureDrawerTest, WhatIsOpaqueBecomesAJPEGAndWhatIsNotAPNG) {
  const auto opaque = draw(sample("quarters.png"));
  ASSERT_TRUE(opaque);
  EXPECT_FALSE(opaque->isPNG);
  EXPECT_TRUE(contentOf(*opaque).starts_with("\xff\xd8\xff"));
  const auto page = draw(sample("quarters.pdf"));
  ASSERT_TRUE(page);
  EXPECT_FALSE(page->isPNG) << "a page is white where nothing is";
  const auto translucent = draw(sample("translucent.png"));
  ASSERT_TRUE(translucent);
  ASSERT_TRUE(translucent->isPNG);
  EXPECT_LE(difference(Pixels(contentOf(*translucent)).at(0.2, 0.2), {255, 0, 0, 128}), 3);
}

TEST_F(PictureDrawerTest, PixelsAreNeverEnlargedAndLinesAreDrawnToFit) {
  const auto picture = draw(sample("quarters.jpg"));
  ASSERT_TRUE(picture);
  EXPECT_EQ(picture->width, 48U);
  EXPECT_EQ(picture->height, 32U);
  const auto smaller = draw(sample("quarters.jpg"), 24);
  ASSERT_TRUE(smaller);
  EXPECT_EQ(smaller->width, 24U);
  EXPECT_EQ(smaller->height, 16U);
  for (const char* name : {"quarters.svg", "quarters.pdf"}) {
    const auto drawing = draw(sample(name));
    ASSERT_TRUE(drawing);
    EXPECT_EQ(drawing->width, 1024U) << name;
    EXPECT_NEAR(drawing->height, 683, 1) << name;
  }
}

TEST_F(PictureDrawerTest, NothingOfTheOriginalIsKeptButItsPixels) {
  const auto picture = draw(sample("turned.jpg"));
  ASSERT_TRUE(picture);
  EXPECT_EQ(contentOf(*picture).find("Exif"), std::string::npos);
}

TEST_F(PictureDrawerTest, TheResultCannotBeChangedAnyMore) {
  const auto picture = draw(sample("quarters.png"));
  ASSERT_TRUE(picture);
  EXPECT_EQ(pwrite(picture->file.get(), "x", 1, 0), -1);
  EXPECT_EQ(ftruncate(picture->file.get(), 0), -1);
}

TEST_F(PictureDrawerTest, WhatIsNoPictureIsRefused) {
  for (const std::string& bytes :
       {std::string(), std::string("text"), std::string(5000, '\0'),
        sample("quarters.jpg").substr(0, 200), std::string("P6 1 1 255\nabc")}) {
    EXPECT_FALSE(draw(bytes));
    ASSERT_TRUE(error_);
    EXPECT_TRUE(error_->is(NSCocoaErrorDomain, NSFileReadCorruptFileError))
        << error_->description();
  }
  expectDrawsStill();
}

TEST_F(PictureDrawerTest, AFewKilobytesThatPromiseTenBillionPixelsAreRefused) {
  for (const bool isInterlaced : {false, true}) {
    EXPECT_FALSE(draw(promisingPNG(100'000, isInterlaced)));
    ASSERT_TRUE(error_);
    EXPECT_TRUE(error_->is(NSPOSIXErrorDomain, EFBIG)) << error_->description();
    // Within the limit, but without its pixels: drawn empty, or not at all.
    if (const auto picture = draw(promisingPNG(12'000, isInterlaced))) {
      EXPECT_LE(picture->width, 1024U);
    }
  }
  expectDrawsStill();
}

TEST_F(PictureDrawerTest, ADrawingReachesNothingOutside) {
  const TemporaryDirectory directory;
  const std::string secret = directory / "secret.png";
  std::ofstream(secret) << sample("quarters.png");
  const std::string pipe = directory / "pipe";
  ASSERT_EQ(mkfifo(pipe.c_str(), 0600), 0);
  const auto picture =
      draw("<?xml version=\"1.0\"?><!DOCTYPE svg [<!ENTITY f SYSTEM \"file://" + pipe +
               "\">]><svg xmlns=\"http://www.w3.org/2000/svg\" "
               "xmlns:xlink=\"http://www.w3.org/1999/xlink\" width=\"100\" height=\"100\">"
               "<image width=\"100\" height=\"100\" xlink:href=\"file://" +
               secret + "\"/><image width=\"9\" height=\"9\" xlink:href=\"" + secret +
               "\"/><image width=\"9\" height=\"9\" xlink:href=\"http://127.0.0.1:9/a.png\"/>"
               "<text>&f;</text></svg>",
           100, Form::Png);
  if (picture) {  // nothing is drawn of what was not reached
    EXPECT_LE(difference(Pixels(contentOf(*picture)).at(0.2, 0.2), {0, 0, 0, 0}), 0);
  } else {
    EXPECT_TRUE(error_->is(NSCocoaErrorDomain, NSFileReadCorruptFileError));
  }
  expectDrawsStill();
}

TEST_F(PictureDrawerTest, ABombOfEntitiesDoesNotGoOff) {
  std::string bomb = "<?xml version=\"1.0\"?><!DOCTYPE svg [<!ENTITY a0 \"aaaaaaaaaa\">";
  for (int i = 1; i <= 12; ++i) {
    bomb += "<!ENTITY a" + std::to_string(i) + " \"";
    for (int j = 0; j < 10; ++j) bomb += "&a" + std::to_string(i - 1) + ";";
    bomb += "\">";
  }
  bomb +=
      "]><svg xmlns=\"http://www.w3.org/2000/svg\" width=\"9\" height=\"9\">"
      "<text>&a12;</text></svg>";
  PictureDrawer drawer;  // with the patience that a drive has
  const auto picture = drawer.draw(fileOf(bomb).get(), 1024, Form::Smallest, &error_);
  if (picture) {
    EXPECT_EQ(picture->width, 1024U) << "drawn without the text";
  } else {
    EXPECT_TRUE(error_->is(NSCocoaErrorDomain, NSFileReadCorruptFileError))
        << error_->description();
  }
  EXPECT_TRUE(drawer.draw(fileOf(sample("quarters.png")).get(), 64, Form::Png));
}

TEST_F(PictureDrawerTest, WhoTakesTooLongIsKilledAndTheNextIsDrawn) {
  PictureDrawer::Options hasty;
  hasty.patience = std::chrono::milliseconds(0);
  PictureDrawer drawer(hasty);
  EXPECT_FALSE(drawer.draw(fileOf(sample("quarters.png")).get(), 64, Form::Png, &error_));
  ASSERT_TRUE(error_);
  EXPECT_TRUE(error_->is(NSPOSIXErrorDomain, ETIME)) << error_->description();
  expectDrawsStill();
}

TEST_F(PictureDrawerTest, AProcessThatDiesInTheMiddleCostsOnePicture) {
  expectDrawsStill();
  ASSERT_FALSE(FaultPoint::arm("drawing.sent=error"));
  EXPECT_FALSE(draw(sample("quarters.png")));
  ASSERT_TRUE(error_);
  EXPECT_TRUE(error_->is(NSPOSIXErrorDomain, EIO)) << error_->description();
  FaultPoint::disarmAll();
  expectDrawsStill();
}

TEST_F(PictureDrawerTest, AProcessIsReplacedAfterItsShare) {
  PictureDrawer::Options often = options();
  often.picturesOfAProcess = 2;
  PictureDrawer drawer(often);
  for (int i = 0; i < 5; ++i)
    EXPECT_TRUE(drawer.draw(fileOf(sample("quarters.png")).get(), 64, Form::Png));
}

TEST_F(PictureDrawerTest, SeveralDrawAtOnce) {
  std::vector<std::thread> threads;
  std::atomic<int> drawn{0};
  for (int i = 0; i < 4; ++i) {
    threads.emplace_back([&] {
      for (int j = 0; j < 5; ++j)
        if (drawer_.draw(fileOf(sample("quarters.jpg")).get(), 64, Form::Png)) ++drawn;
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(drawn, 20);
}

TEST_F(PictureDrawerTest, WithoutTheProgramTheErrorNamesIt) {
  PictureDrawer::Options nowhere;
  nowhere.program = "/nowhere/yomber-thumbnailer";
  PictureDrawer drawer(nowhere);
  EXPECT_FALSE(drawer.draw(fileOf(sample("quarters.png")).get(), 64, Form::Png, &error_));
  ASSERT_TRUE(error_);
  EXPECT_NE(error_->description().find("/nowhere/yomber-thumbnailer"), std::string::npos);
}

TEST_F(PictureDrawerTest, MutationsOfEveryKindHarmNothing) {
  const char* const set = std::getenv("YOMBER_MUTATIONS");
  int count = set != nullptr ? std::atoi(set) : 1000;  // of each
  if (set == nullptr && kIsSanitized) {
    count = 40;
    std::puts("40 of each kind only: drawing is slow under a sanitizer");
  }
  const char* const seedSet = std::getenv("YOMBER_SEED");
  std::mt19937 random(seedSet != nullptr ? static_cast<unsigned>(std::atoi(seedSet)) : 7U);
  int drawn = 0;
  int refused = 0;
  int died = 0;
  std::map<std::string, std::string> originals{{"two-frames.webp", animatedWebP()},
                                               {"two-pages.pdf", twoPagesPDF()}};
  for (const char* name : {"quarters.png", "quarters.jpg", "quarters.webp", "quarters.heic",
                           "quarters.avif", "quarters.svg", "quarters.pdf", "two-pages.gif",
                           "two-pages.tif", "translucent.png", "wide-gamut.jpg"})
    originals[name] = sample(name);
  for (const auto& [name, original] : originals) {
    for (int i = 0; i < count; ++i) {
      std::string bytes = original;
      for (unsigned changes = 1 + random() % 8; changes > 0; --changes)
        bytes[random() % bytes.size()] = static_cast<char>(random());
      if (random() % 4 == 0) bytes.resize(random() % bytes.size());
      if (draw(bytes)) {
        ++drawn;
        continue;
      }
      const bool isRefused = error_->is(NSCocoaErrorDomain, NSFileReadCorruptFileError) ||
                             error_->is(NSPOSIXErrorDomain, EFBIG);
      ++(isRefused ? refused : died);
      EXPECT_FALSE(error_->is(NSPOSIXErrorDomain, ETIME)) << name << " " << i;
      EXPECT_TRUE(isRefused || error_->is(NSPOSIXErrorDomain, EIO)) << error_->description();
    }
  }
  std::printf("%d drawn, %d refused, %d cost their process\n", drawn, refused, died);
  expectDrawsStill();
}

TEST(DrawableTypesTest, PicturesAreDrawnAndOtherFilesAreNotOpened) {
  EXPECT_TRUE(isDrawableType("image/jpeg"));
  EXPECT_TRUE(isDrawableType("application/pdf"));
  EXPECT_TRUE(isDrawableType("image/svg+xml"));
  EXPECT_FALSE(isDrawableType("text/plain"));
  EXPECT_FALSE(isDrawableType("application/octet-stream"));
  EXPECT_FALSE(isDrawableType(""));
}

TEST(DrawableTypesTest, EveryKindOfPictureIsKnownByItsStart) {
  const std::vector<std::string> samples = {"quarters.avif", "quarters.heic", "quarters.jpg",
                                            "quarters.pdf",  "quarters.png",  "quarters.svg",
                                            "quarters.webp", "two-pages.gif", "two-pages.tif"};
  for (const std::string& name : samples)
    EXPECT_TRUE(isDrawableStart(sample(name).substr(0, kDrawableStart))) << name;
  EXPECT_FALSE(isDrawableStart(sample("green.mp4")));
  EXPECT_FALSE(isDrawableStart("RIFF\x24\x08\x01\x02WAVEfmt "));
  EXPECT_FALSE(isDrawableStart("<?xml version=\"1.0\"?><feed/>"));
  EXPECT_FALSE(isDrawableStart("\xff\xd8"));
  EXPECT_FALSE(isDrawableStart(""));
}

}  // namespace
}  // namespace yomber
