#include "platform/drawing/drawable_types.h"

#include <algorithm>
#include <array>

namespace yomber {

bool isDrawableType(std::string_view type) {
  static constexpr std::array<std::string_view, 14> kTypes = {"application/pdf",
                                                              "image/avif",
                                                              "image/gif",
                                                              "image/heic",
                                                              "image/heif",
                                                              "image/jpeg",
                                                              "image/jpg",
                                                              "image/pjpeg",
                                                              "image/png",
                                                              "image/svg+xml",
                                                              "image/svg+xml-compressed",
                                                              "image/tiff",
                                                              "image/webp",
                                                              "image/x-png"};
  return std::ranges::find(kTypes, type) != kTypes.end();
}

bool isDrawableStart(std::string_view start) {
  using namespace std::string_view_literals;
  static constexpr std::array kSignatures = {
      "\xff\xd8\xff"sv, "\x89PNG\r\n\x1a\n"sv, "GIF8"sv, "II*\0"sv, "MM\0*"sv, "%PDF-"sv};
  static constexpr std::array kBrands = {"avif"sv, "heic"sv, "heix"sv, "mif1"sv};
  const auto begins = [&](std::string_view signature) { return start.starts_with(signature); };
  if (std::ranges::any_of(kSignatures, begins)) return true;
  // Boxes and chunks tell their kind behind a length.
  if (start.size() >= 12 && start.substr(4, 4) == "ftyp")
    return std::ranges::find(kBrands, start.substr(8, 4)) != kBrands.end();
  if (start.starts_with("RIFF")) return start.substr(0, 12).ends_with("WEBP");
  const bool isMarkup = start.starts_with("<?xml") || start.starts_with("<!DOCTYPE svg");
  return start.starts_with("<svg") || (isMarkup && start.find("<svg") != std::string_view::npos);
}

}  // namespace yomber
